#include "Platform/os/RunLoop.h"

#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <thread>
#include <vector>

#include "Platform/os/Notifications.h"
#include "Tests/Platform/os/TestRoot.h"

namespace platform {
namespace {

TEST(RunLoop, RunsTheMainQueueInOrderOnTheMainThread) {
  RunLoop loop;
  const auto mainThread = std::this_thread::get_id();
  std::vector<int> order;
  std::thread other([&] {
    for (int i = 0; i < 100; ++i) {
      loop.async([&, i] {
        EXPECT_EQ(std::this_thread::get_id(), mainThread);
        order.push_back(i);
      });
    }
    loop.async([&] {
      loop.async([&] { loop.stop(); });  // what work adds comes after it
      order.push_back(100);
    });
  });
  loop.run();
  other.join();
  ASSERT_EQ(order.size(), 101U);
  EXPECT_TRUE(std::ranges::is_sorted(order));
}

TEST(RunLoop, DeliversSignalsTimersAndDescriptors) {
  RunLoop loop;
  int ends[2];
  ASSERT_EQ(::pipe(ends), 0);
  std::vector<std::string> seen;
  ASSERT_TRUE(loop.watchSignal(SIGUSR1, [&] {
    seen.emplace_back("signal");
    EXPECT_EQ(::write(ends[1], "x", 1), 1);
  }));
  ASSERT_TRUE(loop.watchDescriptor(ends[0], [&] {
    char byte = 0;
    EXPECT_EQ(::read(ends[0], &byte, 1), 1);
    seen.emplace_back("descriptor");
  }));
  EXPECT_EQ(loop.watchDescriptor(ends[0], [] {}).error().value, EEXIST);
  ASSERT_TRUE(loop.every(1, [&] {
    seen.emplace_back("timer");
    if (seen.size() >= 4) loop.stop();
  }));
  EXPECT_EQ(loop.every(0, [] {}).error().value, EINVAL);
  ::kill(::getpid(), SIGUSR1);
  loop.run();
  EXPECT_EQ(seen, (std::vector<std::string>{"signal", "descriptor", "timer", "timer"}));
}

TEST(RunLoop, SeesFilesWrittenRenamedAndRemoved) {
  TestRoot root;
  RunLoop loop;
  std::vector<std::string> seen;
  const auto directory = root.path("etc/tessary");
  ASSERT_TRUE(loop.watchFile(directory, "file", [&] { seen.emplace_back("file"); }));
  ASSERT_TRUE(loop.watchFile(directory, "fil", [&] { seen.emplace_back("fil"); }));
  EXPECT_EQ(loop.watchFile(root.path("nowhere"), "file", [] {}).error().value, ENOENT);
  // Each step is seen before the next one is taken.
  std::vector<std::function<void()>> steps{
      [&] { root.write("etc/tessary/file", "1"); },
      [&] { root.replace("etc/tessary/file", Value(2)); },
      [&] { root.write("etc/tessary/other", "not watched"); },
      [&] { std::filesystem::remove(directory + "/file"); },
  };
  std::thread other([&] {
    for (const auto& step : steps) {
      step();
      ::usleep(50'000);
    }
    loop.stop();
  });
  loop.run();
  other.join();
  EXPECT_EQ(seen, std::vector<std::string>(3, "file"));
}

TEST(Notifications, ReachObserversAndLoseNoPost) {
  TestRoot root;
  RunLoop loop;
  const Notifications notifications(root.files(), &loop);
  const Notifications poster(root.files(), /*loop=*/nullptr);
  EXPECT_EQ(poster.observe("name", [] {}), static_cast<uint32_t>(ENOTSUP));
  ASSERT_EQ(notifications.observe("../name", [&] { loop.stop(); }), Notifications::kStatusOK);
  std::vector<std::thread> threads;
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([&] {
      for (int j = 0; j < 25; ++j) EXPECT_EQ(poster.post("../name"), Notifications::kStatusOK);
    });
  }
  loop.run();
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(root.read("run/tessary/notifications/%2E.%2Fname"), "100\n");
  root.write("run/tessary/notifications/broken", "many");
  EXPECT_EQ(poster.post("broken"), Notifications::kStatusOK);
  EXPECT_EQ(root.read("run/tessary/notifications/broken"), "1\n");
}

}  // namespace
}  // namespace platform
