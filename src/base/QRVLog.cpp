#include "base/QRVLog.h"

#include <spdlog/sinks/rotating_file_sink.h>
#include <spdlog/spdlog.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <vector>

#include "base/QRVMutex.h"

namespace {

struct Handle {
  std::shared_ptr<spdlog::logger> logger;
  std::atomic<int> level;
};

// Handles are never freed: a writer on another thread may still hold the
// pointer it loaded. Only tests ever open more than one.
std::atomic<Handle*> gHandle{nullptr};
QRVMutex gOpenMutex;
std::vector<std::unique_ptr<Handle>> gAllHandles GUARDED_BY(gOpenMutex);

const char* levelName(int level) {
  switch (level) {
    case QRVLogLevel::kError: return "Error";
    case QRVLogLevel::kNotice: return "Notice";
    case QRVLogLevel::kInfo: return "Info";
    case QRVLogLevel::kDebug: return "Debug";
    default: return "Default";
  }
}

spdlog::level::level_enum spdLevel(int level) {
  if (level <= QRVLogLevel::kError) return spdlog::level::err;
  if (level <= QRVLogLevel::kNotice) return spdlog::level::warn;
  if (level <= QRVLogLevel::kInfo) return spdlog::level::info;
  return spdlog::level::debug;
}

}  // namespace

bool QRVLog::open(const std::string& subsystem, const std::string& path, int level,
                  size_t rotationCount, size_t sizeLimit) {
  QRVMutexLock lock(&gOpenMutex);
  std::shared_ptr<spdlog::logger> logger;
  try {
    auto sink = std::make_shared<spdlog::sinks::rotating_file_sink_mt>(path, sizeLimit,
                                                                       rotationCount);
    logger = std::make_shared<spdlog::logger>(subsystem, std::move(sink));
    logger->set_pattern("%Y-%m-%d %H:%M:%S.%f %P:%t %v");
    logger->set_level(spdlog::level::trace);
    // The daemon is stopped without warning; a line that matters must
    // already be on disk.
    logger->flush_on(spdlog::level::trace);
  } catch (const std::exception&) {
    writeSystem(QRVLogLevel::kError, fmt::format("Failed to set up rotating logs at path {}", path));
    gHandle.store(nullptr);
    return false;
  }
  auto handle = std::make_unique<Handle>();
  handle->logger = std::move(logger);
  handle->level = level;
  gHandle.store(handle.get());
  gAllHandles.push_back(std::move(handle));
  return true;
}

void QRVLog::close() {
  QRVMutexLock lock(&gOpenMutex);
  gHandle.store(nullptr);
}

bool QRVLog::hasHandle() { return gHandle.load() != nullptr; }

void QRVLog::setLevel(int level) {
  if (Handle* h = gHandle.load()) h->level = level;
}

bool QRVLog::isEnabled(int level) {
  Handle* h = gHandle.load();
  if (!h) return level <= QRVLogLevel::kNotice;
  return h->level.load(std::memory_order_relaxed) >= level;
}

void QRVLog::write(int level, std::string_view function, std::string_view message) {
  Handle* h = gHandle.load();
  if (!h) {
    if (level <= QRVLogLevel::kNotice)
      writeSystem(level, fmt::format("{}: {}", function, message));
    return;
  }
  if (h->level.load(std::memory_order_relaxed) < level) return;
  h->logger->log(spdLevel(level), "<{}> {}: {}", levelName(level), function, message);
}

void QRVLog::writeSystem(int level, std::string_view message) {
  // Under systemd stderr is a journal stream, which reads a "<N>" prefix as
  // the line's priority.
  static const bool journal = getenv("JOURNAL_STREAM") != nullptr;
  std::string line = journal ? fmt::format("<{}>quorvad: {}\n", level, message)
                             : fmt::format("quorvad[{}]: <{}> {}\n", getpid(), levelName(level), message);
  // One write(2) per line keeps lines from different threads whole.
  ssize_t ignored = ::write(STDERR_FILENO, line.data(), line.size());
  (void)ignored;
}
