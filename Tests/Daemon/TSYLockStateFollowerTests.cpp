#include "Daemon/TSYLockStateFollower.h"

#include <gtest/gtest.h>

#include <future>

#include "Tests/Daemon/ContainerDevice.h"

namespace {

using namespace std::chrono_literals;

// The queue counts: one suspension too many and it never runs again, and one resumption too many
// ends the process. A state that comes twice, or is neither of the two, must do neither.
TEST(TSYLockStateFollower, theQueueStandsStillWhileTheDeviceIsLocked) {
  const ContainerDevice device;
  const platform::KeyBag& keyBag = platform::Platform::current().keyBag;
  const struct {
    std::vector<int> states;
    bool runs;
  } cases[] = {{{0}, true},       {{7, 0}, true},     {{1}, false},        {{1, 1}, false},
               {{1, 1, 0}, true}, {{1, 7}, false},    {{1, 7, 0}, true},   {{1, 1, 0, 0}, true},
               {{1, 0, 7}, true}, {{1, 0, 1}, false}, {{1, 0, 1, 0}, true}};
  for (const auto& [states, runs] : cases) {
    platform::SerialQueue queue("com.example.lock-state");
    TSYLockStateFollower follower(keyBag, queue);
    for (const int state : states) {
      ASSERT_TRUE(keyBag.setLockState(state));
      follower.lockStateDidChange();
    }
    const auto ran = std::make_shared<std::promise<void>>();
    queue.async([ran] { ran->set_value(); });
    EXPECT_EQ(ran->get_future().wait_for(runs ? 20s : 20ms) == std::future_status::ready, runs)
        << testing::PrintToString(states);
  }
}

}  // namespace
