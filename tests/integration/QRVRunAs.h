// Runs a piece of a test in a child process under another uid and gid, so the
// daemon sees a different peer; the child's answer comes back as text.
#pragma once

#include <sys/types.h>

#include <functional>
#include <optional>
#include <string>

// Forks, switches the child to `uid`/`gid` (groups cleared), runs `body` and
// hands its returned text back. Returns nothing when the child died or did
// not finish within `timeoutSeconds`.
std::optional<std::string> QRVRunAs(uid_t uid, gid_t gid, const std::function<std::string()>& body,
                                    int timeoutSeconds = 60);
