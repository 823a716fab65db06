// The steps every listening Unix socket of the daemon takes.
#pragma once

#include <sys/un.h>

#include <string>

#include "base/QRVError.h"

namespace QRVUnixSocket {

// Makes `path` ready to bind: the address in `address`, the parent
// directory created, and a socket an earlier run left there removed (bind
// would fail on it). ENAMETOOLONG when the path does not fit an address.
bool prepareToBind(const std::string& path, sockaddr_un* address, QRVError* error);

// The next pending connection of the non-blocking `listenFd` (non-blocking
// and close-on-exec itself), or -1 when none is left. Failures other than an
// empty backlog are logged naming `service`; when descriptors run out it
// pauses a moment, so that the clients holding them can let go.
int next(int listenFd, const char* service);

}  // namespace QRVUnixSocket
