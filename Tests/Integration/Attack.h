// A device one of whose users attacks the daemon that works in his tree with root's rights, and
// what lies outside that tree: another user's home, with containers that the daemon would take for
// the attacker's own if a link led it there.
#pragma once

#include <fmt/format.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <map>
#include <thread>

#include "Tests/Integration/ContainerState.h"
#include "Tests/Integration/Subprocess.h"
#include "Tests/Integration/Watchdog.h"

namespace fs = std::filesystem;

inline constexpr uid_t kMobile = 501;
inline constexpr uid_t kOther = 502;
inline constexpr char kHome[] = "/private/var/mobile";
inline constexpr char kOtherHome[] = "/private/var/users/other";
inline constexpr char kMetadataFile[] = "/.com.veltra.tessary.metadata.plist";
inline constexpr char kMemory[] = "/dev/shm";
inline constexpr char kApplication[] = "com.example.app";
inline constexpr char kOutside[] = "com.example.outside";
inline constexpr uint64_t kDone = 1;

// What a request may come to while its files are not what they should be: it was done, or the one
// step that could not be done is told. 40, an exception, is not among them.
inline constexpr uint64_t kSensible[] = {kDone, 5, 6, 7, 8, 9, 21, 34, 41, 43, 44, 45};

// A tree that nobody may create, change, give away, remove or read anything in.
class Untouched {
 public:
  explicit Untouched(std::string path) : path_(std::move(path)) { record(); }

  // What has happened since the last time; empty for nothing.
  std::string changes() {
    std::string text;
    // Before the directories are read here.
    for (const auto& [path, look] : looks_) {
      const std::string now = lookOf(path);
      if (now != look) text += fmt::format("{} was {} and is {}\n", path, look, now);
    }
    for (const std::string& path : items()) {
      if (!looks_.contains(path)) text += path + " has come\n";
    }
    record();
    return text;
  }

 private:
  std::vector<std::string> items() const {
    std::vector<std::string> paths{path_};
    for (const auto& item : fs::recursive_directory_iterator(path_)) {
      paths.push_back(item.path());
    }
    return paths;
  }

  // Any change of an item changes its ctime, and reading an item that was read before it was last
  // written changes its atime.
  static std::string lookOf(const std::string& path) {
    struct stat status{};
    if (::lstat(path.c_str(), &status) != 0) return "gone";
    const auto text = [](const timespec& time) {
      return fmt::format("{}.{:09}", time.tv_sec, time.tv_nsec);
    };
    return fmt::format("({:o} {}:{} {} bytes, modified {}, changed {}, read {})", status.st_mode,
                       status.st_uid, status.st_gid, status.st_size, text(status.st_mtim),
                       text(status.st_ctim), text(status.st_atim));
  }

  void record() {
    looks_.clear();
    for (const std::string& path : items()) {
      const timespec times[] = {{.tv_sec = 1, .tv_nsec = 0}, {.tv_sec = 0, .tv_nsec = UTIME_OMIT}};
      ::utimensat(AT_FDCWD, path.c_str(), times, AT_SYMLINK_NOFOLLOW);
      looks_.emplace(path, "");
    }
    for (auto& [path, look] : looks_) look = lookOf(path);
  }

  const std::string path_;
  std::map<std::string, std::string> looks_;
};

inline void giveAll(const std::string& tree, uid_t uid) {
  EXPECT_EQ(::lchown(tree.c_str(), uid, uid), 0);
  for (const auto& item : fs::recursive_directory_iterator(tree)) {
    EXPECT_EQ(::lchown(item.path().c_str(), uid, uid), 0);
  }
}

class Attack : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "processes of several users are needed";
    mayMount_ = ::unshare(CLONE_NEWNS) == 0 &&
                ::mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0;
    // In memory, where a creation does not wait for the disk, there are more of them in a race.
    device_.emplace(fs::is_directory(kMemory) ? kMemory : "");
    ASSERT_EQ(runToEnd({Device::program("tessary-platform"), "--root", device_->root(), "init",
                        "--user", "other:502"})
                  .exitStatus,
              0);
    makeVictim();
    device_->start();
    warmUp();
    fs::create_directories(home("Library/Tessary"));
    giveAll(home(), kMobile);
  }

  std::string home(const std::string& path = {}) const {
    return device_->path(kHome) + (path.empty() ? "" : "/" + path);
  }
  std::string otherHome() const { return device_->path(kOtherHome); }

  tessary::Client connect() const { return device_->connect(privilegedCaller()); }

  // Containers that the daemon itself made, and would take for its own if a link led it there.
  void makeVictim() {
    device_->start();
    tessary::Client client = connect();
    for (const bool transient : {false, true}) {
      const auto made =
          client.createOrLookup(kOutside, 2, {.createIfNecessary = true, .transient = transient});
      ASSERT_TRUE(made.has_value());
      if (!transient) outside_ = otherHome() + made->path.substr(home().size());
    }
    device_->stop();
    fs::rename(home("Containers"), otherHome() + "/Containers");
    fs::create_directories(otherHome() + "/Library/Tessary");
    fs::create_directories(otherHome() + "/Library/Caches/deep");
    std::ofstream(otherHome() + "/Library/Caches/deep/note") << "mine";
    giveAll(otherHome(), kOther);
    victim_.emplace(otherHome());
  }

  void warmUp() {
    tessary::Client client = connect();
    const auto made = client.createOrLookup(kApplication, 2, {.createIfNecessary = true});
    ASSERT_TRUE(made.has_value()) << made.error().code;
    container_ = made->path;
    ASSERT_EQ(code(client.createOrLookup(kApplication, 2,
                                         {.createIfNecessary = true, .transient = true})),
              kDone);
  }

  template <typename T>
  static uint64_t code(const tessary::Result<T>& result) {
    return result ? kDone : result.error().code;
  }

  struct Answers {
    uint64_t existing, created, transient, list;
  };

  // Everything that a client can ask for of this user's containers of one class.
  Answers askAll(tessary::Client& client) {
    Answers answers{};
    answers.existing = codeOf(client.createOrLookup(kApplication, 2));
    answers.created = codeOf(client.createOrLookup(fmt::format("com.example.new{}", ++created_), 2,
                                                   {.createIfNecessary = true}));
    answers.transient = codeOf(
        client.createOrLookup(kApplication, 2, {.createIfNecessary = true, .transient = true}));
    for (const bool transient : {true, false}) {
      const auto listed = client.containersOfClass(2, transient);
      answers.list = code(listed);
      EXPECT_TRUE(std::ranges::count(kSensible, answers.list)) << answers.list;
      if (!listed) continue;
      for (const auto& container : *listed) EXPECT_NE(container.identifier, kOutside);
    }
    return answers;
  }

  uint64_t codeOf(const tessary::Result<tessary::Container>& result) const {
    if (result) {
      EXPECT_TRUE(result->path.starts_with(home())) << result->path;
    }
    EXPECT_TRUE(std::ranges::count(kSensible, code(result)))
        << code(result) << (result ? "" : result.error().text);
    return code(result);
  }

  // Once everything is in order again. The first requests may find that containers have gone.
  void expectService() {
    tessary::Client client = connect();
    Answers answers{};
    for (int attempt = 0; attempt < 2; ++attempt) {
      (void)client.createOrLookup(kApplication, 2, {.createIfNecessary = true});
      answers = askAll(client);
    }
    EXPECT_EQ(answers.existing, kDone);
    EXPECT_EQ(answers.created, kDone);
    EXPECT_EQ(answers.transient, kDone);
    EXPECT_EQ(answers.list, kDone);
  }

  bool deathRowEmpties() const {
    const auto deadline = std::chrono::steady_clock::now() + Watchdog::kPatience;
    while (!itemsIn(*device_, kDeathRow).empty()) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    return true;
  }

  bool mayMount_ = false;
  std::optional<Device> device_;
  std::optional<Untouched> victim_;
  std::string outside_;    // a container of the victim
  std::string container_;  // the application's
  int created_ = 0;
};
