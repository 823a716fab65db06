// What every bench measures with: milliseconds since a point in time, the
// median of its rounds (and other percentiles), and how many rounds it was
// asked for.
#pragma once

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <vector>

namespace QRVBench {

using Clock = std::chrono::steady_clock;

inline double millisSince(Clock::time_point start) {
  return std::chrono::duration<double, std::milli>(Clock::now() - start).count();
}

// The middle round, which one disturbed round (another worker on the
// machine, a flush of the page cache) cannot move.
inline double median(std::vector<double> v) {
  std::sort(v.begin(), v.end());
  return v.empty() ? 0 : v[v.size() / 2];
}

// The value below which a fraction `q` (0..1) of the samples lie: the
// sample at that rank of the sorted list.
inline double percentile(std::vector<double> v, double q) {
  if (v.empty()) return 0;
  std::sort(v.begin(), v.end());
  size_t rank = static_cast<size_t>(q * static_cast<double>(v.size()));
  return v[std::min(rank, v.size() - 1)];
}

// $QRV_BENCH_REPETITIONS, at least 1; `fallback` when it is not set.
inline int repetitions(int fallback) {
  const char* text = getenv("QRV_BENCH_REPETITIONS");
  return text ? std::max(1, atoi(text)) : fallback;
}

}  // namespace QRVBench
