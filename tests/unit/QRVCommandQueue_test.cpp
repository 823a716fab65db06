#include "QRVCommandQueue.h"

#include <gtest/gtest.h>

#include <functional>
#include <vector>

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

TEST(CommandQueueTest, EmptyDrainLeavesTheResultAlone) {
  QRVCommandQueue queue;
  uint64_t result = 12;  // a handler's own failure survives
  EXPECT_TRUE(queue.executeAllUntilExhaustedOrError(&result));
  EXPECT_EQ(result, 12u);
  uint64_t code = 1;
  EXPECT_FALSE(queue.executeNextCommandWithError(&code));
  EXPECT_EQ(code, QRVCommandQueue::kExhausted);
}

TEST(CommandQueueTest, FirstFailureStopsTheDrainAndBecomesTheResult) {
  std::vector<std::string> log;
  QRVCommandQueue queue;
  queue.insertCommand(std::make_shared<Step>(&log, "A"));
  queue.insertCommand(std::make_shared<Step>(&log, "B", 28));
  queue.insertCommand(std::make_shared<Step>(&log, "C"));
  uint64_t result = 1;
  EXPECT_FALSE(queue.executeAllUntilExhaustedOrError(&result));
  EXPECT_EQ(result, 28u);
  EXPECT_EQ(log, (std::vector<std::string>{"A", "B"}));
}

TEST(CommandQueueTest, CommandsAddedWhileDrainingRunInTheSameDrain) {
  std::vector<std::string> log;
  QRVCommandQueue queue;
  queue.insertCommand(std::make_shared<Step>(&log, "A", 0, [&](QRVCommandQueue& q) {
    q.insertCommand(std::make_shared<Step>(&log, "A2"));
  }));
  queue.insertCommand(std::make_shared<Step>(&log, "B"));
  uint64_t result = 1;
  EXPECT_TRUE(queue.executeAllUntilExhaustedOrError(&result));
  EXPECT_EQ(result, 1u);
  EXPECT_EQ(log, (std::vector<std::string>{"A", "B", "A2"}));
  EXPECT_EQ(queue.pendingCount(), 0u);
}

}  // namespace
