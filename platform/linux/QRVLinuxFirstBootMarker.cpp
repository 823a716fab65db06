#include "platform/linux/QRVLinuxFirstBootMarker.h"

#include <fcntl.h>
#include <semaphore.h>

#include <cerrno>
#include <filesystem>
#include <functional>

#include <fmt/format.h>

QRVLinuxFirstBootMarker::QRVLinuxFirstBootMarker(const std::string& root) : name_("quorvad.fb_check") {
  std::error_code ec;
  std::string canonical = std::filesystem::weakly_canonical(root, ec).string();
  if (canonical.empty()) canonical = root;
  if (canonical != "/") name_ += fmt::format(".{:016x}", std::hash<std::string>()(canonical));
}

bool QRVLinuxFirstBootMarker::exists() {
  sem_t* sem = sem_open(("/" + name_).c_str(), 0);
  if (sem == SEM_FAILED) return false;
  sem_close(sem);
  return true;
}

bool QRVLinuxFirstBootMarker::create(int* errnum) {
  sem_t* sem = sem_open(("/" + name_).c_str(), O_CREAT, 0444, 0);
  if (sem == SEM_FAILED) {
    if (errnum) *errnum = errno;
    return false;
  }
  sem_close(sem);
  return true;
}
