#include "platform/linux/QRVProcInfo.h"

#include <poll.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <sstream>
#include <string>

namespace QRVProcInfo {

namespace {

std::string readFile(const std::string& path) {
  std::ifstream in(path);
  std::stringstream ss;
  ss << in.rdbuf();
  return ss.str();
}

std::string procPath(pid_t pid, const char* leaf) { return "/proc/" + std::to_string(pid) + "/" + leaf; }

}  // namespace

std::optional<uint64_t> startTime(pid_t pid) {
  std::string stat = readFile(procPath(pid, "stat"));
  // The command name (field 2) may hold spaces and parentheses; fields after
  // it start behind the last ')'.
  size_t close = stat.rfind(')');
  if (close == std::string::npos) return std::nullopt;
  std::istringstream fields(stat.substr(close + 1));
  std::string field;
  // Fields 3..21 precede the start time.
  for (int i = 3; i <= 21; i++)
    if (!(fields >> field)) return std::nullopt;
  uint64_t start = 0;
  if (!(fields >> start)) return std::nullopt;
  return start;
}

QRVAuditToken auditTokenForPeer(const ucred& cred, int pidfd) {
  std::optional<uint64_t> start = startTime(cred.pid);
  if (pidfd >= 0) {
    pollfd p{pidfd, POLLIN, 0};
    if (poll(&p, 1, 0) == 1) start.reset();
  }
  return QRVAuditToken::make(cred.uid, cred.gid, cred.pid, start.value_or(0));
}

std::optional<FileId> executable(pid_t pid) {
  struct stat st;
  if (stat(procPath(pid, "exe").c_str(), &st) != 0) return std::nullopt;
  return FileId{st.st_dev, st.st_ino};
}

std::optional<std::string> executablePath(pid_t pid) {
  std::string link = procPath(pid, "exe");
  std::string target(4096, '\0');
  ssize_t length = readlink(link.c_str(), target.data(), target.size());
  if (length <= 0 || static_cast<size_t>(length) >= target.size()) return std::nullopt;
  target.resize(static_cast<size_t>(length));
  if (target.front() != '/') return std::nullopt;
  // The link names the file as it was reached at exec time; a file removed
  // or renamed over since then must not be taken for what now lies there.
  struct stat named;
  std::optional<FileId> running = executable(pid);
  if (!running || lstat(target.c_str(), &named) != 0 || !S_ISREG(named.st_mode)) return std::nullopt;
  if (!(FileId{named.st_dev, named.st_ino} == *running)) return std::nullopt;
  return target;
}

bool isSandboxed(pid_t pid) { return statusShowsConfinement(readFile(procPath(pid, "status"))); }

bool statusShowsConfinement(std::string_view status) {
  // "NoNewPrivs:\t1" and "Seccomp:\t2" (a filter), each at a line's start.
  auto fieldIs = [&](std::string_view name, char value) {
    for (size_t at = status.find(name); at != std::string_view::npos; at = status.find(name, at + 1)) {
      if (at != 0 && status[at - 1] != '\n') continue;
      size_t v = status.find_first_not_of(" \t", at + name.size());
      return v != std::string_view::npos && status[v] == value &&
             (v + 1 == status.size() || status[v + 1] == '\n');
    }
    return false;
  };
  return fieldIs("NoNewPrivs:", '1') && fieldIs("Seccomp:", '2');
}

std::optional<uint32_t> personaFromCgroup(pid_t pid) {
  static const std::string kPrefix = "persona-", kSuffix = ".slice";
  std::istringstream cgroups(readFile(procPath(pid, "cgroup")));
  for (std::string line; std::getline(cgroups, line);) {
    size_t at = line.find(kPrefix);
    while (at != std::string::npos) {
      size_t end = line.find(kSuffix, at);
      if (end == std::string::npos) break;
      std::string digits = line.substr(at + kPrefix.size(), end - at - kPrefix.size());
      if (!digits.empty() && digits.size() <= 10 &&
          digits.find_first_not_of("0123456789") == std::string::npos) {
        uint64_t id = std::stoull(digits);
        if (id <= UINT32_MAX) return static_cast<uint32_t>(id);
      }
      at = line.find(kPrefix, end);
    }
  }
  return std::nullopt;
}

}  // namespace QRVProcInfo
