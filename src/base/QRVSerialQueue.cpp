#include "base/QRVSerialQueue.h"

#include <sys/resource.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <system_error>
#include <thread>

#include "base/QRVCondVar.h"

namespace {

// Threads are started on demand, so a job that blocks never starves the
// others, and leave after a while without work. There is deliberately no cap
// on the number of threads: a pool that stops growing is a fixed pool once
// enough jobs block, and can deadlock like one. The count stays bounded all
// the same, because a queue has at most one drain submitted at a time, so no
// more threads are started than there are queues with work at once.
class ThreadPool {
 public:
  explicit ThreadPool(int nice) : nice_(nice) {}

  void submit(std::function<void()> job) EXCLUDES(mutex_) {
    QRVMutexLock lock(&mutex_);
    jobs_.push_back(std::move(job));
    if (idle_ >= jobs_.size()) {
      cv_.signal();
      return;
    }
    try {
      std::thread([this] { work(); }).detach();
      threads_++;
    } catch (const std::system_error&) {
      // Out of threads: the job waits for a running thread to come free.
      // With none at all it would never run.
      if (threads_ == 0) {
        fprintf(stderr, "quorvad: cannot start a worker thread\n");
        abort();
      }
    }
  }

 private:
  void work() EXCLUDES(mutex_) {
    if (nice_) setpriority(PRIO_PROCESS, static_cast<id_t>(gettid()), nice_);
    QRVMutexLock lock(&mutex_);
    for (;;) {
      idle_++;
      bool got = true;
      const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
      while (jobs_.empty()) {
        if (!cv_.waitUntil(&mutex_, deadline)) {
          got = !jobs_.empty();
          break;
        }
      }
      idle_--;
      if (!got) {
        threads_--;
        return;
      }
      auto job = std::move(jobs_.front());
      jobs_.pop_front();
      lock.unlock();
      job();
      lock.lock();
    }
  }

  const int nice_;
  QRVMutex mutex_;
  QRVCondVar cv_;
  std::deque<std::function<void()>> jobs_ GUARDED_BY(mutex_);
  size_t idle_ GUARDED_BY(mutex_) = 0;
  size_t threads_ GUARDED_BY(mutex_) = 0;
};

// Never destroyed: detached workers may still be waiting when the process
// exits.
ThreadPool& pool(QRVSerialQueue::Priority priority) {
  static ThreadPool* def = new ThreadPool(0);
  static ThreadPool* background = new ThreadPool(10);
  return priority == QRVSerialQueue::Priority::kBackground ? *background : *def;
}

thread_local const QRVSerialQueue* tCurrent = nullptr;
std::atomic<QRVSerialQueue::ExceptionHandler> gExceptionHandler{nullptr};

// Marks the calling thread as running `queue` for the scope's duration.
class CurrentQueueScope {
 public:
  explicit CurrentQueueScope(const QRVSerialQueue* queue) : saved_(tCurrent) { tCurrent = queue; }
  ~CurrentQueueScope() { tCurrent = saved_; }

 private:
  const QRVSerialQueue* saved_;
};

}  // namespace

std::shared_ptr<QRVSerialQueue> QRVSerialQueue::create(std::string label,
                                                       std::shared_ptr<QRVSerialQueue> target,
                                                       Priority priority) {
  return std::shared_ptr<QRVSerialQueue>(
      new QRVSerialQueue(std::move(label), std::move(target), priority));
}

QRVSerialQueue::QRVSerialQueue(std::string label, std::shared_ptr<QRVSerialQueue> target,
                               Priority priority)
    : label_(std::move(label)), target_(std::move(target)), priority_(priority) {}

void QRVSerialQueue::setUncaughtExceptionHandler(ExceptionHandler handler) {
  gExceptionHandler = handler;
}

void QRVSerialQueue::async(Job job) {
  QRVMutexLock lock(&mutex_);
  jobs_.push_back(std::move(job));
  if (!draining_ && suspendCount_ == 0) scheduleDrainLocked();
}

void QRVSerialQueue::scheduleDrainLocked() {
  draining_ = true;
  // The drain keeps the queue alive even if its owner lets go meanwhile.
  auto self = shared_from_this();
  if (target_)
    target_->async([self] { self->drain(); });
  else
    pool(priority_).submit([self] { self->drain(); });
}

void QRVSerialQueue::drain() {
  CurrentQueueScope scope(this);
  for (bool ranOne = false;; ranOne = true) {
    Job job;
    {
      QRVMutexLock lock(&mutex_);
      if (jobs_.empty() || suspendCount_ > 0) {
        draining_ = false;
        return;
      }
      // This drain is one job of the target. After each of our jobs it
      // steps aside when the target has been suspended or has other jobs
      // waiting, so that they go first, and carries on behind them.
      if (ranOne && targetWantsTurn()) {
        scheduleDrainLocked();
        return;
      }
      job = std::move(jobs_.front());
      jobs_.pop_front();
    }
    run(job);
  }
}

bool QRVSerialQueue::targetWantsTurn() const {
  for (const QRVSerialQueue* q = target_.get(); q; q = q->target_.get()) {
    QRVMutexLock lock(&q->mutex_);
    if (q->suspendCount_ > 0 || !q->jobs_.empty()) return true;
  }
  return false;
}

void QRVSerialQueue::run(const Job& job) {
  try {
    job();
  } catch (...) {
    ExceptionHandler handler = gExceptionHandler.load();
    if (handler) handler(std::current_exception());
    fprintf(stderr, "quorvad: uncaught exception in queue job\n");
    abort();
  }
}

void QRVSerialQueue::sync(const Job& job) {
  if (isCurrent()) {
    fprintf(stderr, "quorvad: sync on the current queue \"%s\" would deadlock\n", label_.c_str());
    abort();
  }
  // Fast path: an idle queue without target is taken over by the caller,
  // with no other thread involved.
  {
    QRVMutexLock lock(&mutex_);
    if (!target_ && !draining_ && jobs_.empty() && suspendCount_ == 0) {
      draining_ = true;
      lock.unlock();
      {
        CurrentQueueScope scope(this);
        run(job);
      }
      lock.lock();
      draining_ = false;
      if (!jobs_.empty() && suspendCount_ == 0) scheduleDrainLocked();
      return;
    }
  }
  // Otherwise wait for our turn in line, then hold the queue's worker until
  // the job is done on this thread. The handshake state is shared because the
  // worker may still be waking up after this function has returned.
  struct Handshake {
    QRVMutex m;
    QRVCondVar cv;
    bool turn GUARDED_BY(m) = false;
    bool done GUARDED_BY(m) = false;
  };
  auto h = std::make_shared<Handshake>();
  async([h] {
    QRVMutexLock l(&h->m);
    h->turn = true;
    h->cv.signalAll();
    while (!h->done) h->cv.wait(&h->m);
  });
  {
    QRVMutexLock l(&h->m);
    while (!h->turn) h->cv.wait(&h->m);
  }
  {
    CurrentQueueScope scope(this);
    run(job);
  }
  QRVMutexLock l(&h->m);
  h->done = true;
  h->cv.signalAll();
}

void QRVSerialQueue::suspend() {
  QRVMutexLock lock(&mutex_);
  suspendCount_++;
}

void QRVSerialQueue::resume() {
  QRVMutexLock lock(&mutex_);
  if (suspendCount_ == 0) {
    fprintf(stderr, "quorvad: queue \"%s\" resumed more often than suspended\n", label_.c_str());
    abort();
  }
  if (--suspendCount_ == 0 && !draining_ && !jobs_.empty()) scheduleDrainLocked();
}

bool QRVSerialQueue::isSuspended() const {
  QRVMutexLock lock(&mutex_);
  return suspendCount_ > 0;
}

bool QRVSerialQueue::isCurrent() const {
  // A job of a queue that targets this one also holds this one.
  for (const QRVSerialQueue* q = tCurrent; q; q = q->target_.get())
    if (q == this) return true;
  return false;
}

const char* QRVSerialQueue::currentLabel() { return tCurrent ? tCurrent->label_.c_str() : nullptr; }
