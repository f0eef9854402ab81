#include "Daemon/TSYFileManager.h"

#include <sys/acl.h>
#include <sys/stat.h>

#include "Daemon/TSYMetadata.h"
#include "Tests/Daemon/ContainerDevice.h"
#include "Tests/Platform/fs/Scratch.h"

namespace {

using platform::aclText;
using platform::Scratch;

constexpr char kBase[] = "/private/var/mobile/base";
constexpr char kTopLevel[] = "user::rwx,group::r-x,group:701:rwx,mask::rwx,other::r-x,";
constexpr char kInner[] = "user::---,group::---,group:701:rwx,mask::rwx,other::---,";
constexpr char kDefault[] = "user::rwx,group::---,group:701:rwx,mask::rwx,other::---,";

class TSYFileManagerTest : public testing::Test {
 protected:
  TSYURL url(const std::string& path) const { return TSYURL(device_.path(path)); }
  void write(const std::string& path, const std::string& text = "") const {
    device_.write(path, text);
  }
  bool isLogged(const std::string& text) const {
    return device_.log().find(text) != std::string::npos;
  }
  bool makeImmutable(const std::string& path) const {
    return std::system(("chattr +i '" + device_.path(path) + "' 2>/dev/null").c_str()) == 0;
  }

  const ContainerDevice device_;
  TSYFileManager& manager_ = TSYFileManager::defaultManager();
};

TEST_F(TSYFileManagerTest, createsDirectoriesWithModeOwnerAndClass) {
  const TSYURL deep = url("/private/var/mobile/a/b");
  ASSERT_TRUE(manager_.createDirectoryAtURL(deep, /*withIntermediateDirectories=*/true, 0750, 501,
                                            /*protectionClass=*/2));
  // On one that is there the owner and the class are set again, the mode is not.
  for (const bool intermediate : {false, true}) {
    ASSERT_TRUE(manager_.createDirectoryAtURL(deep, intermediate, 0700, 502, 4));
    EXPECT_EQ(Scratch::mode(deep.path()), 0750U);
    EXPECT_EQ(Scratch::look(deep.path()).st_uid, ::geteuid() == 0 ? 502 : ::geteuid());
    EXPECT_EQ(manager_.dataProtectionClassOfItemAtURL(deep).value_or(-1), 4);
  }
  EXPECT_EQ(Scratch::look(device_.path("/private/var/mobile/a")).st_uid, ::geteuid());
  const std::string file = device_.path("/private/var/mobile/file");
  write("/private/var/mobile/file");
  for (const bool intermediate : {false, true}) {
    EXPECT_EQ(manager_.createDirectoryAtURL(TSYURL(file), intermediate, 0755)
                  .error()
                  .localizedDescription(),
              (intermediate ? "mkpath_np of " : "mkdir of ") + file + " failed: Not a directory");
  }
}

TEST_F(TSYFileManagerTest, movesAcrossFileSystems) {
  const std::string elsewhere = device_.path("/elsewhere");
  std::filesystem::create_directory(elsewhere);
  if (::unshare(CLONE_NEWNS) != 0 ||
      ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
      ::mount("tmpfs", elsewhere.c_str(), "tmpfs", 0, nullptr) != 0) {
    GTEST_SKIP() << "may not mount";
  }
  // The device's own root is outside the namespace, in which nothing is mounted.
  const auto device = platform::DevicePlatform::open(device_.path(""));
  platform::Platform::setCurrent((*device)->platform());
  write("/source/d/file", "content");
  std::filesystem::create_symlink("d/file", device_.path("/source/link"));
  ASSERT_EQ(::chown(device_.path("/source/d").c_str(), 501, 502), 0);
  ASSERT_TRUE(manager_.moveItemAtURL(url("/source"), url("/elsewhere/target")));
  EXPECT_TRUE(manager_.itemDoesNotExistAtURL(url("/source")));
  EXPECT_EQ(Scratch::look(elsewhere + "/target/d").st_uid, 501U);
  EXPECT_EQ(std::filesystem::read_symlink(elsewhere + "/target/link"), "d/file");
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(elsewhere), {}), 1) << "a rest";
  // What cannot be put there stays where it was.
  write("/source/file");
  EXPECT_TRUE(
      manager_.moveItemAtURL(url("/source"), url("/elsewhere/target")).error().isPosix(ENOTEMPTY));
  EXPECT_TRUE(manager_.itemExistsAtURL(url("/source/file")));
  ::umount(elsewhere.c_str());
}

TEST_F(TSYFileManagerTest, removesWhatIsHeldByTheImmutableFlag) {
  write("/tree/file");
  write("/tree/held/file");
  write("/tree/held/sub/file");
  if (!makeImmutable("/tree/file") || !makeImmutable("/tree/held")) {
    GTEST_SKIP() << "no immutable flags here";
  }
  ASSERT_TRUE(manager_.removeItemAtURL(url("/tree")));
  EXPECT_TRUE(manager_.itemDoesNotExistAtURL(url("/tree")));
  EXPECT_TRUE(manager_.removeItemAtURL(url("/tree"))) << "what is missing is removed";

  // A directory outside the tree keeps its flag, and so the tree stays.
  write("/outer/tree/file");
  ASSERT_TRUE(makeImmutable("/outer"));
  EXPECT_TRUE(manager_.removeItemAtURL(url("/outer/tree")).error().isPosix(EPERM));
  EXPECT_TRUE(manager_.itemExistsAtURL(url("/outer/tree")));
  EXPECT_EQ(std::system(("chattr -i '" + device_.path("/outer") + "'").c_str()), 0);
}

TEST_F(TSYFileManagerTest, standardizesOwnersAndModes) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root gives files away";
  const std::string metadata = "/c/" + std::string(kTSYMetadataFileName);
  write("/c/sub/plain");
  write("/c/sub/run");
  write(metadata);
  write("/victim");
  std::filesystem::create_symlink(device_.path("/victim"), device_.path("/c/link"));
  for (const auto& [path, mode] : {std::pair{"/c", 0700U},
                                   {"/c/sub", 02777U},
                                   {"/c/sub/plain", 0666U},
                                   {"/c/sub/run", 06610U},
                                   {"/victim", 0600U}}) {
    ASSERT_EQ(::chmod(device_.path(path).c_str(), mode), 0);
  }
  ASSERT_EQ(::chmod(device_.path(metadata).c_str(), 0640), 0);
  ASSERT_TRUE(manager_.standardizeOwnershipAtURL(url("/c"), 501, 502));
  const std::tuple<std::string, mode_t, uid_t, gid_t> expected[] = {
      {"/c", 0755, 501, 502},         {"/c/sub", 0755, 501, 502},  {"/c/sub/plain", 0644, 501, 502},
      {"/c/sub/run", 0755, 501, 502}, {"/c/link", 0777, 501, 502}, {metadata, 0640, 0, 0},
      {"/victim", 0600, 0, 0}};
  for (const auto& [path, mode, uid, gid] : expected) {
    const struct stat status = Scratch::look(device_.path(path));
    EXPECT_EQ(status.st_mode & 07777U, mode) << path;
    EXPECT_EQ(status.st_uid, uid) << path;
    EXPECT_EQ(status.st_gid, gid) << path;
  }
}

TEST_F(TSYFileManagerTest, givesSystemContainersTheirLists) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root gives files away";
  const std::string metadata = "/all/c/" + std::string(kTSYMetadataFileName);
  write("/all/c/sub/file");
  write("/all/other/file");
  write(metadata);
  write("/victim");
  std::filesystem::create_symlink(device_.path("/victim"), device_.path("/all/c/link"));
  ASSERT_TRUE(manager_.standardizeAllSystemContainerACLsAtURL(url("/all")));
  const std::string ordinary = "user::rw-,group::rw-,other::rw-,";
  const std::tuple<std::string, std::string, uid_t> expected[] = {
      {"/all/c", kTopLevel, 0},
      {"/all/other", kTopLevel, 0},
      {"/all/c/sub", kInner, 4294967294},
      {"/all/c/sub/file", kInner, 4294967294},
      {metadata, ordinary, 0},
      {"/victim", ordinary, 0}};
  for (const auto& [path, access, uid] : expected) {
    EXPECT_EQ(aclText(device_.path(path), ACL_TYPE_ACCESS), access) << path;
    EXPECT_EQ(Scratch::look(device_.path(path)).st_uid, uid) << path;
  }
  EXPECT_EQ(aclText(device_.path("/all/c"), ACL_TYPE_DEFAULT), kDefault);
  EXPECT_EQ(aclText(device_.path("/all/c/sub"), ACL_TYPE_DEFAULT), kDefault);
  // A directory that the daemon makes inside is open to the group at once.
  ASSERT_TRUE(manager_.createDirectoryAtURL(url("/all/c/Library/Caches"),
                                            /*withIntermediateDirectories=*/true, 0, 4294967294,
                                            0));
  EXPECT_EQ(aclText(device_.path("/all/c/Library"), ACL_TYPE_ACCESS), kInner);
  EXPECT_EQ(aclText(device_.path("/all/c/Library/Caches"), ACL_TYPE_ACCESS), kInner);

  EXPECT_TRUE(
      manager_.setTopLevelSystemContainerACLAtURL(url("/victim")).error().is(TSYErrorACLFailed));
  write("/etc/group", "others:x:1:\n");
  EXPECT_TRUE(
      manager_.setTopLevelSystemContainerACLAtURL(url("/all/c")).error().is(TSYErrorACLFailed));
}

TEST_F(TSYFileManagerTest, acceptsOnlyPathsInsideTheBase) {
  const std::string base = kBase;
  write(base + "/a/file");
  write(base + "2/file");
  write("/private/var/mobile/x/file");
  write("/etc/secret");
  const auto link = [&](const std::string& text, const std::string& name) {
    std::filesystem::create_symlink(text, device_.path(base + name));
  };
  link("/etc", "/absolute");
  link("../x", "/outside");
  link("../../x", "/a/climbing");
  link("a/file", "/inside");
  link("../a", "/a/sibling");
  link("absolute/secret", "/hidden");  // its text stays inside; what it passes through does not
  link("nothing", "/dangling");
  link("loop", "/loop");

  const std::string outside = "as it is points outside or to the base";
  const struct {
    std::string suspicious;
    std::string resolved;  // none when empty
    std::string log;
    std::string base = kBase;
  } cases[] = {
      {base + "/a/file", base + "/a/file", ""},
      {base + "/a/b/c", base + "/a/b/c", "appending non-existing components /b/c"},
      {base, base, ""},
      {base + "/inside", base + "/a/file", ""},
      {base + "/a/sibling/new", base + "/a/new", ""},
      {"/var/mobile/base/a", base + "/a", ""},
      {"/private/var/mobile/x", "", "does not contain base path"},
      {base + "/a/../../x", "", "contains '..' paths, which are invalid"},
      {base + "2/file", "", "because components diverge at base != base2"},
      {base + "/absolute", "", "as absolute symlinks are not allowed"},
      {base + "/absolute/secret", "", "because base component count is greater"},
      {base + "/outside", "", outside},
      {base + "/outside/file", "", "because components diverge at base != x"},
      {base + "/a/climbing", "", outside},
      {base + "/hidden", "", "because base component count is greater"},
      {base + "/dangling/new", "", "Failed to retrieve realpath for suspicious path"},
      {base + "/loop/x", "", "Readlink failed: Too many levels of symbolic links"},
      {base + "3/x", "", "Failed to retrieve realpath for base path", base + "3"},
      {"/x", "", "because real component counts don't make sense", "/"},
  };
  for (const auto& each : cases) {
    write("/daemon.log", "");
    const auto real = manager_.realPathForURL(url(each.suspicious), url(each.base));
    EXPECT_EQ(real ? real->path() : "", each.resolved.empty() ? "" : device_.path(each.resolved))
        << each.suspicious;
    EXPECT_TRUE(isLogged(each.log)) << each.suspicious << ": " << each.log;
  }
  EXPECT_FALSE(manager_.realPathForURL(TSYURL(), url(base)));
  EXPECT_FALSE(manager_.realPathForURL(url(base + std::string("/a\0/x", 5)), url(base)));
}

TEST_F(TSYFileManagerTest, findsHomesBelowTheRoot) {
  write("/etc/passwd",
        "linked:x:601:601::/linked:/bin/sh\n"
        "far:x:602:602::/far:/bin/sh\n"
        "gone:x:603:603::/gone:/bin/sh\n");
  std::filesystem::create_symlink("/private/var/alice", device_.path("/linked"));
  std::filesystem::create_symlink("/../../../../../../tmp", device_.path("/far"));
  const std::pair<uid_t, const char*> cases[] = {{601, "/private/var/alice"},
                                                 {602, "/private/var/mobile"},
                                                 {603, "/private/var/mobile"},
                                                 {604, "/private/var/mobile"}};
  for (const auto& [uid, home] : cases) {
    EXPECT_EQ(TSYFileManager::homeDirectoryURLForPOSIXUID(uid), url(home)) << uid;
  }
}

}  // namespace
