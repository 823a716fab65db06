// Runs a piece of a test in a child process under another uid and gid, so the
// daemon sees a different peer; the child's answer comes back as text.
#pragma once

#include <sys/types.h>

#include <functional>
#include <optional>
#include <string>
#include <vector>

// Forks, switches the child to `uid`/`gid` (groups cleared), runs `body` and
// hands its returned text back. Returns nothing when the child died or did
// not finish within `timeoutSeconds`.
std::optional<std::string> QRVRunAs(uid_t uid, gid_t gid, const std::function<std::string()>& body,
                                    int timeoutSeconds = 60);

class QRVDaemonProcess;
class QRVPlist;

// Sends `requests` in order over one connection from a process of `uid` and
// returns one reply dictionary per request; a request that got no reply
// (the daemon died, the connection failed) gets an empty dictionary, whose
// result code reads as 0.
std::vector<QRVPlist> QRVRepliesAs(const QRVDaemonProcess& daemon, uid_t uid, const std::vector<QRVPlist>& requests);
