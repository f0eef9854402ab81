// The owner of a per-user tree has put things that are no directories where directories should be.
// Requests are answered, and what lies outside the tree stays as it was.

#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>

#include "Platform/base/FileDescriptor.h"
#include "Platform/ipc/SocketPath.h"
#include "Tests/Integration/Attack.h"

using platform::FileDescriptor;

namespace {

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
    if (isTree) {
      EXPECT_EQ(answers.existing == kDone, place.existing) << answers.existing;
    }
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
      if (!isWarm) device_->start();
      if (HasFatalFailure()) return;
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
                         [](const auto& tested) { return std::string(tested.param.name); });

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
  const FileDescriptor mounted(::open(inside.c_str(), O_PATH | O_CLOEXEC));
  ASSERT_EQ(code(client.createOrLookup(kApplication, 2, anew)), kDone);
  EXPECT_TRUE(deathRowEmpties());
  EXPECT_EQ(victim_->changes(), "");
  EXPECT_FALSE(fs::exists(first->path));
  // Wherever it has been moved to.
  const std::string itself = fmt::format("/proc/self/fd/{}", mounted.get());
  EXPECT_EQ(::umount2(itself.c_str(), MNT_DETACH), 0);
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

}  // namespace
