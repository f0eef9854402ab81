#include "Daemon/TSYCommandQueue.h"

#include <gtest/gtest.h>

#include <functional>
#include <thread>

namespace {

class Step : public TSYCommand {
 public:
  using Work = std::function<TSYResult<void>(TSYCommandQueue&)>;

  explicit Step(Work work) : work_(std::move(work)) {}
  uint64_t command() const override { return 99; }
  TSYResult<void> fromQueueExecute(TSYCommandQueue& queue) override { return work_(queue); }

 private:
  const Work work_;
};

struct Recorder {
  std::shared_ptr<TSYCommand> step(char name, uint64_t code = TSYErrorSuccess) {
    return std::make_shared<Step>([this, name, code](TSYCommandQueue&) -> TSYResult<void> {
      order += name;
      if (code == TSYErrorSuccess) return {};
      return TSYFailure(TSYErrorCreate(code, std::nullopt, TSYLogIt::no, "{}", name));
    });
  }
  std::string order;
};

TEST(TSYCommandQueue, runsInOrderUntilNoneIsLeft) {
  TSYCommandQueue queue;
  Recorder recorder;
  EXPECT_TRUE(queue.executeAllUntilExhausted().has_value());
  const auto none = queue.executeNextCommand();
  ASSERT_FALSE(none.has_value());
  EXPECT_EQ(none.error().code(), 77U);
  for (const char name : {'a', 'b', 'c', 'd'}) queue.insertCommand(recorder.step(name));
  EXPECT_EQ(recorder.order, "");
  EXPECT_TRUE(queue.executeNextCommand().has_value());
  EXPECT_EQ(recorder.order, "a");
  EXPECT_TRUE(queue.executeAllUntilExhausted().has_value());
  EXPECT_EQ(recorder.order, "abcd");
}

TEST(TSYCommandQueue, aFailureEndsTheDrainAndLeavesTheRest) {
  TSYCommandQueue queue;
  Recorder recorder;
  queue.insertCommand(recorder.step('a'));
  queue.insertCommand(recorder.step('b', TSYErrorDeleteFailed));
  queue.insertCommand(recorder.step('c'));
  const auto drained = queue.executeAllUntilExhausted();
  ASSERT_FALSE(drained.has_value());
  EXPECT_EQ(drained.error().code(), 28U);
  EXPECT_EQ(recorder.order, "ab");
  EXPECT_TRUE(queue.executeAllUntilExhausted().has_value());
  EXPECT_EQ(recorder.order, "abc");
}

TEST(TSYCommandQueue, aRunningCommandMayInsertMore) {
  TSYCommandQueue queue;
  Recorder recorder;
  queue.insertCommand(std::make_shared<Step>([&](TSYCommandQueue& running) -> TSYResult<void> {
    EXPECT_EQ(&running, &queue);
    recorder.order += 'a';
    running.insertCommand(recorder.step('c'));
    return {};
  }));
  queue.insertCommand(recorder.step('b'));
  EXPECT_TRUE(queue.executeAllUntilExhausted().has_value());
  EXPECT_EQ(recorder.order, "abc");
}

TEST(TSYCommandQueue, anyThreadMayInsertAndCommandsRunOneAtATime) {
  TSYCommandQueue queue;
  int ran = 0;  // plain on purpose
  const auto count = std::make_shared<Step>([&ran](TSYCommandQueue&) -> TSYResult<void> {
    ++ran;
    return {};
  });
  std::vector<std::thread> threads;
  for (int thread = 0; thread < 4; ++thread) {
    threads.emplace_back([&] {
      for (int i = 0; i < 100; ++i) {
        queue.insertCommand(count);
        if (i % 10 != 0) continue;
        EXPECT_TRUE(queue.executeAllUntilExhausted().has_value());
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_TRUE(queue.executeAllUntilExhausted().has_value());
  EXPECT_EQ(ran, 400);
}

}  // namespace
