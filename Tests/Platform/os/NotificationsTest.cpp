#include "Platform/os/Notifications.h"

#include <thread>
#include <vector>

#include "Platform/os/RunLoop.h"
#include "Tests/Platform/os/TestRoot.h"

namespace platform {
namespace {

TEST(Notifications, ReachObserversAndLoseNoPost) {
  TestRoot root;
  RunLoop loop;
  const Notifications notifications(root.files(), &loop);
  const Notifications poster(root.files(), /*loop=*/nullptr);
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
