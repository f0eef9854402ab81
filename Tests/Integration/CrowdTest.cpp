// Many clients want the same few containers at once: everybody is given the same one of each.
#include <fmt/format.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <barrier>
#include <mutex>
#include <set>

#include "Tests/Integration/ContainerState.h"
#include "Tests/Integration/Watchdog.h"

namespace {

constexpr size_t kClients = 200;
constexpr size_t kTransientCreators = 16;

const Creation kCreations[] = {
    {2, "com.example.one"},  {2, "com.example.two"},      {2, "com.example.three"},
    {12, "com.example.one"}, {12, "com.veltra.exampled"}, {13, "systemgroup.com.veltra.palette"},
};

TEST(Crowd, IsGivenOneContainerOfEachIdentity) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root";
  Device device;
  device.start();
  const Watchdog watchdog(device);
  std::vector<tessary::Client> clients;
  // All of this process, with the rights of the first.
  clients.push_back(device.connect(privilegedCaller()));
  while (clients.size() < kClients) {
    auto client = tessary::Client::connect(device.root());
    ASSERT_TRUE(client);
    clients.push_back(std::move(*client));
  }
  const Creation transient{2, "com.example.one", /*transient=*/true};
  std::mutex mutex;
  std::set<std::string> told[std::size(kCreations)];
  int made[std::size(kCreations)] = {};
  std::set<std::string> transients;
  std::barrier start(kClients);
  const auto act = [&](size_t number) {
    start.arrive_and_wait();
    // A different order for each client; each creation is made and then looked up.
    for (size_t i = 0; i < std::size(kCreations); ++i) {
      const size_t which = (i + number) % std::size(kCreations);
      for (const bool again : {false, true}) {
        const auto found = again ? kCreations[which].lookUp(clients[number])
                                 : kCreations[which].request(clients[number]);
        const std::scoped_lock lock(mutex);
        ASSERT_TRUE(found) << kCreations[which].identifier << ": " << found.error().text;
        EXPECT_EQ(found->identifier, kCreations[which].identifier);
        told[which].insert(found->uuid.string() + " at " + found->path);
        if (!found->existed) ++made[which];
      }
    }
    // Of a transient one everybody gets his own, and the last one stays.
    if (number >= kTransientCreators) return;
    const auto found = transient.request(clients[number]);
    const std::scoped_lock lock(mutex);
    ASSERT_TRUE(found) << found.error().text;
    EXPECT_FALSE(found->existed);
    EXPECT_TRUE(transients.insert(found->uuid.string()).second);
  };
  {
    std::vector<std::jthread> threads;
    for (size_t number = 0; number < kClients; ++number) threads.emplace_back(act, number);
  }
  for (size_t which = 0; which < std::size(kCreations); ++which) {
    SCOPED_TRACE(fmt::format("{} of {}", kCreations[which].identifier, which));
    EXPECT_EQ(told[which].size(), 1U) << fmt::format("{}", fmt::join(told[which], "\n"));
    EXPECT_EQ(made[which], 1);
  }
  const std::pair<size_t, size_t> counts[] = {{0, 3}, {3, 2}, {5, 1}};
  for (const auto& [which, count] : counts) {
    EXPECT_EQ(itemsIn(device, kCreations[which].classDirectory()).size(), count);
    EXPECT_EQ(litterThatStays(device, kCreations[which]), "");
  }
  EXPECT_EQ(clients[0].containersOfClass(2)->size(), 3U);
  EXPECT_EQ(itemsIn(device, transient.classDirectory()).size(), 1U);
  const auto listed = clients[0].containersOfClass(2, /*transient=*/true);
  ASSERT_EQ(listed->size(), 1U);
  EXPECT_TRUE(transients.contains(listed->front().uuid.string()));
}

}  // namespace
