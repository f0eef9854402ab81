// The owner of a per-user tree attacks the daemon that works in it with root's rights: things that
// are no directories stand where directories should, before requests and during them. Requests are
// answered, and what lies outside the tree stays as it was.
#include <fcntl.h>
#include <fmt/format.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <sched.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <map>
#include <new>
#include <thread>

#include "Platform/ipc/SocketPath.h"
#include "Tests/Integration/ContainerState.h"
#include "Tests/Integration/Subprocess.h"
#include "Tests/Integration/Watchdog.h"

namespace fs = std::filesystem;
using platform::FileDescriptor;
using namespace std::chrono_literals;

namespace {

constexpr uid_t kMobile = 501;
constexpr uid_t kOther = 502;
constexpr char kHome[] = "/private/var/mobile";
constexpr char kOtherHome[] = "/private/var/users/other";
constexpr char kMetadataFile[] = "/.com.veltra.tessary.metadata.plist";
constexpr char kMemory[] = "/dev/shm";
constexpr char kApplication[] = "com.example.app";
constexpr char kOutside[] = "com.example.outside";
constexpr uint64_t kDone = 1;

// What a request may come to while its files are not what they should be: it was done, or the one
// step that could not be done is told. 40, an exception, is not among them.
constexpr uint64_t kSensible[] = {kDone, 5, 6, 7, 8, 9, 21, 34, 41, 43, 44, 45};

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

void giveAll(const std::string& tree, uid_t uid) {
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
    if (result) EXPECT_TRUE(result->path.starts_with(home())) << result->path;
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
      std::this_thread::sleep_for(2ms);
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

// --- Things in the way --------------------------------------------------------------------------

enum class Obstacle {
  link,
  linkBelowRoot,
  relativeLink,
  danglingLink,
  fifo,
  file,
  socket,
  mount,
  hugeFile,
  directory,
  leasedFile,
};

struct Place {
  const char* name;
  const char* path;  // below the home, or in the application's container
  // What still works while something else stands there.
  bool existing, created, transient;
};

constexpr char kContainer[] = "(container)";
constexpr char kMetadata[] = "(metadata)";

const Place kPlaces[] = {
    {"Containers", "Containers", false, false, false},
    {"Staging", "Containers/Staging", true, false, false},
    {"Transient", "Containers/Temp", true, true, false},
    {"Data", "Containers/Data", false, false, true},
    {"ClassDirectory", "Containers/Data/Application", false, false, true},
    {"Library", "Library/Tessary", true, true, true},
    {"Container", kContainer, false, true, true},
    {"MetadataFile", kMetadata, false, true, true},
};

class AttackInPlace : public Attack, public ::testing::WithParamInterface<Place> {
 protected:
  bool isMetadata() const { return GetParam().path == kMetadata; }

  std::vector<Obstacle> obstacles() const {
    using enum Obstacle;
    std::vector<Obstacle> list = {link, linkBelowRoot, relativeLink, danglingLink, fifo, socket};
    if (isMetadata()) {
      list.insert(list.end(), {hugeFile, directory, leasedFile});
    } else {
      list.push_back(file);
      if (mayMount_) list.push_back(mount);
    }
    return list;
  }

  std::string target() const {
    if (isMetadata()) return outside_ + kMetadataFile;
    return GetParam().path == kContainer ? outside_ : otherHome() + "/" + GetParam().path;
  }

  void put(Obstacle obstacle) {
    place_ = GetParam().path == kContainer ? container_
             : isMetadata()                ? container_ + kMetadataFile
                                           : home(GetParam().path);
    if (obstacle == Obstacle::mount) {
      ASSERT_EQ(::mount("none", place_.c_str(), "tmpfs", 0, "mode=0755,uid=501,gid=501"), 0);
      return;
    }
    fs::rename(place_, place_ + ".aside");
    const std::string link = target();
    switch (obstacle) {
      case Obstacle::link:
        return fs::create_symlink(link, place_);
      case Obstacle::linkBelowRoot:
        return fs::create_symlink(link.substr(device_->root().size()), place_);
      case Obstacle::relativeLink:
        return fs::create_symlink(fs::path(link).lexically_relative(fs::path(place_).parent_path()),
                                  place_);
      case Obstacle::danglingLink:
        return fs::create_symlink(link + "-that-is-not", place_);
      case Obstacle::fifo:
        ASSERT_EQ(::mkfifo(place_.c_str(), 0666), 0);
        return;
      case Obstacle::socket:
        ASSERT_TRUE(platform::ipc::listenAt(place_, SOCK_STREAM, 0666));
        return;
      case Obstacle::file:
        std::ofstream(place_) << "no directory";
        return;
      case Obstacle::hugeFile:
        std::ofstream(place_).flush();
        return fs::resize_file(place_, uint64_t{1} << 40U);
      case Obstacle::directory:
        ASSERT_TRUE(fs::create_directory(place_));
        return;
      case Obstacle::leasedFile:
        fs::copy_file(place_ + ".aside", place_);
        lease_ = FileDescriptor(::open(place_.c_str(), O_RDWR | O_CLOEXEC));
        // Who opens it otherwise than without waiting waits for 45 seconds.
        ::signal(SIGIO, SIG_IGN);
        ASSERT_EQ(::fcntl(lease_.get(), F_SETLEASE, F_WRLCK), 0);
        return;
      default:
        FAIL();
    }
  }

  void clear(Obstacle obstacle) {
    lease_.reset();
    if (obstacle == Obstacle::mount) {
      ASSERT_EQ(::umount2(place_.c_str(), MNT_DETACH), 0);
      return;
    }
    fs::remove(place_);
    fs::rename(place_ + ".aside", place_);
  }

  void expectAnswers(Obstacle obstacle) {
    tessary::Client client = connect();
    const Answers answers = askAll(client);
    if (obstacle == Obstacle::mount) return;  // an empty tree is as good as any
    const Place& place = GetParam();
    // Of one container: its identifier may stand for another one of an earlier case.
    const bool isTree = !isMetadata() && place.path != kContainer;
    if (isTree) EXPECT_EQ(answers.existing == kDone, place.existing) << answers.existing;
    EXPECT_EQ(answers.created == kDone, place.created) << answers.created;
    EXPECT_EQ(answers.transient == kDone, place.transient) << answers.transient;
  }

  std::string place_;
  FileDescriptor lease_;
};

TEST_P(AttackInPlace, IsAnsweredAndLeadsNowhere) {
  for (const Obstacle obstacle : obstacles()) {
    for (const bool isWarm : {true, false}) {
      SCOPED_TRACE(fmt::format("obstacle {}, {}", static_cast<int>(obstacle),
                               isWarm ? "with a warm cache" : "after a start"));
      ASSERT_NO_FATAL_FAILURE(warmUp());
      if (!isWarm) device_->stop();
      ASSERT_NO_FATAL_FAILURE(put(obstacle));
      if (!isWarm) ASSERT_NO_FATAL_FAILURE(device_->start());
      const Watchdog watchdog(*device_);
      expectAnswers(obstacle);
      EXPECT_TRUE(deathRowEmpties());
      EXPECT_EQ(victim_->changes(), "");
      ASSERT_NO_FATAL_FAILURE(clear(obstacle));
      expectService();
      if (HasFailure()) FAIL() << device_->daemonLog();
    }
  }
}

INSTANTIATE_TEST_SUITE_P(At, AttackInPlace, ::testing::ValuesIn(kPlaces),
                         [](const auto& info) { return std::string(info.param.name); });

// The old transient container is removed, and with it everything but what is mounted in it.
TEST_F(Attack, AMountInAContainerIsNotEntered) {
  if (!mayMount_) GTEST_SKIP() << "mounting is not permitted";
  const Watchdog watchdog(*device_);
  tessary::Client client = connect();
  const tessary::CreateOrLookupOptions anew{.createIfNecessary = true, .transient = true};
  const auto first = client.createOrLookup(kApplication, 2, anew);
  ASSERT_TRUE(first.has_value());
  const std::string inside = first->path + "/Library/Caches";
  ASSERT_EQ(::mount(otherHome().c_str(), inside.c_str(), nullptr, MS_BIND, nullptr), 0);
  ASSERT_EQ(code(client.createOrLookup(kApplication, 2, anew)), kDone);
  EXPECT_TRUE(deathRowEmpties());
  EXPECT_EQ(victim_->changes(), "");
  EXPECT_FALSE(fs::exists(first->path));
  expectService();
}

TEST_F(Attack, ALayoutPathThroughALinkIsNoHome) {
  device_->stop();
  device_->setPersonas({{"W", 101, "enterprise", std::string(kHome) + "/work/home", {}},
                        {"P", 100, "personal", {}, {}}});
  Caller worker = privilegedCaller();
  worker.persona = "W";
  const std::string work = home("work");
  for (const bool isLast : {false, true}) {
    fs::remove_all(work);
    if (isLast) {
      fs::create_directory(work);
      fs::create_symlink(otherHome(), work + "/home");
    } else {
      fs::create_symlink(otherHome(), work);
    }
    device_->start();
    const Watchdog watchdog(*device_);
    tessary::Client client = device_->connect(worker);
    for (int attempt = 0; attempt < 2; ++attempt) {
      const Answers answers = askAll(client);
      EXPECT_NE(answers.created, kDone);
      EXPECT_NE(answers.transient, kDone);
      EXPECT_NE(answers.list, kDone);
    }
    EXPECT_EQ(victim_->changes(), "");
    device_->stop();
  }
  fs::remove_all(work);
  device_->start();
  tessary::Client client = device_->connect(worker);
  const auto made = client.createOrLookup(kApplication, 2, {.createIfNecessary = true});
  ASSERT_TRUE(made.has_value());
  EXPECT_TRUE(made->path.starts_with(work + "/home/Containers/Data/Application/")) << made->path;
}

// --- Races --------------------------------------------------------------------------------------

constexpr std::chrono::milliseconds kRaceLength{1500};
constexpr unsigned kLengths = 16384;  // a period of the generator, too

void exchange(int directory, const char* first, const char* second) {
  ::renameat2(directory, first, directory, second, RENAME_EXCHANGE);
}

// Swaps a directory for a link and back, each for times of all lengths.
[[noreturn]] void raceForDirectory(const std::string& directory, std::atomic<uint64_t>& rounds) {
  const std::string link = directory + ".swap";
  for (unsigned length = 0;;) {
    exchange(AT_FDCWD, directory.c_str(), link.c_str());
    length = (length * 5 + 3) % kLengths;
    for (unsigned i = 0; i < length; ++i) ++rounds;
  }
}

// Swaps directories in transient containers for links, and pulls others out of them; the
// descriptor leads to the container when it is on death row as well.
[[noreturn]] void raceInContainers(const std::string& home, const std::string& target,
                                   std::atomic<uint64_t>& rounds) {
  constexpr int kRounds = 100;
  constexpr int kPairs = 32;
  std::vector<std::pair<std::string, std::string>> pairs;
  for (int i = 0; i < kPairs; ++i) {
    pairs.emplace_back(fmt::format("d{}", i), fmt::format("l{}", i));
  }
  const int outside = ::open(home.c_str(), O_PATH | O_DIRECTORY);
  for (;;) {
    std::error_code ignored;
    for (const auto& item :
         fs::directory_iterator(home + "/Containers/Temp/Data/Application", ignored)) {
      const FileDescriptor container(::open(item.path().c_str(), O_RDONLY | O_DIRECTORY));
      if (!container.valid()) continue;
      for (const auto& [directory, link] : pairs) {
        (void)::mkdirat(container.get(), directory.c_str(), 0755);
        (void)::symlinkat(target.c_str(), container.get(), link.c_str());
      }
      for (int i = 0; i < kRounds; ++i, ++rounds) {
        for (const auto& [directory, link] : pairs) {
          exchange(container.get(), directory.c_str(), link.c_str());
        }
        ::renameat(container.get(), "Library/Caches", outside, "caught");
        ::renameat(outside, "caught", container.get(), "Library/Caches");
      }
    }
  }
}

class AttackDuringRequests : public Attack, public ::testing::WithParamInterface<const char*> {
 protected:
  pid_t startRacer() {
    if (isInContainers()) {
      // Relative, and right on death row: an absolute link would lead through other mounts.
      const fs::path victim = otherHome() + "/Library";
      const fs::path link = victim.lexically_relative(device_->path(kDeathRow) + "/temp/container");
      return forkAsMobile([&] { raceInContainers(home(), link, *rounds_); });
    }
    const std::string directory = home(GetParam());
    fs::create_symlink(otherHome() + "/" + GetParam(), directory + ".swap");
    return forkAsMobile([&] { raceForDirectory(directory, *rounds_); });
  }

  template <typename Action>
  pid_t forkAsMobile(const Action& action) {
    const pid_t child = ::fork();
    if (child != 0) return child;
    if (::setgroups(0, nullptr) != 0 || ::setresgid(kMobile, kMobile, kMobile) != 0 ||
        ::setresuid(kMobile, kMobile, kMobile) != 0 || ::prctl(PR_SET_PDEATHSIG, SIGKILL) != 0) {
      ::_exit(1);
    }
    action();
    ::_exit(0);
  }

  void endRacer(pid_t racer) {
    ::kill(racer, SIGKILL);
    EXPECT_EQ(waitForExit(racer), 128 + SIGKILL);
    if (isInContainers()) return;
    const std::string directory = home(GetParam());
    if (fs::is_symlink(directory))
      exchange(AT_FDCWD, directory.c_str(), (directory + ".swap").c_str());
    fs::remove_all(directory + ".swap");
  }

  bool isInContainers() const { return GetParam()[0] == '\0'; }

  std::atomic<uint64_t>* rounds_ =
      new (::mmap(nullptr, sizeof(std::atomic<uint64_t>), PROT_READ | PROT_WRITE,
                  MAP_SHARED | MAP_ANONYMOUS, -1, 0)) std::atomic<uint64_t>(0);
};

TEST_P(AttackDuringRequests, LeadsNowhere) {
  tessary::Client creating = connect();
  tessary::Client replacing = connect();
  ASSERT_TRUE(creating.personaList() && replacing.personaList());
  const pid_t racer = startRacer();
  int done = 0;
  int requests = 0;
  {
    const Watchdog watchdog(*device_);
    const auto end = std::chrono::steady_clock::now() + kRaceLength;
    std::thread replacer([&] {
      while (std::chrono::steady_clock::now() < end) {
        (void)codeOf(replacing.createOrLookup(kApplication, 2,
                                              {.createIfNecessary = true, .transient = true}));
      }
    });
    while (std::chrono::steady_clock::now() < end) {
      const Answers answers = askAll(creating);
      ++requests;
      done += answers.created == kDone ? 1 : 0;
    }
    replacer.join();
    endRacer(racer);
    expectService();
    EXPECT_TRUE(deathRowEmpties());
  }
  EXPECT_GT(rounds_->load(), 100U);
  EXPECT_EQ(victim_->changes(), "");
  fmt::print("{:<36} {} of {} creations done\n", GetParam(), done, requests);
  if (HasFailure()) fmt::print("{}\n", device_->systemLog().substr(0, 4000));
}

INSTANTIATE_TEST_SUITE_P(OfADirectory, AttackDuringRequests,
                         ::testing::Values("Containers", "Containers/Staging", "Containers/Temp",
                                           "Containers/Data", "Containers/Data/Application",
                                           "Containers/Temp/Data/Application", ""),
                         [](const auto& info) {
                           std::string name = info.param[0] == '\0' ? "InContainers" : info.param;
                           std::erase(name, '/');
                           return name;
                         });

}  // namespace
