#include "Daemon/TSYCommandQueue.h"

#include <gtest/gtest.h>

#include <thread>

#include "Tests/Daemon/ContainerDevice.h"

namespace {

// Records its name; fails with its code unless that is 1.
std::shared_ptr<TSYCommand> step(std::string& order, char name, uint64_t code = TSYErrorSuccess) {
  return std::make_shared<Step>([&order, name, code](TSYCommandQueue&) -> TSYResult<void> {
    order += name;
    if (code == TSYErrorSuccess) return {};
    return TSYFailure(TSYErrorCreate(code, std::nullopt, TSYLogIt::no, "{}", name));
  });
}

TEST(TSYCommandQueue, runsInOrderUntilOneFailsAndThenTheRest) {
  TSYCommandQueue queue;
  std::string order;
  EXPECT_TRUE(queue.executeAllUntilExhausted().has_value());
  expectFailure(queue.executeNextCommand(), 77, "");
  queue.insertCommand(std::make_shared<Step>([&](TSYCommandQueue& running) -> TSYResult<void> {
    running.insertCommand(step(order, 'd'));  // behind what is there
    return {};
  }));
  queue.insertCommand(step(order, 'a'));
  queue.insertCommand(step(order, 'b', TSYErrorDeleteFailed));
  queue.insertCommand(step(order, 'c'));
  expectFailure(queue.executeAllUntilExhausted(), 28, "b");
  EXPECT_EQ(order, "ab");
  EXPECT_TRUE(queue.executeAllUntilExhausted().has_value());
  EXPECT_EQ(order, "abcd");
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
