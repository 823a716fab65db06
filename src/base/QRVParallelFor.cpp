#include "base/QRVParallelFor.h"

#include <algorithm>
#include <atomic>
#include <exception>
#include <mutex>
#include <system_error>
#include <thread>
#include <vector>

namespace {

struct Work {
  Work(const std::function<bool(size_t)>& j, size_t n) : job(j), count(n) {}

  const std::function<bool(size_t)>& job;
  const size_t count;
  std::atomic<size_t> next{0};
  std::atomic<bool> stopped{false};
  std::mutex failureMutex;
  std::exception_ptr failure;

  void run() {
    while (!stopped.load(std::memory_order_relaxed)) {
      size_t i = next.fetch_add(1, std::memory_order_relaxed);
      if (i >= count) return;
      try {
        if (!job(i)) stopped = true;
      } catch (...) {
        std::lock_guard<std::mutex> lock(failureMutex);
        if (!failure) failure = std::current_exception();
        stopped = true;
      }
    }
  }
};

}  // namespace

void QRVParallelFor(size_t count, size_t maxThreads, size_t perThread, const std::function<bool(size_t)>& job) {
  Work work(job, count);
  const size_t wanted = std::min(std::max<size_t>(maxThreads, 1), count / std::max<size_t>(perThread, 1) + 1);
  std::vector<std::thread> helpers;
  helpers.reserve(wanted - 1);
  for (size_t t = 1; t < wanted; t++) {
    try {
      helpers.emplace_back([&work] { work.run(); });
    } catch (const std::system_error&) {
      break;  // out of threads: the ones running do the rest
    }
  }
  work.run();
  for (std::thread& helper : helpers) helper.join();
  if (work.failure) std::rethrow_exception(work.failure);
}
