#include "integration/QRVRunAs.h"

#include <grp.h>
#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>

#include "base/QRVPlist.h"
#include "client/QRVClient.h"
#include "integration/QRVDaemonProcess.h"

std::optional<std::string> QRVRunAs(uid_t uid, gid_t gid, const std::function<std::string()>& body,
                                    int timeoutSeconds) {
  int fds[2];
  if (pipe(fds) != 0) return std::nullopt;
  pid_t pid = fork();
  if (pid < 0) return std::nullopt;
  if (pid == 0) {
    close(fds[0]);
    if (setgroups(0, nullptr) != 0 || setgid(gid) != 0 || setuid(uid) != 0) _exit(120);
    std::string out = body();
    for (size_t done = 0; done < out.size();) {
      ssize_t n = write(fds[1], out.data() + done, out.size() - done);
      if (n <= 0) _exit(121);
      done += static_cast<size_t>(n);
    }
    // _exit: the child must not run the parent's test teardown.
    _exit(0);
  }
  close(fds[1]);
  std::string out;
  auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(timeoutSeconds);
  for (;;) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    pollfd p{fds[0], POLLIN, 0};
    if (left.count() <= 0 || poll(&p, 1, static_cast<int>(left.count())) <= 0) {
      kill(pid, SIGKILL);
      break;
    }
    char buf[4096];
    ssize_t n = read(fds[0], buf, sizeof buf);
    if (n <= 0) break;
    out.append(buf, static_cast<size_t>(n));
  }
  close(fds[0]);
  int status = 0;
  waitpid(pid, &status, 0);
  if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) return std::nullopt;
  return out;
}

std::vector<QRVPlist> QRVRepliesAs(const QRVDaemonProcess& daemon, uid_t uid, const std::vector<QRVPlist>& requests) {
  // The child hands its replies back as one binary property list.
  std::optional<std::string> out = QRVRunAs(uid, uid, [&] {
    QRVPlist::Array replies;
    QRVClientError error;
    std::optional<QRVClient> client = QRVClient::connect(daemon.root(), &error);
    for (const QRVPlist& request : requests) {
      std::optional<QRVPlist> reply =
          client ? client->sendRequest(request, std::chrono::seconds(10), &error) : std::nullopt;
      replies.push_back(reply.value_or(QRVPlist::dictionary()));
    }
    QRVPlist::Bytes bytes = QRVPlist::array(std::move(replies)).toBinary();
    return std::string(bytes.begin(), bytes.end());
  });
  std::optional<QRVPlist> parsed =
      out ? QRVPlist::fromBinary(reinterpret_cast<const uint8_t*>(out->data()), out->size()) : std::nullopt;
  std::vector<QRVPlist> replies = parsed && parsed->isArray() ? parsed->arrayValue() : QRVPlist::Array();
  replies.resize(requests.size(), QRVPlist::dictionary());
  return replies;
}
