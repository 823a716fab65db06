// Waiting in tests for work that finishes on another thread: polls the
// condition until it holds or the timeout passes, so a bug fails the test
// instead of hanging it.
#pragma once

#include <chrono>
#include <functional>
#include <thread>

inline bool QRVEventually(const std::function<bool()>& condition,
                          std::chrono::milliseconds timeout = std::chrono::seconds(5)) {
  auto deadline = std::chrono::steady_clock::now() + timeout;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return true;
}
