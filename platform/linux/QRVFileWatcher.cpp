#include "platform/linux/QRVFileWatcher.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>

QRVFileWatcher::~QRVFileWatcher() {
  if (thread_.joinable()) {
    uint64_t one = 1;
    ssize_t ignored = write(stopFd_, &one, sizeof one);
    (void)ignored;
    thread_.join();
  }
  if (inotifyFd_ >= 0) close(inotifyFd_);
  if (stopFd_ >= 0) close(stopFd_);
}

int QRVFileWatcher::start(const std::string& path, std::function<void()> onChange) {
  if (thread_.joinable()) return EBUSY;
  std::filesystem::path dir = std::filesystem::path(path).parent_path();
  std::error_code ec;
  std::filesystem::create_directories(dir, ec);
  inotifyFd_ = inotify_init1(IN_CLOEXEC);
  if (inotifyFd_ < 0) return errno;
  stopFd_ = eventfd(0, EFD_CLOEXEC);
  if (stopFd_ < 0) return errno;
  if (inotify_add_watch(inotifyFd_, dir.c_str(), IN_CLOSE_WRITE | IN_MOVED_TO | IN_MOVED_FROM | IN_DELETE | IN_CREATE) < 0)
    return errno;
  std::string leaf = std::filesystem::path(path).filename();
  thread_ = std::thread([this, leaf, onChange = std::move(onChange)] {
    alignas(inotify_event) char buf[4096];
    for (;;) {
      pollfd fds[2] = {{inotifyFd_, POLLIN, 0}, {stopFd_, POLLIN, 0}};
      if (poll(fds, 2, -1) < 0 && errno != EINTR) return;
      if (fds[1].revents) return;
      if (!(fds[0].revents & POLLIN)) continue;
      ssize_t n = read(inotifyFd_, buf, sizeof buf);
      bool ours = false;
      for (char* p = buf; n > 0 && p < buf + n;) {
        auto* ev = reinterpret_cast<inotify_event*>(p);
        if (ev->len && leaf == ev->name) ours = true;
        p += sizeof(inotify_event) + ev->len;
      }
      if (ours) onChange();
    }
  });
  return 0;
}
