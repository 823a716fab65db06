// A serial work queue: jobs run one at a time, in submission order, on
// threads of a shared pool. Every queue of the daemon is one of these.
//
// A queue may target another queue: its jobs then run as jobs of the target,
// so the two never run at the same time. Queues without a target run on the
// default pool or, for background work, on a pool of lower-priority threads.
//
// The pools grow when every thread is busy (a job may block waiting for
// another queue, and a fixed pool could then deadlock) and shrink again when
// threads stay idle.
//
// Thread-safe. Create queues with `create`; they are shared by reference.
#pragma once

#include <deque>
#include <functional>
#include <memory>
#include <string>

#include "base/QRVMutex.h"

class QRVSerialQueue : public std::enable_shared_from_this<QRVSerialQueue> {
 public:
  enum class Priority { kDefault, kBackground };
  using Job = std::function<void()>;

  static std::shared_ptr<QRVSerialQueue> create(std::string label,
                                                std::shared_ptr<QRVSerialQueue> target = nullptr,
                                                Priority priority = Priority::kDefault);

  // Called with the exception of a job that threw. The default aborts; the
  // daemon installs its crash reporter.
  using ExceptionHandler = void (*)(std::exception_ptr);
  static void setUncaughtExceptionHandler(ExceptionHandler handler);

  const std::string& label() const { return label_; }

  void async(Job job) EXCLUDES(mutex_);
  // Runs `job` on the calling thread once every job submitted before it has
  // finished, with the queue held for its duration. Must not be called from
  // a job of this queue (that would wait for itself).
  void sync(const Job& job) EXCLUDES(mutex_);
  // On a serial queue every job already excludes all others; the barrier
  // forms exist so that code written against the queue reads as intended.
  void barrierAsync(Job job) { async(std::move(job)); }
  void barrierSync(const Job& job) { sync(job); }

  // Suspension stops the queue before its next job (a running job
  // finishes). Calls must balance: resuming more often than suspending is a
  // programming error and aborts.
  void suspend() EXCLUDES(mutex_);
  void resume() EXCLUDES(mutex_);
  bool isSuspended() const EXCLUDES(mutex_);

  // True when the calling thread is running a job of this queue.
  bool isCurrent() const;
  // Label of the queue whose job the calling thread runs, or null.
  static const char* currentLabel();

 private:
  QRVSerialQueue(std::string label, std::shared_ptr<QRVSerialQueue> target, Priority priority);
  void scheduleDrainLocked() REQUIRES(mutex_);
  void drain() EXCLUDES(mutex_);
  // Targets are locked after the queues aiming at them, never before.
  bool targetWantsTurn() const REQUIRES(mutex_);
  static void run(const Job& job);

  const std::string label_;
  const std::shared_ptr<QRVSerialQueue> target_;
  const Priority priority_;

  mutable QRVMutex mutex_;
  std::deque<Job> jobs_ GUARDED_BY(mutex_);
  bool draining_ GUARDED_BY(mutex_) = false;  // a drain is scheduled or running
  int suspendCount_ GUARDED_BY(mutex_) = 0;
};
