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

#include <condition_variable>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>

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

  void async(Job job);
  // Runs `job` on the calling thread once every job submitted before it has
  // finished, with the queue held for its duration. Must not be called from
  // a job of this queue (that would wait for itself).
  void sync(const Job& job);
  // On a serial queue every job already excludes all others; the barrier
  // forms exist so that code written against the queue reads as intended.
  void barrierAsync(Job job) { async(std::move(job)); }
  void barrierSync(const Job& job) { sync(job); }

  // Suspension stops the queue before its next job (a running job
  // finishes). Calls must balance: resuming more often than suspending is a
  // programming error and aborts.
  void suspend();
  void resume();
  bool isSuspended() const;

  // True when the calling thread is running a job of this queue.
  bool isCurrent() const;
  // Label of the queue whose job the calling thread runs, or null.
  static const char* currentLabel();

 private:
  QRVSerialQueue(std::string label, std::shared_ptr<QRVSerialQueue> target, Priority priority);
  void scheduleDrainLocked();
  void drain();
  // REQUIRES: mutex_ held (targets are locked after the queues aiming at
  // them, never before).
  bool targetWantsTurn() const;
  static void run(const Job& job);

  const std::string label_;
  const std::shared_ptr<QRVSerialQueue> target_;
  const Priority priority_;

  mutable std::mutex mutex_;
  std::deque<Job> jobs_;       // GUARDED_BY(mutex_)
  bool draining_ = false;      // GUARDED_BY(mutex_): a drain is scheduled or running
  int suspendCount_ = 0;       // GUARDED_BY(mutex_)
};
