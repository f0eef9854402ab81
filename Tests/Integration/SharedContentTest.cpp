// What clients keep and share in containers: the directory for user-managed assets, and staging in
// system groups. Nothing outside of the container is reached, whatever stands in the way.
#include <fmt/format.h>

#include "Tests/Integration/SharedContent.h"

namespace fs = std::filesystem;
using platform::Value;
using platform::ipc::Message;

namespace {

constexpr uid_t kNobody = 4294967294;
constexpr char kMetadataFile[] = ".com.veltra.tessary.metadata.plist";

struct stat look(const std::string& path) {
  struct stat status{};
  EXPECT_EQ(::lstat(path.c_str(), &status), 0) << path;
  return status;
}

// --- User-managed assets ------------------------------------------------------------------------

TEST_F(SharedContent, AnApplicationHasOneAssetsDirectory) {
  const std::string container = makeContainer(kApplication, 2);
  tessary::Client client = connect();
  EXPECT_EQ(codeOf(assets(client, /*create=*/false)), kNoAssets);
  const auto made = assets(client, /*create=*/true);
  ASSERT_TRUE(made);
  EXPECT_FALSE(made->existed);
  EXPECT_EQ(made->path.find(container + "/Library/" + kAssetsPrefix), 0U) << made->path;
  const struct stat status = look(made->path);
  EXPECT_EQ(status.st_mode, mode_t{S_IFDIR | 0755});
  EXPECT_EQ(std::pair(status.st_uid, status.st_gid), std::pair(kMobile, gid_t{kMobile}));

  device_->kill();  // it is recorded for good
  device_->start();
  client = connect();
  for (const bool create : {true, false}) {
    const auto again = assets(client, create);
    EXPECT_TRUE(again && again->existed && again->path == made->path);
  }
  EXPECT_EQ(client.userManagedAssetsPath(kApplication, {.isRelative = true})->path,
            made->path.substr(container.size() + 1));

  // What is no directory of its own is none, and another one is made and recorded.
  const std::function<void(const std::string&)> obstacles[] = {
      [](const std::string&) {}, [](const std::string& path) { write(path); },
      [&](const std::string& path) { fs::create_directory_symlink("Caches", path); },
      [](const std::string& path) { ::mkfifo(path.c_str(), 0666); }};
  std::string last = made->path;
  for (const auto& put : obstacles) {
    fs::remove(last);
    put(last);
    EXPECT_EQ(codeOf(assets(client, /*create=*/false)), kNoAssets);
    const auto other = assets(client, /*create=*/true);
    ASSERT_TRUE(other && !other->existed && other->path != last);
    EXPECT_TRUE(assets(client, /*create=*/false)->existed);
    last = other->path;
  }

  EXPECT_EQ(codeOf(assets(client, true, "com.example.other")), kInvalidObject);
  for (const uint64_t command : {26U, 28U, 29U}) {
    Caller all = privilegedCaller().with("userManagedAssets").with("stageSharedContent");
    client = device_->connect(all);
    EXPECT_EQ(codeOf(client.call(command, Message())), kNoIdentifier) << command;
    EXPECT_EQ(
        codeOf(client.call(command, Message(Value::Dictionary{{"Identifier", kApplication}}))),
        command == 28 ? kDone : kInvalidObject);
  }
  tessary::Client own = device_->connect(Caller());
  EXPECT_EQ(codeOf(assets(own, /*create=*/false)), kDone);
  EXPECT_EQ(codeOf(assets(own, /*create=*/true, "com.example.other")), kInvalidArgument);
}

TEST_F(SharedContent, OnlyAssetsAreDeleted) {
  makeContainer(kApplication, 2);
  makeOutside({"asset"});
  tessary::Client client = connect();
  EXPECT_EQ(deleteAsset(client, "asset"), kInvalidObject);  // no directory yet
  const std::string directory = assets(client, /*create=*/true)->path;
  for (const char* name : {"one", "two", "three", "album/a", "album/b", "tree/a/b"}) {
    write(directory + "/" + name);
  }
  write(directory + "x/sibling");
  linkOutside("open", directory + "/out");
  linkOutside("", directory + "/outDirectory");
  fs::create_symlink("three", directory + "/in");
  fs::create_symlink("nowhere", directory + "/dangling");
  const std::string sibling = "../" + fs::path(directory).filename().string() + "x/sibling";
  const struct {
    std::string path;
    uint64_t code;
    const char* gone = nullptr;
  } kCases[] = {
      {"", kInvalidPath},         {".", kInvalidPath},
      {"album/..", kInvalidPath}, {"..", kInvalidPath},
      {sibling, kInvalidPath},    {openFile(), kInvalidPath},
      {"out", kInvalidPath},      {"outDirectory/asset", kInvalidPath},
      {"dangling", kInvalidPath}, {"missing", kInvalidPath},
      {"one/", kDone, "one"},     {"album/../album/./a", kDone, "album/a"},
      {"/two", kDone, "two"},     {"in", kDone, "three"},
      {"tree", kDone, "tree"},
  };
  for (const auto& [path, code, gone] : kCases) {
    const Picture before = pictureOf(directory);
    EXPECT_EQ(deleteAsset(client, path), code) << path;
    if (gone != nullptr) {
      EXPECT_FALSE(fs::exists(fs::symlink_status(directory + "/" + gone))) << gone;
    } else {
      EXPECT_EQ(pictureOf(directory), before) << path;
    }
  }
  EXPECT_TRUE(fs::exists(directory + "/album/b"));
  EXPECT_TRUE(fs::exists(directory + "x/sibling"));
  EXPECT_EQ(lookOutside(), picture_);
}

TEST_F(SharedContent, NoLinkLeadsAssetsOutside) {
  const std::string container = makeContainer(kApplication, 2);
  tessary::Client client = connect();
  const std::string directory = assets(client, /*create=*/true)->path;
  write(directory + "/asset");
  const std::string inside = directory.substr(container.size() + 1);
  makeOutside({inside + "/asset"});
  for (const std::string& replaced : {directory, container + "/Library"}) {
    fs::rename(replaced, replaced + ".aside");
    linkOutside(replaced.substr(container.size() + 1), replaced);
    EXPECT_EQ(codeOf(assets(client, /*create=*/false)), kNoAssets);
    EXPECT_EQ(deleteAsset(client, "asset"), kInvalidPath);
    if (replaced != directory) {
      EXPECT_EQ(codeOf(assets(client, /*create=*/true)), kCreateFailed);
    }
    fs::remove(replaced);
    fs::rename(replaced + ".aside", replaced);
  }
  EXPECT_EQ(lookOutside(), picture_);
  EXPECT_TRUE(fs::exists(directory + "/asset"));
}

// --- Staging ------------------------------------------------------------------------------------

TEST_F(SharedContent, StagingStaysInTheContainer) {
  tessary::Client stager = connectStager();
  EXPECT_EQ(stage(stager, "new/item", "Library/item"), kNotFound);
  const std::string container = makeContainer(kGroup, 13);
  makeContainer("systemgroup.com.example.other", 13);
  makeOutside({"item"});
  for (const char* name : {"one", "two", "three/deep/file", "four", "inner/item"}) {
    write(container + "/new/" + name, name);
  }
  linkOutside("", container + "/out");
  fs::create_symlink("new/four", container + "/in");
  fs::create_symlink("../../item", container + "/new/climbing");
  fs::create_hard_link(openFile(), container + "/new/hard");
  stager = connectStager();
  const struct {
    std::string from, to;
    uint64_t code;
    std::string group = kGroup;
  } kCases[] = {
      {"new/one", "Library/one", kNotEntitled, "systemgroup.com.example.other"},
      {"new/../new/one", "Library/one", kInvalidArgument, "systemgroup.com.example.other"},
      {"new/one", "..", kInvalidArgument},
      {"", "Library/whole", kInvalidPath},
      {".", "Library/whole", kInvalidPath},
      {"new/one", "", kInvalidPath},
      {kMetadataFile, "Library/metadata", kInvalidPath},
      {"new/one", kMetadataFile, kInvalidPath},
      {"new/one", fmt::format("/.//{}", kMetadataFile), kInvalidPath},
      {"out", "Library/one", kInvalidPath},
      {"new/one", "out/one", kInvalidPath},
      {"new/climbing", "Library/one", kInvalidPath},
      {"new/missing", "Library/one", kACLFailed},
      {"new/one", "missing/one", kStagingFailed},
      {"new/one", "new/three", kStagingFailed},
      {"new/three", "new/three/deep/three", kStagingFailed},
      {"new/one", "Library/one", kDone},
      {"new/two", "Library/one", kDone},
      {"/new/./three/", "Library/three", kDone},
      {"in", "Library/four", kDone},
      {"new/hard", "Library/hard", kDone},
  };
  for (const auto& [from, to, code, group] : kCases) {
    EXPECT_EQ(stage(stager, from, to, group), code) << from << " to " << to;
  }
  const auto staged = stager.stageSharedContent(kGroup, "/Library/./three", "Library/three");
  EXPECT_TRUE(staged && fs::equivalent(*staged, container + "/Library/three"));
  EXPECT_EQ(lookOutside(), picture_);
  EXPECT_EQ(contentOf(container + "/Library/one"), "two");
  EXPECT_EQ(contentOf(container + "/Library/four"), "four");
  EXPECT_FALSE(fs::exists(container + "/new/one") || fs::exists(container + "/new/four"));
  // Everything was opened to the group, and to nobody else.
  const Picture picture = pictureOf(container + "/Library");
  for (const char* name : {"/one", "/three", "/three/deep", "/three/deep/file", "/four"}) {
    const struct stat status = look(container + "/Library" + name);
    EXPECT_EQ(status.st_mode & 07777U, 070U) << name;
    EXPECT_EQ(status.st_uid, kNobody) << name;
    EXPECT_EQ(picture.at(name).find("access  "), std::string::npos) << picture.at(name);
  }
}

}  // namespace
