// A user attacks the daemon that works in his tree with root's rights: things that are no
// directories stand where directories should be, or come there during requests. Requests are
// answered, and nothing outside the tree is touched: there is another user's home, with containers
// that the daemon would take for the attacker's own if a link led it there.
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
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <new>
#include <set>

#include "Platform/base/FileDescriptor.h"
#include "Tests/Integration/ContainerState.h"
#include "Tests/Integration/Subprocess.h"
#include "Tests/Integration/Watchdog.h"

namespace fs = std::filesystem;
using platform::FileDescriptor;

namespace {

constexpr uid_t kMobile = 501;
constexpr uid_t kOther = 502;
constexpr char kHome[] = "/private/var/mobile";
constexpr char kMetadataFile[] = "/.com.veltra.tessary.metadata.plist";
constexpr char kApplication[] = "com.example.app";
constexpr char kOutside[] = "com.example.outside";
constexpr uint64_t kDone = 1;
constexpr tessary::CreateOrLookupOptions kLasting{.createIfNecessary = true};
constexpr tessary::CreateOrLookupOptions kTransient{.createIfNecessary = true, .transient = true};

// What a request may come to while its files are not what they should be: it was done, or the one
// step that could not be done is told. 40, an exception, is not among them.
const std::set<uint64_t> kSensible = {kDone, 5, 6, 7, 8, 9, 21, 34, 41, 43, 44, 45};

// Of each item of a tree the time of its last change: nobody may create, change, give away or
// remove anything in it without one of them changing.
std::map<std::string, std::string> timesIn(const std::string& tree) {
  std::map<std::string, std::string> times{{tree, ""}};
  for (const auto& item : fs::recursive_directory_iterator(tree)) times[item.path()] = "";
  for (auto& [path, time] : times) {
    struct stat status{};
    if (::lstat(path.c_str(), &status) != 0) continue;
    time = fmt::format("{}.{:09}", status.st_ctim.tv_sec, status.st_ctim.tv_nsec);
  }
  return times;
}

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
    device_.emplace(quickParent(), "other:502");
    makeVictim();
    device_->start();
    warmUp();
    fs::create_directories(home("Library/Tessary"));
    giveAll(home(), kMobile);
  }

  std::string home(const std::string& path = {}) const {
    return device_->path(kHome) + (path.empty() ? "" : "/" + path);
  }
  std::string otherHome() const { return device_->path("/private/var/users/other"); }
  tessary::Client connect() const { return device_->connect(privilegedCaller()); }

  // Containers that the daemon itself made.
  void makeVictim() {
    device_->start();
    tessary::Client client = connect();
    const auto made = client.createOrLookup(kOutside, 2, kLasting);
    ASSERT_TRUE(made && client.createOrLookup(kOutside, 2, kTransient));
    outside_ = otherHome() + made->path.substr(home().size());
    device_->stop();
    fs::rename(home("Containers"), otherHome() + "/Containers");
    fs::create_directories(otherHome() + "/Library/Tessary");
    fs::create_directories(otherHome() + "/Library/Caches/deep");
    std::ofstream(otherHome() + "/Library/Caches/deep/note") << "mine";
    giveAll(otherHome(), kOther);
    victim_ = timesIn(otherHome());
  }

  void warmUp() {
    tessary::Client client = connect();
    const auto made = client.createOrLookup(kApplication, 2, kLasting);
    ASSERT_TRUE(made && client.createOrLookup(kApplication, 2, kTransient));
    container_ = made->path;
  }

  struct Answers {
    bool existing, created, transient, list;  // whether each was done

    bool operator==(const Answers&) const = default;
  };

  // Everything that a client can ask for of this user's containers of one class.
  Answers askAll(tessary::Client& client) {
    Answers answers{};
    answers.existing = isDone(client.createOrLookup(kApplication, 2));
    answers.created =
        isDone(client.createOrLookup(fmt::format("com.example.new{}", ++created_), 2, kLasting));
    answers.transient = isDone(client.createOrLookup(kApplication, 2, kTransient));
    const auto outside = client.createOrLookup(kOutside, 2);
    EXPECT_TRUE(!outside && kSensible.contains(outside.error().code)) << "it leads outside";
    for (const bool transient : {true, false}) {
      const auto listed = client.containersOfClass(2, transient);
      answers.list = listed.has_value();
      EXPECT_TRUE(listed || kSensible.contains(listed.error().code));
    }
    return answers;
  }

  bool isDone(const tessary::Result<tessary::Container>& result) const {
    if (!result) {
      EXPECT_TRUE(kSensible.contains(result.error().code)) << result.error().code;
      return false;
    }
    EXPECT_TRUE(result->path.starts_with(home())) << result->path;
    return true;
  }

  // Once everything is in order again. The first requests may find that containers have gone; the
  // last one has death row emptied.
  void expectService() {
    tessary::Client client = connect();
    Answers answers{};
    for (int attempt = 0; attempt < 2; ++attempt) {
      (void)client.createOrLookup(kApplication, 2, kLasting);
      answers = askAll(client);
    }
    EXPECT_EQ(answers, (Answers{true, true, true, true})) << device_->daemonLog();
  }

  void expectEmptyDeathRow() const {
    EXPECT_TRUE(becomes([&] { return itemsIn(*device_, kDeathRow).empty(); }));
  }

  bool mayMount_ = false;
  std::optional<Device> device_;
  std::map<std::string, std::string> victim_;
  std::string outside_;    // a container of the victim
  std::string container_;  // the application's
  int created_ = 0;
};

// --- Before requests ----------------------------------------------------------------------------

enum class Obstacle { link, linkBelowRoot, danglingLink, fifo, file, mount, hugeFile, leasedFile };

constexpr char kContainer[] = "(container)";
constexpr char kMetadata[] = "(metadata)";

struct Place {
  const char* path;  // below the home, or in the application's container
  // What still works while something else stands there.
  bool existing, created, transient;
};

const Place kPlaces[] = {
    {"Containers", false, false, false},
    {"Containers/Staging", true, false, false},
    {"Containers/Temp", true, true, false},
    {"Containers/Data", false, false, true},
    {"Containers/Data/Application", false, false, true},
    {"Library/Tessary", true, true, true},
    {kContainer, false, true, true},
    {kMetadata, false, true, true},
};

class AttackInPlace : public Attack, public ::testing::WithParamInterface<Place> {
 protected:
  bool isContainer() const { return GetParam().path == kContainer; }
  bool isMetadata() const { return GetParam().path == kMetadata; }

  void put(Obstacle obstacle) {
    place_ = isContainer()  ? container_
             : isMetadata() ? container_ + kMetadataFile
                            : home(GetParam().path);
    if (obstacle == Obstacle::mount) {
      ASSERT_EQ(::mount("none", place_.c_str(), "tmpfs", 0, "mode=0755,uid=501,gid=501"), 0);
      return;
    }
    fs::rename(place_, place_ + ".aside");
    const std::string target = isContainer()  ? outside_
                               : isMetadata() ? outside_ + kMetadataFile
                                              : otherHome() + "/" + GetParam().path;
    switch (obstacle) {
      case Obstacle::link:
        return fs::create_symlink(target, place_);
      case Obstacle::linkBelowRoot:
        return fs::create_symlink(target.substr(device_->root().size()), place_);
      case Obstacle::danglingLink:
        return fs::create_symlink(target + "-that-is-not", place_);
      case Obstacle::fifo:
        ASSERT_EQ(::mkfifo(place_.c_str(), 0666), 0);
        return;
      case Obstacle::file:
        std::ofstream(place_) << "no directory";
        return;
      case Obstacle::hugeFile:
        std::ofstream(place_).flush();
        return fs::resize_file(place_, uint64_t{1} << 40U);
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

  std::string place_;
  FileDescriptor lease_;
};

TEST_P(AttackInPlace, IsAnsweredAndLeadsNowhere) {
  using enum Obstacle;
  std::vector<Obstacle> obstacles = {link, linkBelowRoot, danglingLink, fifo};
  if (isMetadata()) obstacles.insert(obstacles.end(), {hugeFile, leasedFile});
  if (!isMetadata()) obstacles.push_back(file);
  if (!isMetadata() && mayMount_) obstacles.push_back(mount);
  for (const Obstacle obstacle : obstacles) {
    for (const bool isWarm : {true, false}) {
      SCOPED_TRACE(fmt::format("obstacle {}, {}", static_cast<int>(obstacle),
                               isWarm ? "with a warm cache" : "after a start"));
      ASSERT_NO_FATAL_FAILURE(warmUp());
      if (!isWarm) device_->stop();
      ASSERT_NO_FATAL_FAILURE(put(obstacle));
      if (!isWarm) device_->start();
      if (HasFatalFailure()) return;
      const Watchdog watchdog(*device_);
      tessary::Client client = connect();
      const Answers answers = askAll(client);
      if (obstacle != mount) {  // an empty tree is as good as any
        // The container's identifier may stand for another one of an earlier case.
        EXPECT_TRUE(isContainer() || isMetadata() || answers.existing == GetParam().existing);
        EXPECT_EQ(answers.created, GetParam().created);
        EXPECT_EQ(answers.transient, GetParam().transient);
      }
      expectEmptyDeathRow();
      EXPECT_EQ(timesIn(otherHome()), victim_);
      ASSERT_NO_FATAL_FAILURE(clear(obstacle));
      expectService();
      if (HasFailure()) return;
    }
  }
}

std::string caseName(const std::string& path) {
  std::string name = path;
  std::erase_if(name, [](char c) { return std::isalpha(c) == 0; });
  return name;
}

INSTANTIATE_TEST_SUITE_P(At, AttackInPlace, ::testing::ValuesIn(kPlaces),
                         [](const auto& tested) { return caseName(tested.param.path); });

TEST_F(Attack, ALayoutPathThroughALinkIsNoHome) {
  device_->stop();
  device_->setPersonas({{"W", 101, "enterprise", std::string(kHome) + "/office/home", {}},
                        {"P", 100, "personal", {}, {}}});
  Caller worker = privilegedCaller();
  worker.persona = "W";
  fs::create_directory(home("office"));
  fs::create_symlink(otherHome(), home("office/home"));
  device_->start();
  const Watchdog watchdog(*device_);
  tessary::Client client = device_->connect(worker);
  EXPECT_EQ(askAll(client), Answers{});
  EXPECT_EQ(timesIn(otherHome()), victim_);
}

// --- During requests ----------------------------------------------------------------------------

class AttackDuringRequests : public Attack, public ::testing::WithParamInterface<const char*> {
 protected:
  std::string directory() const { return home(GetParam()); }

  pid_t startRacer() {
    fs::create_symlink(otherHome() + "/" + GetParam(), directory() + ".swap");
    const pid_t child = ::fork();
    if (child != 0) return child;
    if (::setgroups(0, nullptr) != 0 || ::setresgid(kMobile, kMobile, kMobile) != 0 ||
        ::setresuid(kMobile, kMobile, kMobile) != 0 || ::prctl(PR_SET_PDEATHSIG, SIGKILL) != 0) {
      ::_exit(1);
    }
    // A directory becomes a link and comes back, each for times of all lengths.
    constexpr unsigned kLengths = 16384;  // a period of the generator, too
    for (unsigned length = 0;;) {
      swap();
      length = (length * 5 + 3) % kLengths;
      for (unsigned i = 0; i < length; ++i) ++*rounds_;
    }
  }

  void endRacer(pid_t racer) {
    ::kill(racer, SIGKILL);
    EXPECT_EQ(waitForExit(racer), 128 + SIGKILL);
    if (fs::is_symlink(directory())) swap();
    fs::remove_all(directory() + ".swap");
  }

  void swap() const {
    const std::string link = directory() + ".swap";
    ::renameat2(AT_FDCWD, directory().c_str(), AT_FDCWD, link.c_str(), RENAME_EXCHANGE);
  }

  std::atomic<uint64_t>* rounds_ =
      new (::mmap(nullptr, sizeof(std::atomic<uint64_t>), PROT_READ | PROT_WRITE,
                  MAP_SHARED | MAP_ANONYMOUS, -1, 0)) std::atomic<uint64_t>(0);
};

TEST_P(AttackDuringRequests, LeadsNowhere) {
  tessary::Client creating = connect();
  tessary::Client replacing = connect();
  const pid_t racer = startRacer();
  const Watchdog watchdog(*device_);
  const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(1500);
  std::thread replacer([&] {
    while (std::chrono::steady_clock::now() < end) {
      (void)isDone(replacing.createOrLookup(kApplication, 2, kTransient));
    }
  });
  while (std::chrono::steady_clock::now() < end) (void)askAll(creating);
  replacer.join();
  endRacer(racer);
  expectService();
  expectEmptyDeathRow();
  EXPECT_GT(rounds_->load(), 100U);
  EXPECT_EQ(timesIn(otherHome()), victim_);
}

INSTANTIATE_TEST_SUITE_P(On, AttackDuringRequests,
                         ::testing::Values("Containers", "Containers/Staging", "Containers/Data",
                                           "Containers/Data/Application",
                                           "Containers/Temp/Data/Application"),
                         [](const auto& tested) { return caseName(tested.param); });

}  // namespace
