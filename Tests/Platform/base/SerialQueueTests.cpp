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

TEST(SerialQueue, WorkRunsInTheOrderInWhichItWasHandedIn) {
  SerialQueue queue("com.example.order");
  std::vector<int> order;  // the queue alone keeps its users apart
  const std::thread::id caller = std::this_thread::get_id();
  queue.suspend();
  for (int i = 0; i < 50; ++i) {
    queue.async([&order, i, caller] {
      EXPECT_NE(std::this_thread::get_id(), caller);
      order.push_back(i);
    });
  }
  queue.resume();
  // A synchronous caller waits for those before him and runs on his own thread.
  EXPECT_EQ(queue.sync([&] {
    EXPECT_EQ(std::this_thread::get_id(), caller);
    order.push_back(50);
    return order.size();
  }),
            51U);
  queue.async([&] { order.push_back(51); });
  queue.sync([] {});
  std::vector<int> expected(52);
  std::iota(expected.begin(), expected.end(), 0);
  EXPECT_EQ(order, expected);
}

TEST(SerialQueue, SuspensionsCountAndHoldBothKindsOfWork) {
  SerialQueue queue("com.example.suspension");
  std::atomic<int> ran = 0;
  queue.suspend();
  queue.suspend();
  queue.async([&] { ++ran; });
  auto waiting = std::async(std::launch::async, [&] { queue.sync([&] { ++ran; }); });
  EXPECT_EQ(waiting.wait_for(30ms), std::future_status::timeout);
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

TEST(SerialQueue, KnowsWhoIsOnIt) {
  SerialQueue outer("com.example.outer");
  SerialQueue inner("com.example.inner");
  EXPECT_FALSE(outer.isCurrent());
  outer.sync([&] {
    EXPECT_TRUE(outer.isCurrent());
    EXPECT_FALSE(inner.isCurrent());
    inner.sync([&] { EXPECT_TRUE(outer.isCurrent() && inner.isCurrent()); });
    EXPECT_FALSE(inner.isCurrent());
    EXPECT_TRUE(outer.isCurrent());
  });
  EXPECT_FALSE(outer.isCurrent());
  // Work of the queue's own thread may go on to another queue, and comes back.
  outer.async([&] {
    inner.sync([&] { outer.assertCurrent(); });
    outer.assertCurrent();
    EXPECT_FALSE(inner.isCurrent());
  });
  outer.sync([] {});
}

TEST(SerialQueueDeathTest, MisuseStopsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        SerialQueue queue("com.example.q");
        queue.sync([&] { queue.sync([] {}); });
      },
      "com.example.q: a synchronous call waits for itself");
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
  }
  EXPECT_EQ(ran, 20);
  {
    SerialQueue queue("com.example.ending");
    queue.suspend();
    queue.async([&ran, held] { ++ran; });
  }
  EXPECT_EQ(ran, 20);
  EXPECT_EQ(held.use_count(), 1);
  {
    const SerialQueue unused("com.example.unused");
  }
}

TEST(SerialQueue, ManyThreadsNeverMeetOnIt) {
  constexpr size_t kThreads = 6;
  constexpr int kRounds = 300;
  SerialQueue queue("com.example.many");
  std::array<int, kThreads> rounds{};  // plain on purpose: the queue keeps its users apart
  std::vector<std::thread> threads;
  for (size_t thread = 0; thread < kThreads; ++thread) {
    threads.emplace_back([&, thread] {
      for (int round = 0; round < kRounds; ++round) {
        // What one thread hands in stays in its order.
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

TEST(SerialQueue, WorkMayHandInMoreWorkWhileTheQueueEnds) {
  std::atomic<int> ran = 0;
  {
    SerialQueue queue("com.example.ending");
    queue.async([&] {
      std::this_thread::sleep_for(30ms);  // until the end has begun
      queue.async([&] { ++ran; });
    });
  }
  EXPECT_EQ(ran, 1);
}

}  // namespace
}  // namespace platform
