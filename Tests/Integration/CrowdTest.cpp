// Many clients want the same few containers at once: everybody is given the same one, and who
// creates is not kept waiting by those who look up.
#include <fmt/format.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <barrier>
#include <chrono>
#include <map>
#include <mutex>
#include <set>
#include <thread>

#include "Tests/Integration/ContainerState.h"
#include "Tests/Integration/Watchdog.h"

namespace {

constexpr int kThreads = 200;
constexpr int kProcesses = 8;
constexpr int kReaders = 64;
constexpr int kWriters = 10;

struct Identity {
  uint64_t containerClass;
  std::string identifier;

  auto operator<=>(const Identity&) const = default;
};

const Identity kIdentities[] = {
    {1, "com.example.one"}, {2, "com.example.one"},      {2, "com.example.two"},
    {7, "com.example.one"}, {12, "com.veltra.exampled"}, {12, "com.example.one"},
    {2, "com.example.six"}, {4, "com.example.one"},      {13, "systemgroup.com.veltra.palette"},
};

constexpr const char* kClassDirectories[] = {
    "/private/var/containers/Bundle/Application",
    "/private/var/mobile/Containers/Data/Application",
    "/private/var/mobile/Containers/Data/ModulinePlugin",
    "/private/var/mobile/Containers/Shared/AppGroup",
    "/private/var/containers/Data/System",
    "/private/var/containers/Shared/SystemGroup",
};

// What everybody was told. Any thread.
class Answered {
 public:
  void add(const Identity& identity, const std::string& uuid, const std::string& path,
           bool existed) {
    const std::scoped_lock lock(mutex_);
    told_[identity].insert(uuid + " at " + path);
    if (!existed) ++made_[identity];
  }

  void expectOneOfEach() {
    for (const Identity& identity : kIdentities) {
      SCOPED_TRACE(fmt::format("{} of class {}", identity.identifier, identity.containerClass));
      EXPECT_EQ(told_[identity].size(), 1U) << fmt::format("{}", fmt::join(told_[identity], "\n"));
      EXPECT_EQ(made_[identity], 1);
    }
  }

 private:
  std::mutex mutex_;
  std::map<Identity, std::set<std::string>> told_;
  std::map<Identity, int> made_;
};

// Runs `action(number)` on many threads that begin together.
template <typename Action>
std::vector<std::jthread> together(std::barrier<>& start, int count, Action action) {
  std::vector<std::jthread> threads;
  for (int number = 0; number < count; ++number) {
    threads.emplace_back([&start, action, number] {
      start.arrive_and_wait();
      action(number);
    });
  }
  return threads;
}

// A different order for each number, each identity twice.
template <typename Action>
void forEachIdentity(int number, Action action) {
  const size_t count = std::size(kIdentities);
  for (size_t i = 0; i < 2 * count; ++i) {
    action(kIdentities[(i + static_cast<size_t>(number)) % count]);
  }
}

class Crowd : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "processes of several users are needed";
    device_.emplace();
    device_->start();
  }

  // Connections that were accepted with the rights to ask for everything.
  std::vector<tessary::Client> connect(int count) const {
    std::vector<tessary::Client> clients;
    clients.push_back(device_->connect(privilegedCaller()));
    while (clients.size() < static_cast<size_t>(count)) {
      auto client = tessary::Client::connect(device_->root());
      EXPECT_TRUE(client.has_value());
      clients.push_back(std::move(*client));
    }
    return clients;
  }

  std::optional<Device> device_;
};

TEST_F(Crowd, IsGivenOneContainerOfEachIdentity) {
  const Watchdog watchdog(*device_);
  std::vector<tessary::Client> clients = connect(kThreads);
  Answered answered;
  std::barrier start(kThreads + kProcesses);
  {
    const auto threads = together(start, kThreads, [&](int number) {
      forEachIdentity(number, [&](const Identity& identity) {
        const auto found = clients[static_cast<size_t>(number)].createOrLookup(
            identity.identifier, identity.containerClass, {.createIfNecessary = true});
        if (!found) {
          ADD_FAILURE() << identity.identifier << ": " << found.error().text;
          return;
        }
        EXPECT_EQ(found->identifier, identity.identifier);
        answered.add(identity, found->uuid.string(), found->path, found->existed);
      });
    });
    const auto processes = together(start, kProcesses, [&](int number) {
      Caller caller = privilegedCaller();
      caller.identifier = fmt::format("com.example.process{}", number);
      forEachIdentity(number, [&](const Identity& identity) {
        const Answer answer = device_->create(caller, identity.identifier, identity.containerClass);
        if (answer.code != 1) {
          ADD_FAILURE() << identity.identifier << ": " << answer.errors;
          return;
        }
        answered.add(identity, answer.text("uuid"), answer.text("path"),
                     answer.json.at("existed").get<bool>());
      });
    });
  }
  answered.expectOneOfEach();

  size_t onDisk = 0;
  for (const char* directory : kClassDirectories) onDisk += itemsIn(*device_, directory).size();
  EXPECT_EQ(onDisk, std::size(kIdentities));
  EXPECT_EQ(clients[0].containersOfClass(2)->size(), 3U);
  EXPECT_EQ(litterThatStays(*device_, {.containerClass = 2}), "");
  EXPECT_EQ(litterThatStays(*device_, {.containerClass = 12}), "");
}

// Of a transient identity everybody gets a new container, and the last one stays.
TEST_F(Crowd, LeavesOneTransientContainer) {
  constexpr int kCreators = 16;
  const Watchdog watchdog(*device_);
  std::vector<tessary::Client> clients = connect(kCreators);
  const Creation creation{.containerClass = 2, .identifier = "com.example.app", .transient = true};
  std::mutex mutex;
  std::set<std::string> uuids;
  std::barrier start(kCreators);
  together(start, kCreators, [&](int number) {
    const auto made = creation.request(clients[static_cast<size_t>(number)]);
    const std::scoped_lock lock(mutex);
    ASSERT_TRUE(made.has_value()) << made.error().text;
    EXPECT_FALSE(made->existed);
    EXPECT_TRUE(uuids.insert(made->uuid.string()).second);
  }).clear();
  EXPECT_EQ(itemsIn(*device_, creation.classDirectory()).size(), 1U);
  const auto listed = clients[0].containersOfClass(2, /*transient=*/true);
  ASSERT_EQ(listed->size(), 1U);
  EXPECT_TRUE(uuids.contains(listed->front().uuid.string()));
  EXPECT_EQ(litterThatStays(*device_, creation), "");
}

TEST_F(Crowd, OfReadersLetsWritersThrough) {
  constexpr std::chrono::seconds kLongest{10};
  const Watchdog watchdog(*device_);
  std::vector<tessary::Client> readers = connect(kReaders);
  tessary::Client writer = std::move(connect(1).front());
  ASSERT_TRUE(Creation{}.request(writer).has_value());

  std::atomic<bool> isOver = false;
  std::atomic<uint64_t> lookups = 0;
  std::barrier start(kReaders + 1);
  auto threads = together(start, kReaders, [&](int number) {
    while (!isOver) {
      if (!Creation{}.lookUp(readers[static_cast<size_t>(number)])) ADD_FAILURE();
      ++lookups;
    }
  });
  start.arrive_and_wait();
  const auto begin = std::chrono::steady_clock::now();
  std::chrono::duration<double> longest{0};
  for (int i = 0; i < kWriters; ++i) {
    const auto asked = std::chrono::steady_clock::now();
    const Creation creation{.containerClass = 2, .identifier = fmt::format("com.example.new{}", i)};
    EXPECT_TRUE(creation.request(writer).has_value());
    longest =
        std::max<std::chrono::duration<double>>(longest, std::chrono::steady_clock::now() - asked);
  }
  const std::chrono::duration<double> whole = std::chrono::steady_clock::now() - begin;
  isOver = true;
  threads.clear();
  EXPECT_LT(longest, kLongest);
  fmt::print(
      "{} creations beside {} readers: {:.1f} ms each, {:.1f} ms at most; {:.0f} lookups/s\n",
      kWriters, kReaders, whole.count() * 1000 / kWriters, longest.count() * 1000,
      static_cast<double>(lookups) / whole.count());
}

}  // namespace
