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

enum class Lock { readA, writeA, readB, writeB, readAB, writeAB, readAll, writeAll, nothing };

void take(Lock lock) {
  switch (lock) {
    case Lock::readA:
      return TSYLockIdentifierForReading("a");
    case Lock::writeA:
      return TSYLockIdentifierForWriting("a");
    case Lock::readB:
      return TSYLockIdentifierForReading("b");
    case Lock::writeB:
      return TSYLockIdentifierForWriting("b");
    case Lock::readAB:
      return TSYLockIdentifiersForReading({"b", "a", "b"});
    case Lock::writeAB:
      return TSYLockIdentifiersForWriting({"b", "a", "b"});
    case Lock::readAll:
      return TSYLockAllIdentifiersForReading();
    case Lock::writeAll:
      return TSYLockAllIdentifiersForWriting();
    case Lock::nothing:
      return;
  }
}

void release(Lock lock) {
  switch (lock) {
    case Lock::readA:
    case Lock::writeA:
      return TSYUnlockIdentifier("a");
    case Lock::readB:
    case Lock::writeB:
      return TSYUnlockIdentifier("b");
    case Lock::readAB:
    case Lock::writeAB:
      return TSYUnlockIdentifiers({"b", "a", "b"});
    case Lock::readAll:
    case Lock::writeAll:
      return TSYUnlockAllIdentifiers();
    case Lock::nothing:
      return;
  }
}

TEST(TSYLocks, whoWaitsForWhom) {
  using enum Lock;
  const struct {
    Lock held;
    std::vector<Lock> proceeding;
    std::vector<Lock> waiting;
  } cases[] = {
      {nothing, {readA, writeA, readAB, writeAB, readAll, writeAll}, {}},
      {readA, {readA, writeB, readAB, readAll}, {writeA, writeAB, writeAll}},
      {writeA, {readB, writeB}, {readA, writeA, readAB, writeAB, readAll, writeAll}},
      {readAB, {readA, readB, readAll}, {writeA, writeB, writeAll}},
      {readAll, {readA, readAB, readAll}, {writeA, writeAB, writeAll}},
      {writeAll, {}, {readA, writeA, readAB, writeAB, readAll, writeAll}},
  };
  const auto takenBySomebodyElse = [](Lock lock) {
    return std::async(std::launch::async, [lock] {
      take(lock);
      release(lock);
    });
  };
  for (const auto& test : cases) {
    const auto held = static_cast<int>(test.held);
    take(test.held);
    for (const Lock wanted : test.proceeding) {
      EXPECT_EQ(takenBySomebodyElse(wanted).wait_for(20s), std::future_status::ready)
          << static_cast<int>(wanted) << " beside " << held;
    }
    for (const Lock wanted : test.waiting) {
      auto taken = takenBySomebodyElse(wanted);
      EXPECT_EQ(taken.wait_for(20ms), std::future_status::timeout)
          << static_cast<int>(wanted) << " beside " << held;
      release(test.held);
      EXPECT_EQ(taken.wait_for(20s), std::future_status::ready) << "woken by " << held;
      take(test.held);
    }
    release(test.held);
  }
}

TEST(TSYLocks, severalWaitersOfEveryKindAreAllWoken) {
  for (const Lock held : {Lock::writeAll, Lock::writeA}) {
    take(held);
    std::vector<std::future<void>> waiters;
    for (const Lock wanted : {Lock::writeAll, Lock::readAll, Lock::writeAll, Lock::readA,
                              Lock::writeA, Lock::readAB, Lock::writeAB, Lock::readAll}) {
      waiters.push_back(std::async(std::launch::async, [wanted] {
        take(wanted);
        release(wanted);
      }));
    }
    std::this_thread::sleep_for(30ms);
    release(held);
    for (auto& waiter : waiters) EXPECT_EQ(waiter.wait_for(20s), std::future_status::ready);
  }
}

TEST(TSYLocks, arraysAreTakenInOrderAndOnce) {
  const ContainerDevice device;
  TSYLockIdentifiersForWriting({"b", "a", "b", "a\xff", "B"});
  TSYUnlockIdentifiers({"b", "a", "b", "a\xff", "B"});
  TSYLockIdentifiersForReading({});
  TSYUnlockIdentifiers({});
  std::istringstream lines(device.log());
  std::vector<std::string> events;
  for (std::string line; std::getline(lines, line);) {
    const size_t got = line.find("Got lock on identifier ");
    const size_t unlocked = line.find("Unlocked identifier ");
    if (got != std::string::npos) events.push_back("+" + line.substr(got + 23));
    if (unlocked != std::string::npos) events.push_back("-" + line.substr(unlocked + 20));
  }
  EXPECT_EQ(events,
            (std::vector<std::string>{"+B", "+a", "+a\xff", "+b", "-b", "-a\xff", "-a", "-B"}));
  EXPECT_EQ(device.countInLog("Destroying lock for identifier"), 4U);
}

TEST(TSYLocks, aScopeThatWasToldNotToLockLocksNothing) {
  using Mode = TSYAllIdentifiersLock::Mode;
  const TSYAllIdentifiersLock none(Mode::writing, /*useLocking=*/false);
  {
    const TSYAllIdentifiersLock reading(Mode::reading, /*useLocking=*/true);
    const TSYAllIdentifiersLock again(Mode::reading, /*useLocking=*/true);
  }
  const TSYAllIdentifiersLock writing(Mode::writing, /*useLocking=*/true);
}

// Each container is a plain number that its writers change and its readers look at.
TEST(TSYLocks, manyThreadsAtOnceKeepTheRules) {
  const std::vector<std::string> names = {"one", "two", "three"};
  std::array<int, 3> values{};
  std::array<std::atomic<int>, 3> writes{};
  const auto change = [&](size_t i) {
    const int before = values[i];
    std::this_thread::yield();
    values[i] = before + 1;
    ++writes[i];
  };
  std::atomic<int> wrong = 0;
  const auto look = [&](size_t i) {
    const int before = values[i];
    std::this_thread::yield();
    if (values[i] != before) ++wrong;
  };
  const auto work = [&](unsigned seed) {
    std::minstd_rand random(seed);
    for (int round = 0; round < 600; ++round) {
      const size_t i = random() % 3;
      switch (random() % 8) {
        case 0:
          TSYLockAllIdentifiersForWriting();
          for (size_t all = 0; all < 3; ++all) change(all);
          TSYUnlockAllIdentifiers();
          break;
        case 1:
          TSYLockAllIdentifiersForReading();
          for (size_t all = 0; all < 3; ++all) look(all);
          TSYUnlockAllIdentifiers();
          break;
        case 2:
          TSYLockIdentifiersForWriting({names[i], names[0]});
          change(i);
          if (i != 0) change(0);
          TSYUnlockIdentifiers({names[i], names[0]});
          break;
        case 3:
        case 4:
          TSYLockIdentifierForWriting(names[i]);
          change(i);
          TSYUnlockIdentifier(names[i]);
          break;
        default:
          TSYLockIdentifierForReading(names[i]);
          look(i);
          TSYUnlockIdentifier(names[i]);
      }
    }
  };
  std::vector<std::thread> threads;
  for (unsigned seed = 1; seed <= 6; ++seed) threads.emplace_back(work, seed);
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(wrong, 0);
  for (size_t i = 0; i < 3; ++i) EXPECT_EQ(values[i], writes[i]);
  TSYLockAllIdentifiersForWriting();  // nothing is held any more
  TSYUnlockAllIdentifiers();
}

TEST(TSYLocksDeathTest, callsThatAreNotPairedStopTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  const struct {
    std::function<void()> calls;
    std::string invariant;
  } cases[] = {
      {[] { TSYUnlockIdentifier("a"); }, "identifierToLockMap"},
      {[] { TSYUnlockAllIdentifiers(); }, "allReaderWriterState > 0"},
      {[] {
         take(Lock::readA);
         release(Lock::readA);
         release(Lock::readA);
       },
       "identifierToLockMap"},
      {[] {
         take(Lock::writeA);
         release(Lock::readB);
       },
       "identifierToLockMap"},
      {[] {
         take(Lock::readAll);
         release(Lock::readAll);
         release(Lock::readAll);
       },
       "allReaderWriterState > 0"},
  };
  for (const auto& test : cases) EXPECT_DEATH(test.calls(), lastWords(test.invariant));
}

}  // namespace
