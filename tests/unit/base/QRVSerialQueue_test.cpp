#include "base/QRVSerialQueue.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <future>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "support/QRVEventually.h"

namespace {

using namespace std::chrono_literals;
constexpr auto kTimeout = 30s;  // reached only when something is broken

// A count that threads wait on, with a bound.
struct Counter {
  std::atomic<int> n{0};
  void add() { n++; }
  bool waitFor(int target, std::chrono::milliseconds timeout = kTimeout) {
    return QRVEventually([&] { return n >= target; }, timeout);
  }
};

// A job that holds its queue from when it has started until it is opened.
struct Gate {
  Counter started, open;
  QRVSerialQueue::Job job() {
    return [this] {
      started.add();
      open.waitFor(1);
    };
  }
};

std::string current() {
  const char* label = QRVSerialQueue::currentLabel();
  return label ? label : "(none)";
}

TEST(QRVSerialQueueTest, JobsRunOneAtATimeInSubmissionOrder) {
  auto q = QRVSerialQueue::create("fifo");
  std::atomic<int> inside{0};
  std::atomic<bool> overlapped{false};
  std::vector<std::pair<int, int>> ran;  // guarded by the queue itself
  std::vector<std::thread> producers;
  for (int p = 0; p < 8; p++) {
    producers.emplace_back([&, p] {
      for (int i = 0; i < 500; i++) {
        q->async([&, p, i] {
          if (inside++ != 0) overlapped = true;
          std::this_thread::yield();
          ran.emplace_back(p, i);
          inside--;
        });
      }
    });
  }
  for (auto& t : producers) t.join();
  q->sync([] {});
  EXPECT_FALSE(overlapped);
  ASSERT_EQ(ran.size(), 8u * 500);
  std::vector<int> next(8, 0);
  for (auto [p, i] : ran) EXPECT_EQ(i, next[p]++) << "producer " << p;

  Counter orphan;  // a queue its owner dropped still runs its jobs
  QRVSerialQueue::create("orphan")->async([&] { orphan.add(); });
  EXPECT_TRUE(orphan.waitFor(1));
}

TEST(QRVSerialQueueTest, SyncRunsOnCallerAfterEarlierJobs) {
  auto q = QRVSerialQueue::create("sync");
  const auto caller = std::this_thread::get_id();
  std::vector<std::string> order;
  Counter done;
  // Fast path, idle queue: the job runs here, and one queued meanwhile after it.
  q->sync([&] {
    EXPECT_EQ(std::this_thread::get_id(), caller);
    EXPECT_TRUE(q->isCurrent());
    EXPECT_EQ(current(), "sync");
    q->async([&] {
      order.push_back("async");
      done.add();
    });
    order.push_back("sync");
  });
  ASSERT_TRUE(done.waitFor(1));
  EXPECT_EQ(order, (std::vector<std::string>{"sync", "async"}));

  // Slow path, busy queue: waits for both earlier jobs, then runs on its caller.
  order.clear();
  Gate gate;
  q->async(gate.job());
  q->async([&] { order.push_back("queued"); });
  ASSERT_TRUE(gate.started.waitFor(1));
  auto syncer = std::async(std::launch::async, [&] {
    std::thread::id ranOn;
    q->sync([&] {
      ranOn = std::this_thread::get_id();
      order.push_back(q->isCurrent() ? "sync" : "sync, not current");
    });
    return ranOn == std::this_thread::get_id();
  });
  EXPECT_EQ(syncer.wait_for(50ms), std::future_status::timeout);
  gate.open.add();
  ASSERT_EQ(syncer.wait_for(kTimeout), std::future_status::ready);
  EXPECT_TRUE(syncer.get());  // ran on the calling thread
  EXPECT_EQ(order, (std::vector<std::string>{"queued", "sync"}));
  EXPECT_FALSE(q->isCurrent());
}

TEST(QRVSerialQueueTest, TargetedQueueRunsAsJobsOfItsTarget) {
  auto target = QRVSerialQueue::create("target");
  auto child = QRVSerialQueue::create("child", target);
  EXPECT_FALSE(target->isCurrent() || child->isCurrent());
  EXPECT_EQ(QRVSerialQueue::currentLabel(), nullptr);
  std::atomic<int> inside{0}, wrong{0};
  Counter done;
  auto job = [&](bool inChild) {
    return [&, inChild] {
      if (inside++ != 0) wrong++;
      if (child->isCurrent() != inChild || !target->isCurrent()) wrong++;
      if (current() != (inChild ? "child" : "target")) wrong++;
      inside--;
      done.add();
    };
  };
  auto producer = std::async(std::launch::async, [&] {
    for (int i = 0; i < 2000; i++) child->async(job(true));
  });
  for (int i = 0; i < 2000; i++) target->async(job(false));
  producer.wait();
  child->sync(job(true));
  ASSERT_TRUE(done.waitFor(4001));
  EXPECT_EQ(wrong, 0);

  // The target's own job goes between the child's, in submission order, and
  // suspending the target stops the child before its next job.
  std::vector<std::string> order;
  Gate gate, gate2;
  child->async(gate.job());
  ASSERT_TRUE(gate.started.waitFor(1));
  target->async([&] { order.push_back("target"); });
  child->async([&] { order.push_back("child"); });
  child->async(gate2.job());
  gate.open.add();
  ASSERT_TRUE(gate2.started.waitFor(1));
  EXPECT_EQ(order, (std::vector<std::string>{"target", "child"}));
  target->suspend();
  Counter ran;
  child->async([&] { ran.add(); });
  gate2.open.add();
  EXPECT_FALSE(ran.waitFor(1, 100ms));
  target->resume();
  EXPECT_TRUE(ran.waitFor(1));
}

TEST(QRVSerialQueueTest, SuspendStopsBeforeNextJobUntilBalancedResume) {
  auto q = QRVSerialQueue::create("suspend");
  Gate gate;
  Counter ran;
  q->async(gate.job());
  ASSERT_TRUE(gate.started.waitFor(1));
  q->suspend();  // the running job finishes, the next one waits
  q->async([&] { ran.add(); });
  gate.open.add();
  EXPECT_FALSE(ran.waitFor(1, 100ms));
  q->suspend();
  q->resume();
  EXPECT_TRUE(q->isSuspended());
  EXPECT_FALSE(ran.waitFor(1, 50ms));
  q->resume();
  EXPECT_FALSE(q->isSuspended());
  EXPECT_TRUE(ran.waitFor(1));

  q->suspend();  // an idle queue: sync waits for the resume too
  auto syncer = std::async(std::launch::async, [&] { q->sync([&] { ran.add(); }); });
  EXPECT_FALSE(ran.waitFor(2, 50ms));
  q->resume();
  EXPECT_TRUE(ran.waitFor(2));
}

TEST(QRVSerialQueueTest, JobsBlockedOnOtherQueuesDoNotStarveThePool) {
  // Every job waits, inside a sync onto another queue, until all are inside:
  // the pool must outgrow the blocked callers and the workers lent to them.
  constexpr int kQueues = 300;
  auto inside = std::make_shared<Counter>(), done = std::make_shared<Counter>();
  for (int i = 0; i < kQueues; i++) {
    auto holder = QRVSerialQueue::create("holder");
    auto inner = QRVSerialQueue::create("inner", holder);  // a target forces the slow path
    QRVSerialQueue::create("outer")->async([inner, inside, done] {
      inner->sync([&] {
        inside->add();
        inside->waitFor(kQueues);
      });
      done->add();
    });
  }
  EXPECT_TRUE(inside->waitFor(kQueues));
  EXPECT_TRUE(done->waitFor(kQueues));
}

void reportAndAbort(std::exception_ptr e) {
  try {
    std::rethrow_exception(e);
  } catch (const std::exception& x) {
    fprintf(stderr, "handler caught: %s\n", x.what());
  }
  abort();
}

TEST(QRVSerialQueueDeathTest, MisuseAndThrowingJobsAbort) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  auto q = QRVSerialQueue::create("misused");
  q->suspend();
  q->resume();
  EXPECT_DEATH(q->resume(), "resumed more often than suspended");
  EXPECT_DEATH(q->sync([&] { q->sync([] {}); }), "would deadlock");
  EXPECT_DEATH(
      {
        QRVSerialQueue::setUncaughtExceptionHandler(reportAndAbort);
        q->async([] { throw std::runtime_error("job failed"); });
        std::this_thread::sleep_for(kTimeout);  // the handler ends the process first
      },
      "handler caught: job failed");
}

}  // namespace
