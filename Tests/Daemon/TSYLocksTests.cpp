#include "Daemon/TSYLocks.h"

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <chrono>
#include <functional>
#include <future>
#include <random>
#include <thread>

#include "Tests/Daemon/ContainerDevice.h"

namespace {

using namespace std::chrono_literals;

const TSYIdentifiers kBoth = {"b", "a", "b"};

struct Lock {
  std::string name;
  std::function<void()> take;
  std::function<void()> release;
};
const Lock readA{"readA", [] { TSYLockIdentifierForReading("a"); },
                 [] { TSYUnlockIdentifier("a"); }};
const Lock writeA{"writeA", [] { TSYLockIdentifierForWriting("a"); }, readA.release};
const Lock readB{"readB", [] { TSYLockIdentifierForReading("b"); },
                 [] { TSYUnlockIdentifier("b"); }};
const Lock writeB{"writeB", [] { TSYLockIdentifierForWriting("b"); }, readB.release};
const Lock readAB{"readAB", [] { TSYLockIdentifiersForReading(kBoth); },
                  [] { TSYUnlockIdentifiers(kBoth); }};
const Lock writeAB{"writeAB", [] { TSYLockIdentifiersForWriting(kBoth); }, readAB.release};
const Lock readAll{"readAll", TSYLockAllIdentifiersForReading, TSYUnlockAllIdentifiers};
const Lock writeAll{"writeAll", TSYLockAllIdentifiersForWriting, TSYUnlockAllIdentifiers};

std::future<void> takenBySomebodyElse(const Lock& lock) {
  return std::async(std::launch::async, [&lock] {
    lock.take();
    lock.release();
  });
}

TEST(TSYLocks, whoWaitsForWhom) {
  const struct {
    const Lock& held;
    std::vector<const Lock*> proceeding;
    std::vector<const Lock*> waiting;
  } cases[] = {
      {readA, {&readA, &writeB, &readAB, &readAll}, {&writeA, &writeAB, &writeAll}},
      {writeA, {&readB, &writeB}, {&readA, &writeA, &readAB, &writeAB, &readAll, &writeAll}},
      {readAB, {&readA, &readB, &readAll}, {&writeA, &writeB, &writeAll}},
      {readAll, {&readA, &readAB, &readAll}, {&writeA, &writeAB, &writeAll}},
      {writeAll, {}, {&readA, &writeA, &readAB, &writeAB, &readAll, &writeAll}}};
  for (const auto& test : cases) {
    test.held.take();
    for (const Lock* wanted : test.proceeding) {
      EXPECT_EQ(takenBySomebodyElse(*wanted).wait_for(20s), std::future_status::ready)
          << wanted->name << " beside " << test.held.name;
    }
    for (const Lock* wanted : test.waiting) {
      auto taken = takenBySomebodyElse(*wanted);
      EXPECT_EQ(taken.wait_for(20ms), std::future_status::timeout)
          << wanted->name << " beside " << test.held.name;
      test.held.release();
      EXPECT_EQ(taken.wait_for(20s), std::future_status::ready) << "woken by " << test.held.name;
      test.held.take();
    }
    test.held.release();
  }
}

// Each container is a plain number that its writers change and its readers look at.
TEST(TSYLocks, manyThreadsAtOnceKeepTheRules) {
  std::array<int, 3> values{};
  std::atomic<int> changes = 0;
  std::atomic<int> wrong = 0;
  const auto change = [&](std::initializer_list<size_t> names) {
    for (const size_t i : names) {
      const int before = values[i];
      std::this_thread::yield();
      values[i] = before + 1;
      ++changes;
    }
  };
  const auto look = [&](size_t i) {
    const int before = values[i];
    std::this_thread::yield();
    if (values[i] != before) ++wrong;
  };
  const auto work = [&](unsigned seed) {
    std::minstd_rand random(seed);
    for (int round = 0; round < 600; ++round) {
      const size_t i = random() % 3;
      const TSYIdentifiers identifiers = {std::to_string(i), "0"};
      const unsigned choice = random() % 8;
      if (choice == 0) {
        const TSYAllIdentifiersLock lock(TSYLockMode::writing, /*useLocking=*/true);
        change({0, 1, 2});
      } else if (choice == 1) {
        const TSYAllIdentifiersLock lock(TSYLockMode::reading, /*useLocking=*/true);
        for (const size_t each : {0U, 1U, 2U}) look(each);
      } else if (choice < 5) {
        TSYLockIdentifiersForWriting(identifiers);
        change({0, i});
        TSYUnlockIdentifiers(identifiers);
      } else {
        TSYLockIdentifierForReading(identifiers[0]);
        look(i);
        TSYUnlockIdentifier(identifiers[0]);
      }
    }
  };
  std::vector<std::thread> threads;
  for (unsigned seed = 1; seed <= 6; ++seed) threads.emplace_back(work, seed);
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(wrong, 0);
  EXPECT_EQ(values[0] + values[1] + values[2], changes);
  TSYLockAllIdentifiersForWriting();  // nothing is held any more
  TSYUnlockAllIdentifiers();
}

TEST(TSYLocksDeathTest, callsThatAreNotPairedStopTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  const auto twice = [](const Lock& lock) {
    lock.take();
    lock.release();
    lock.release();
  };
  const std::string noRecord = lastWords("identifierToLockMap");
  const std::string noGlobalLock = lastWords("allReaderWriterState > 0");
  EXPECT_DEATH(readA.release(), noRecord);
  EXPECT_DEATH(readAll.release(), noGlobalLock);
  EXPECT_DEATH(twice(readA), noRecord);
  EXPECT_DEATH(twice(writeAB), noRecord);
  EXPECT_DEATH(twice(writeAll), noGlobalLock);
}

}  // namespace
