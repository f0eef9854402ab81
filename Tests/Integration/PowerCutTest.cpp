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

#include <chrono>
#include <filesystem>
#include <fstream>
#include <random>
#include <set>
#include <thread>

#include "Platform/base/FileDescriptor.h"
#include "Tests/Integration/ContainerState.h"
#include "Tests/Integration/SanitizedBuild.h"
#include "Tests/Integration/Subprocess.h"
#include "Tests/Integration/SystemCalls.h"

namespace {

// ext4's own request; its header is not among the kernel's public ones.
constexpr unsigned long kShutDown = _IOR('X', 125, uint32_t);
constexpr uint32_t kWithoutFlushingTheLog = 2;

constexpr size_t kPowerCuts = 24 / kSanitizedStride;

// A small ext4 file system in a file, mounted.
class Disk {
 public:
  Disk() {
    const std::string parent = quickParent();
    std::string pattern =
        (parent.empty() ? std::filesystem::temp_directory_path().string() : parent) +
        "/tessary-disk-XXXXXX";
    directory_ = ::mkdtemp(pattern.data());
    std::filesystem::create_directory(mountPoint());
    std::ofstream(image()).close();
    std::filesystem::resize_file(image(), 64U << 20);
    run({"/usr/sbin/mkfs.ext4", "-q", "-F", image()});
    mount();
  }
  ~Disk() {
    // Busy or not, it must not stay behind.
    if (!unmount()) ::umount2(mountPoint().c_str(), MNT_DETACH);
    std::filesystem::remove_all(directory_);
  }
  Disk(const Disk&) = delete;
  Disk& operator=(const Disk&) = delete;

  const std::string& trouble() const { return trouble_; }
  std::string mountPoint() const { return directory_ + "/mount"; }

  void mount() { run({"/usr/bin/mount", "-o", "loop", image(), mountPoint()}); }
  // Also gives the loop device back, and waits for that: somebody who has just made a mount
  // namespace of his own has a copy of the mount, and the file system goes on while he is there.
  bool unmount() {
    struct stat status{};
    if (::stat(mountPoint().c_str(), &status) != 0) return false;
    const std::string backing = fmt::format("/sys/dev/block/{}:{}/loop/backing_file",
                                            major(status.st_dev), minor(status.st_dev));
    if (::umount2(mountPoint().c_str(), UMOUNT_NOFOLLOW) != 0) return false;
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    while (std::filesystem::exists(backing)) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return true;
  }

  platform::FileDescriptor open() const {
    return platform::FileDescriptor(
        ::open(mountPoint().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  }

 private:
  std::string image() const { return directory_ + "/image"; }

  void run(const std::vector<std::string>& command) {
    if (!trouble_.empty()) return;
    if (!std::filesystem::exists(command[0])) {
      trouble_ = "no " + command[0];
    } else if (const Finished finished = runToEnd(command); finished.exitStatus != 0) {
      trouble_ = command[0] + ": " + finished.errors;
    }
  }

  std::string directory_;
  std::string trouble_;
};

class PowerCut : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "needs root";
    if (const std::string why = whyNotTraceable(); !why.empty()) GTEST_SKIP() << why;
    disk_ = std::make_unique<Disk>();
    if (!disk_->trouble().empty()) GTEST_SKIP() << disk_->trouble();
    device_ = std::make_unique<Device>(disk_->mountPoint());
    device_->start();
    for (const Creation& kind : kKinds) learn(kind);
    tessary::Client client = connect();
    createWithPowerCut(client);  // without one: counts the calls
    ASSERT_GT(callsOfACreation_, 50U);
  }

  void TearDown() override {
    device_.reset();
    disk_.reset();
  }

  tessary::Client connect() const {
    tessary::Client client = device_->connect(privilegedCaller());
    EXPECT_TRUE(client.personaList().has_value());
    return client;
  }

  void learn(const Creation& kind) {
    tessary::Client client = connect();
    const auto made = kind.request(client);
    ASSERT_TRUE(made.has_value());
    models_[kind.containerClass] = pictureOf(made->path);
    creations_.push_back(kind);
  }

  Creation newCreation() {
    const auto n = creations_.size();
    creations_.push_back(
        {kKinds[n % std::size(kKinds)].containerClass, fmt::format("com.example.app{}", n)});
    return creations_.back();
  }

  void sync() const { ::syncfs(disk_->open().get()); }

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
        EXPECT_EQ(container.error().code, 21U) << creation.identifier;
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

  const Creation kKinds[2] = {{2, "com.example.first"}, {12, "com.veltra.exampled"}};

  std::unique_ptr<Disk> disk_;
  std::unique_ptr<Device> device_;
  std::map<uint64_t, std::map<std::string, std::string>> models_;
  std::vector<Creation> creations_;
  size_t callsOfACreation_ = 0;
};

TEST_F(PowerCut, LeavesContainersWholeOrAbsent) {
  std::mt19937 random(20260111);  // NOLINT(cert-msc32-c,cert-msc51-cpp): the same each time
  size_t cuts = 0;
  size_t lost = 0;
  for (size_t i = 0; i < kPowerCuts && !HasFailure(); ++i) {
    SCOPED_TRACE(i);
    sync();
    const std::set<std::string> synced = expectWholeOrAbsent();
    std::set<std::string> answered = synced;
    tessary::Client client = connect();
    for (unsigned before = random() % 4; before > 0; --before) {
      const Creation creation = newCreation();
      ASSERT_TRUE(creation.request(client).has_value());
      answered.insert(creation.identifier);
    }
    // Connecting syncs a file, and thereby the names of all others, but not what is in those.
    if (random() % 2 == 0) connect();
    if (createWithPowerCut(client, random() % callsOfACreation_)) ++cuts;
    restartDevice();
    const std::set<std::string> there = expectWholeOrAbsent();
    EXPECT_TRUE(std::ranges::includes(there, synced));
    lost += static_cast<size_t>(
        std::ranges::count_if(answered, [&](const auto& id) { return !there.contains(id); }));
    EXPECT_EQ(litterThatStays(*device_, kKinds[0]), "");
    EXPECT_EQ(litterThatStays(*device_, kKinds[1]), "");
    client = connect();
    EXPECT_TRUE(newCreation().request(client).has_value());
  }
  EXPECT_GT(cuts, kPowerCuts / 2);
  fmt::print("{} power cuts, {} containers, {} of those answered lost\n", cuts, creations_.size(),
             lost);
}

}  // namespace
