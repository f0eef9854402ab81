// The file system under the daemon stops in the middle of a creation, without its journal being
// written out, as when the power goes. After the next mount, which replays the journal, every
// container is whole or not there.
//
// What was answered shortly before may be lost: a creation promises that what is there is whole,
// not that it lasts. What was there when everything was synced must still be.
#include <fcntl.h>
#include <fmt/format.h>
#include <gtest/gtest.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <random>
#include <set>

#include "Platform/base/FileDescriptor.h"
#include "Tests/Integration/ContainerState.h"
#include "Tests/Integration/SanitizedBuild.h"
#include "Tests/Integration/Subprocess.h"
#include "Tests/Integration/SystemCalls.h"
#include "Tests/ScratchDirectory.h"

namespace {

// ext4's own request; its header is not among the kernel's public ones.
constexpr unsigned long kShutDown = _IOR('X', 125, uint32_t);
constexpr uint32_t kWithoutFlushingTheLog = 2;

constexpr size_t kPowerCuts = 24 / kSanitizedStride;
constexpr uint64_t kNotFound = 21;

// A small ext4 file system in a file, mounted.
class Disk {
 public:
  Disk() {
    const std::string parent = quickParent();
    directory_ = parent.empty() ? makeScratchDirectory() : makeScratchDirectory(parent);
    std::filesystem::create_directory(mountPoint());
    const Finished made =
        runToEnd({"/bin/sh", "-c", "truncate -s 64M \"$0\" && /usr/sbin/mkfs.ext4 -q -F \"$0\"",
                  directory_ + "/image"});
    trouble_ = made.errors;
    if (made.exitStatus == 0) mount();
  }
  ~Disk() {
    // Busy or not, it must not stay behind.
    if (!unmount()) ::umount2(mountPoint().c_str(), MNT_DETACH);
    std::filesystem::remove_all(directory_);
  }
  Disk(const Disk&) = delete;
  Disk& operator=(const Disk&) = delete;

  // Why it is not mounted; empty when it is.
  const std::string& trouble() const { return trouble_; }
  std::string mountPoint() const { return directory_ + "/mount"; }

  void mount() {
    const std::vector<std::string> command = {"/usr/bin/mount", "-o", "loop", directory_ + "/image",
                                              mountPoint()};
    trouble_ = runToEnd(command).errors;
  }
  // Also gives the loop device back, and waits for that: somebody who has just made a mount
  // namespace of his own has a copy of the mount, and the file system goes on while he is there.
  bool unmount() {
    struct stat status{};
    if (::stat(mountPoint().c_str(), &status) != 0) return false;
    const std::string backing = fmt::format("/sys/dev/block/{}:{}/loop/backing_file",
                                            major(status.st_dev), minor(status.st_dev));
    return ::umount2(mountPoint().c_str(), UMOUNT_NOFOLLOW) == 0 &&
           becomes([&] { return !std::filesystem::exists(backing); });
  }

  platform::FileDescriptor open() const {
    return platform::FileDescriptor(
        ::open(mountPoint().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  }

 private:
  std::string directory_;
  std::string trouble_;
};

class PowerCut : public ::testing::Test {
 protected:
  void SetUp() override {
    if (const std::string why = whyNotTraceable(); !why.empty()) GTEST_SKIP() << why;
    disk_.emplace();
    if (!disk_->trouble().empty()) GTEST_SKIP() << disk_->trouble();
    device_.emplace(disk_->mountPoint());
    device_->start();
    tessary::Client client = connect();
    for (size_t i = 0; i < 2; ++i) {
      const Creation creation = newCreation();
      const auto made = creation.request(client);
      ASSERT_TRUE(made.has_value());
      models_[creation.containerClass] = pictureOf(made->path);
    }
    createWithPowerCut(client);  // without one: counts the calls
    ASSERT_GT(callsOfACreation_, 50U);
  }

  tessary::Client connect() const { return device_->connect(privilegedCaller()); }

  // Of a user's class and of a global one by turns.
  Creation newCreation() {
    const size_t n = creations_.size();
    creations_.push_back({n % 2 == 0 ? 2U : 12U, fmt::format("com.example.app{}", n)});
    return creations_.back();
  }

  // A creation during which the disk stops before call `number`. Returns whether it did.
  bool createWithPowerCut(tessary::Client& client, size_t number = SIZE_MAX) {
    const platform::FileDescriptor disk = disk_->open();
    const Creation creation = newCreation();
    bool isCut = false;
    const auto calls = traceRequest(
        device_->daemonPid(), [&] { (void)creation.request(client); },
        [&](const FileCall&, size_t n) {
          uint32_t how = kWithoutFlushingTheLog;
          if (n == number) isCut = ::ioctl(disk.get(), kShutDown, &how) == 0;
          return Verdict{};
        });
    if (!isCut) callsOfACreation_ = calls.size();
    return isCut;
  }

  // The device boots: what lives until then is gone.
  void restartDevice() {
    device_->kill();
    device_->releaseRoot();
    ASSERT_TRUE(disk_->unmount()) << errno;
    disk_->mount();
    ASSERT_EQ(disk_->trouble(), "");
    std::filesystem::remove_all(device_->path("/run/tessary"));
    device_->reopenRoot();
    device_->start();
  }

  // Every container of those asked for is whole or absent; returns those that are there.
  std::set<std::string> expectWholeOrAbsent() {
    std::set<std::string> there;
    tessary::Client client = connect();
    std::map<std::string, size_t> found;
    for (const Creation& creation : creations_) {
      const auto container = creation.lookUp(client);
      if (!container) {
        EXPECT_EQ(container.error().code, kNotFound) << creation.identifier;
        continue;
      }
      EXPECT_EQ(defectOf(creation, container->path, models_.at(creation.containerClass)), "");
      there.insert(creation.identifier);
      ++found[creation.classDirectory()];
    }
    // And there is none that cannot be found.
    for (const auto& [directory, count] : found) {
      EXPECT_EQ(itemsIn(*device_, directory).size(), count) << directory;
    }
    return there;
  }

  std::optional<Disk> disk_;
  std::optional<Device> device_;
  std::map<uint64_t, Picture> models_;
  std::vector<Creation> creations_;
  size_t callsOfACreation_ = 0;
};

TEST_F(PowerCut, LeavesContainersWholeOrAbsent) {
  std::mt19937 random(20260111);  // NOLINT(cert-msc32-c,cert-msc51-cpp): the same each time
  size_t cuts = 0;
  for (size_t i = 0; i < kPowerCuts && !HasFailure(); ++i) {
    SCOPED_TRACE(i);
    ::syncfs(disk_->open().get());
    const std::set<std::string> synced = expectWholeOrAbsent();
    tessary::Client client = connect();
    for (unsigned before = random() % 4; before > 0; --before) {
      ASSERT_TRUE(newCreation().request(client).has_value());
    }
    // Connecting syncs a file, and thereby the names of all others, but not what is in those.
    if (random() % 2 == 0) connect();
    if (createWithPowerCut(client, random() % callsOfACreation_)) ++cuts;
    restartDevice();
    EXPECT_TRUE(std::ranges::includes(expectWholeOrAbsent(), synced));
    for (const uint64_t containerClass : {2U, 12U}) {
      EXPECT_EQ(litterThatStays(*device_, {.containerClass = containerClass}), "");
    }
    client = connect();
    EXPECT_TRUE(newCreation().request(client).has_value());
  }
  EXPECT_GT(cuts, kPowerCuts / 2);
}

}  // namespace
