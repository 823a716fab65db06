#include "core/QRVCommandQueue.h"

#include <gtest/gtest.h>

#include <functional>
#include <vector>

#include "base/QRVResultCode.h"

namespace {

// A command that records that it ran and does what it is told.
class Step : public QRVCommand {
 public:
  Step(std::vector<std::string>* log, std::string name, uint64_t failWith = 0,
       std::function<void(QRVCommandQueue&)> also = nullptr)
      : log_(log), name_(std::move(name)), failWith_(failWith), also_(std::move(also)) {}
  uint64_t command() const override { return 99; }
  bool fromQueue(QRVCommandQueue& queue, uint64_t* result) override {
    log_->push_back(name_);
    if (also_) also_(queue);
    if (!failWith_) return true;
    *result = failWith_;
    return false;
  }

 private:
  std::vector<std::string>* log_;
  std::string name_;
  uint64_t failWith_;
  std::function<void(QRVCommandQueue&)> also_;
};

TEST(CommandQueueTest, DrainRunsInOrderIncludingLateCommandsAndStopsAtTheFirstFailure) {
  QRVCommandQueue queue;
  uint64_t result = 12;  // an empty drain leaves a handler's own failure alone
  EXPECT_TRUE(queue.executeAllUntilExhaustedOrError(&result));
  EXPECT_EQ(result, 12u);
  EXPECT_FALSE(queue.executeNextCommandWithError(&result));
  EXPECT_EQ(result, QRVResultCode::kQueueExhausted);

  // A command added while draining runs in the same drain, after those queued before it.
  std::vector<std::string> log;
  queue.insertCommand(std::make_shared<Step>(&log, "A", 0, [&](QRVCommandQueue& q) {
    q.insertCommand(std::make_shared<Step>(&log, "A2"));
  }));
  queue.insertCommand(std::make_shared<Step>(&log, "B"));
  result = 1;
  EXPECT_TRUE(queue.executeAllUntilExhaustedOrError(&result));
  EXPECT_EQ(result, 1u);
  EXPECT_EQ(log, (std::vector<std::string>{"A", "B", "A2"}));

  log.clear();
  queue.insertCommand(std::make_shared<Step>(&log, "C"));
  queue.insertCommand(std::make_shared<Step>(&log, "D", 28));
  queue.insertCommand(std::make_shared<Step>(&log, "E"));
  EXPECT_FALSE(queue.executeAllUntilExhaustedOrError(&result));
  EXPECT_EQ(result, 28u);
  EXPECT_EQ(log, (std::vector<std::string>{"C", "D"}));
  // What came after the failure is dropped, not left to run in a later drain.
  EXPECT_EQ(queue.pendingCount(), 0u);
}

}  // namespace
