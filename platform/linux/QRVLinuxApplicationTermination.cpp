#include "platform/linux/QRVLinuxApplicationTermination.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "base/QRVLog.h"

namespace {

int writeControl(const std::string& path, const char* value) {
  int fd = ::open(path.c_str(), O_WRONLY | O_CLOEXEC);
  if (fd < 0) return errno;
  ssize_t n = ::write(fd, value, strlen(value));
  int e = n < 0 ? errno : 0;
  ::close(fd);
  return e;
}

// Thaws the scope when released, so the application may run again.
class FrozenScope : public QRVApplicationTermination::Assertion {
 public:
  explicit FrozenScope(std::string scope) : scope_(std::move(scope)) {}
  ~FrozenScope() override {
    if (scope_.empty()) return;
    // The scope may have been removed meanwhile: then there is nothing to thaw.
    if (int e = writeControl(scope_ + "/cgroup.freeze", "0"); e && e != ENOENT)
      QRVLogError("Failed to thaw {}: {}", scope_, strerror(e));
  }

 private:
  const std::string scope_;
};

}  // namespace

std::string QRVLinuxApplicationTermination::scopeDirectoryForIdentifier(const std::string& identifier) const {
  return sliceDirectory_ + "/app-" + identifier + ".scope";
}

std::unique_ptr<QRVApplicationTermination::Assertion> QRVLinuxApplicationTermination::terminate(
    const std::string& identifier, const std::string& reason, QRVError* error) {
  // The identifier becomes a path component: it must not climb out of the slice.
  if (identifier.empty() || identifier.find('/') != std::string::npos || identifier == "." || identifier == "..") {
    QRVFail(error, QRV_POSIX_ERROR(EINVAL, "Invalid application identifier for termination: {}", identifier));
    return nullptr;
  }
  const std::string scope = scopeDirectoryForIdentifier(identifier);
  struct stat st;
  if (::stat(scope.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
    QRVLogInfo("No cgroup for {}: nothing to stop ({})", identifier, reason);
    return std::make_unique<FrozenScope>(std::string());
  }
  // Freeze first, so nothing new starts between the kill and the release.
  if (int e = writeControl(scope + "/cgroup.freeze", "1")) {
    QRVFail(error, QRV_POSIX_ERROR(e, "Failed to freeze {}: {}", scope, strerror(e)));
    return nullptr;
  }
  auto held = std::make_unique<FrozenScope>(scope);
  if (int e = writeControl(scope + "/cgroup.kill", "1")) {
    QRVFail(error, QRV_POSIX_ERROR(e, "Failed to kill {}: {}", scope, strerror(e)));
    return nullptr;  // thaws again
  }
  QRVLogNotice("Terminated {} ({})", identifier, reason);
  return held;
}
