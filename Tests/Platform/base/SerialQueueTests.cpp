#include "Platform/base/SerialQueue.h"

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <chrono>
#include <future>
#include <memory>
#include <numeric>
#include <vector>

namespace platform {
namespace {

using namespace std::chrono_literals;

TEST(SerialQueue, SuspensionsCountAndHoldBothKindsOfWork) {
  SerialQueue queue("com.example.suspension");
  std::atomic<int> ran = 0;
  queue.suspend();
  queue.suspend();
  queue.async([&] { ++ran; });
  auto waiting = std::async(std::launch::async, [&] { queue.sync([&] { ++ran; }); });
  queue.resume();
  EXPECT_EQ(waiting.wait_for(30ms), std::future_status::timeout);
  EXPECT_EQ(ran, 0);
  queue.resume();
  waiting.get();
  EXPECT_EQ(ran, 2);
  // What runs is not interrupted, and may itself suspend what comes behind it.
  queue.async([&] {
    queue.suspend();
    ++ran;
  });
  queue.async([&] { ran = 100; });
  while (ran != 3) std::this_thread::yield();
  std::this_thread::sleep_for(30ms);
  EXPECT_EQ(ran, 3);
  queue.resume();
  queue.sync([] {});
  EXPECT_EQ(ran, 100);
}

TEST(SerialQueueDeathTest, MisuseStopsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        SerialQueue queue("com.example.q");
        SerialQueue other("com.example.other");
        queue.sync([&] { other.sync([&] { queue.sync([] {}); }); });
      },
      "com.example.q: a synchronous call waits for itself");
  SerialQueue idle("com.example.q");
  EXPECT_DEATH(idle.assertCurrent(), "runs outside it");
  EXPECT_DEATH(idle.resume(), "resumed more often than suspended");
}

TEST(SerialQueue, EndingRunsWhatWasHandedInAndDropsWhatIsSuspended) {
  std::atomic<int> ran = 0;
  const auto held = std::make_shared<int>(0);
  {
    SerialQueue queue("com.example.ending");
    for (int i = 0; i < 20; ++i) queue.async([&ran, held] { ++ran; });
    queue.async([&] {
      std::this_thread::sleep_for(30ms);  // until the end has begun
      queue.async([&] { ++ran; });
    });
  }
  EXPECT_EQ(ran, 21);
  {
    SerialQueue queue("com.example.ending");
    queue.suspend();
    queue.async([&ran, held] { ++ran; });
  }
  EXPECT_EQ(ran, 21);
  EXPECT_EQ(held.use_count(), 1);
}

TEST(SerialQueue, ManyThreadsNeverMeetOnItAndKeepTheirOrder) {
  constexpr size_t kThreads = 6;
  constexpr int kRounds = 300;
  SerialQueue queue("com.example.many");
  std::array<int, kThreads> rounds{};  // plain on purpose: the queue keeps its users apart
  std::vector<std::thread> threads;
  for (size_t thread = 0; thread < kThreads; ++thread) {
    threads.emplace_back([&, thread] {
      for (int round = 0; round < kRounds; ++round) {
        const auto work = [&rounds, thread, round] { EXPECT_EQ(rounds[thread]++, round); };
        if (round % 3 == 0) {
          queue.sync(work);
        } else {
          queue.async(work);
        }
        queue.suspend();
        queue.resume();
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  queue.sync([&] { EXPECT_EQ(std::accumulate(rounds.begin(), rounds.end(), 0), 6 * kRounds); });
}

}  // namespace
}  // namespace platform
