// For tests of what clients keep and share in containers: an application's data container, a system
// group's, and the tree of somebody else, which nothing may change.
#pragma once

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "Tests/Integration/ContainerState.h"

// What the commands are answered.
enum Code : uint64_t {
  kDone = 1,
  kCreateFailed = 6,
  kInvalidPath = 10,
  kInvalidObject = 11,
  kNoIdentifier = 18,
  kNotFound = 21,
  kInvalidArgument = 38,
  kNotEntitled = 55,
  kACLFailed = 63,
  kStagingFailed = 64,
  kNoAssets = 71,
};

inline constexpr uid_t kMobile = 501;
inline constexpr char kApplication[] = "com.example.app";
inline constexpr char kGroup[] = "systemgroup.com.example.shared";
inline constexpr char kAssetsPrefix[] = "com.veltra.UserManagedAssets.";

inline void write(const std::string& path, const std::string& text = "content") {
  std::filesystem::create_directories(std::filesystem::path(path).parent_path());
  std::ofstream(path, std::ios::binary) << text;
}

class SharedContent : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "processes of several users are needed";
    // In memory, where nothing waits for the disk, there are more requests in a race.
    device_.emplace(quickParent());
    device_->start();
  }

  tessary::Client connect() const {
    return device_->connect(privilegedCaller().with("userManagedAssets"));
  }
  tessary::Client connectStager() const {
    Caller stager = Caller().with("stageSharedContent");
    stager.identifier = "com.example.stager";
    stager.entitlements.emplace("com.veltra.security.system-groups",
                                platform::Value::Array{kGroup});
    return device_->connect(stager);
  }
  std::string makeContainer(const char* identifier, uint64_t containerClass) const {
    const auto made =
        connect().createOrLookup(identifier, containerClass, {.createIfNecessary = true});
    EXPECT_TRUE(made) << made.error().text;
    return made ? made->path : std::string();
  }

  static tessary::Result<tessary::UserManagedAssets> assets(
      tessary::Client& client, bool create, const std::string& identifier = kApplication) {
    return client.userManagedAssetsPath(identifier, {.createIfNecessary = create});
  }
  static uint64_t deleteAsset(tessary::Client& client, const std::string& path) {
    return codeOf(client.deleteUserManagedAsset(kApplication, path));
  }
  static uint64_t stage(tessary::Client& client, const std::string& from, const std::string& to,
                        const std::string& group = kGroup) {
    return codeOf(client.stageSharedContent(group, from, to));
  }

  // The tree of somebody else, on the same file system, and what it looks like.
  std::string outside(const std::string& path = {}) const {
    return device_->path("/private/var/outside") + (path.empty() ? "" : "/" + path);
  }
  // A link there that is one for the daemon too, whose world begins at the device's root.
  void linkOutside(const std::string& path, const std::string& at) const {
    std::filesystem::create_symlink(
        std::filesystem::relative(outside(path), std::filesystem::path(at).parent_path()), at);
  }
  // A file there that everybody may write into, and so give another name.
  std::string openFile() const { return outside("open"); }
  void makeOutside(const std::vector<std::string>& paths) {
    write(openFile());
    for (const std::string& path : paths) write(outside(path));
    std::filesystem::permissions(openFile(), std::filesystem::perms(0666));
    picture_ = lookOutside();
  }
  Picture lookOutside() const {
    Picture picture = pictureOf(outside());
    for (auto& [name, look] : picture) look += contentOf(outside() + name);
    return picture;
  }

  std::optional<Device> device_;
  Picture picture_;
};
