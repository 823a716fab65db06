#include "platform/linux/QRVLinuxNotificationService.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>

#include "base/QRVLog.h"

uint32_t QRVLinuxNotificationService::post(const std::string& name) {
  if (name.empty() || name.find('/') != std::string::npos || name == "." || name == "..") return EINVAL;
  std::error_code ec;
  std::filesystem::create_directories(directory_, ec);
  std::string path = directory_ + "/" + name;
  int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0644);
  if (fd < 0) return static_cast<uint32_t>(errno);
  // Touching updates the time stamps even when the file already existed,
  // which is what watchers see.
  int rc = futimens(fd, nullptr);
  int e = errno;
  close(fd);
  if (rc != 0) return static_cast<uint32_t>(e);
  QRVLog::writeSystem(QRVLogLevel::kNotice, "posted notification " + name);
  return 0;
}
