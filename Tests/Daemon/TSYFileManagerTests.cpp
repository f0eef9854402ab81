#include "Daemon/TSYFileManager.h"

#include <fcntl.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <algorithm>

#include "Daemon/TSYLog.h"
#include "Daemon/TSYMetadata.h"
#include "Tests/Daemon/TestPlatform.h"
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
  void SetUp() override {
    ASSERT_TRUE(TSYLogOpen(platform_.path("/log"), TSYLogLevelDebug, {2, 1 << 20}));
  }

  TSYURL url(const std::string& path) const { return TSYURL(platform_.path(path)); }
  void write(const std::string& path, const std::string& text = "") const {
    platform_.write(path, text);
  }
  bool isLogged(const std::string& text) const {
    std::ifstream file(platform_.path("/log"));
    const std::string log{std::istreambuf_iterator<char>(file), {}};
    return log.find(text) != std::string::npos;
  }
  bool makeImmutable(const std::string& path) const {
    return std::system(("chattr +i '" + platform_.path(path) + "' 2>/dev/null").c_str()) == 0;
  }

  const TestPlatform platform_;
  TSYFileManager& manager_ = TSYFileManager::defaultManager();
};

TEST_F(TSYFileManagerTest, createsDirectoriesWithModeOwnerAndClass) {
  const bool isRoot = ::geteuid() == 0;
  const TSYURL deep = url("/private/var/mobile/a/b");
  EXPECT_TRUE(manager_.createDirectoryAtURL(deep, /*withIntermediateDirectories=*/false, 0755)
                  .error()
                  .isPosix(ENOENT));
  ASSERT_TRUE(manager_.createDirectoryAtURL(deep, /*withIntermediateDirectories=*/true, 0750, 501,
                                            /*protectionClass=*/2));
  // On one that is there the owner and the class are set again, the mode is not.
  for (const bool intermediate : {false, true}) {
    ASSERT_TRUE(manager_.createDirectoryAtURL(deep, intermediate, 0700, 502, 4));
    EXPECT_EQ(Scratch::mode(deep.path()), 0750U);
    EXPECT_EQ(Scratch::look(deep.path()).st_uid, isRoot ? 502 : ::geteuid());
    EXPECT_EQ(Scratch::look(deep.path()).st_gid, isRoot ? 502 : ::getegid());
    EXPECT_EQ(manager_.dataProtectionClassOfItemAtURL(deep).value_or(-1), 4);
  }
  EXPECT_EQ(Scratch::look(platform_.path("/private/var/mobile/a")).st_uid, ::geteuid());

  const std::string file = platform_.path("/private/var/mobile/file");
  write("/private/var/mobile/file");
  for (const bool intermediate : {false, true}) {
    const auto made = manager_.createDirectoryAtURL(TSYURL(file), intermediate, 0755);
    ASSERT_FALSE(made);
    const std::string call = intermediate ? "mkpath_np" : "mkdir";
    EXPECT_EQ(made.error().localizedDescription(),
              call + " of " + file + " failed: Not a directory");
  }
}

TEST_F(TSYFileManagerTest, tellsAMissingSourceFromOtherFailures) {
  const TSYURL from = url("/private/var/mobile/from");
  const TSYURL to = url("/private/var/mobile/to");
  EXPECT_TRUE(manager_.moveItemAtURL(from, to).error().isPosix(ENOENT));
  EXPECT_TRUE(manager_.copyItemAtURL(from, to).error().isPosix(ENOENT));
  EXPECT_TRUE(manager_.moveItemIfExistsAtURL(from, to));
  EXPECT_TRUE(manager_.copyItemIfExistsAtURL(from, to));
  write("/private/var/mobile/from", "x");
  ASSERT_TRUE(manager_.copyItemIfExistsAtURL(from, to));
  EXPECT_TRUE(manager_.itemExistsAtURL(from));
  ASSERT_TRUE(manager_.moveItemIfExistsAtURL(from, to));
  EXPECT_TRUE(manager_.itemDoesNotExistAtURL(from));
  EXPECT_TRUE(manager_.itemExistsAtURL(to));
  // Below a file nothing can be said to be missing.
  EXPECT_FALSE(manager_.itemExistsAtURL(to.appending("x")));
  EXPECT_FALSE(manager_.itemDoesNotExistAtURL(to.appending("x")));
  EXPECT_TRUE(isLogged("Failed to determine if " + to.path() + "/x exists: Not a directory"));
  EXPECT_TRUE(manager_.moveItemIfExistsAtURL(to.appending("x"), from).error().isPosix(ENOTDIR));
  std::filesystem::create_symlink("nowhere", from.path());
  EXPECT_TRUE(manager_.itemExistsAtURL(from));
}

TEST_F(TSYFileManagerTest, movesAcrossFileSystems) {
  const std::string elsewhere = platform_.path("/elsewhere");
  std::filesystem::create_directory(elsewhere);
  if (::unshare(CLONE_NEWNS) != 0 ||
      ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
      ::mount("tmpfs", elsewhere.c_str(), "tmpfs", 0, nullptr) != 0) {
    GTEST_SKIP() << "may not mount";
  }
  // The device's own root is outside the namespace, in which nothing is mounted.
  const auto device = platform::DevicePlatform::open(platform_.path(""));
  platform::Platform::setCurrent((*device)->platform());
  write("/source/d/file", "content");
  std::filesystem::create_symlink("d/file", platform_.path("/source/link"));
  ASSERT_EQ(::chown(platform_.path("/source/d").c_str(), 501, 502), 0);
  ASSERT_TRUE(manager_.moveItemAtURL(url("/source"), url("/elsewhere/target")));
  EXPECT_TRUE(manager_.itemDoesNotExistAtURL(url("/source")));
  EXPECT_EQ(Scratch::look(elsewhere + "/target/d").st_uid, 501U);
  EXPECT_EQ(std::filesystem::read_symlink(elsewhere + "/target/link"), "d/file");
  EXPECT_EQ(std::filesystem::file_size(elsewhere + "/target/d/file"), 7U);
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(elsewhere), {}), 1) << "a rest";
  // What cannot be put there stays where it was.
  write("/source/d/file", "other");
  EXPECT_TRUE(
      manager_.moveItemAtURL(url("/source"), url("/elsewhere/target")).error().isPosix(ENOTEMPTY));
  EXPECT_TRUE(manager_.itemExistsAtURL(url("/source/d/file")));
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
  EXPECT_TRUE(isLogged("Unset UF_IMMUTABLE on " + platform_.path("/tree/file")));
  EXPECT_TRUE(isLogged("removefile hit error for " + platform_.path("/tree/file") +
                       " : Operation not permitted"));
  EXPECT_TRUE(manager_.removeItemAtURL(url("/tree"))) << "what is missing is removed";

  // A directory outside the tree keeps its flag, and so the tree stays.
  write("/outer/tree/file");
  ASSERT_TRUE(makeImmutable("/outer"));
  const auto removed = manager_.removeItemAtURL(url("/outer/tree"));
  ASSERT_FALSE(removed);
  EXPECT_EQ(removed.error().localizedDescription(),
            "removefile of " + platform_.path("/outer/tree") + " failed: Operation not permitted");
  EXPECT_TRUE(manager_.itemExistsAtURL(url("/outer/tree")));
  EXPECT_EQ(std::system(("chattr -i '" + platform_.path("/outer") + "'").c_str()), 0);

  const auto none = manager_.removeItemAtURL(TSYURL());
  EXPECT_TRUE(none.error().isPosix(EFAULT));
}

TEST_F(TSYFileManagerTest, listsWithoutNamesThatBeginWithADot) {
  write("/d/" + std::string(kTSYMetadataFileName));
  write("/d/.hidden");
  write("/d/a");
  std::filesystem::create_symlink("nowhere", platform_.path("/d/b"));
  auto items = manager_.urlsForItemsInDirectoryAtURL(url("/d")).value();
  std::ranges::sort(items, {}, &TSYURL::path);
  EXPECT_EQ(items, (std::vector{url("/d/a"), url("/d/b")}));
  const auto missing = manager_.urlsForItemsInDirectoryAtURL(url("/x"));
  EXPECT_TRUE(missing.error().isPosix(ENOENT));
  EXPECT_FALSE(isLogged("opendir of " + platform_.path("/x")));
  EXPECT_TRUE(manager_.urlsForItemsInDirectoryAtURL(url("/d/a")).error().isPosix(ENOTDIR));
  EXPECT_TRUE(isLogged("opendir of " + platform_.path("/d/a") + " failed: Not a directory"));
}

TEST_F(TSYFileManagerTest, changesTheClassOnlyWhenThePredicateAgrees) {
  write("/f");
  std::filesystem::create_symlink("f", platform_.path("/l"));
  int seen = -1;
  const auto answer = [&](bool agrees) {
    return [&seen, agrees](int current) {
      seen = current;
      return agrees;
    };
  };
  EXPECT_TRUE(manager_.setDataProtectionClassOfItemAtURL(url("/f"), 1, answer(false)));
  EXPECT_EQ(manager_.dataProtectionClassOfItemAtURL(url("/f")).value(), 3);
  EXPECT_TRUE(manager_.setDataProtectionClassOfItemAtURL(url("/f"), 1, answer(true)));
  EXPECT_EQ(seen, 3);
  EXPECT_EQ(manager_.dataProtectionClassOfItemAtURL(url("/f")).value(), 1);
  ASSERT_TRUE(platform::Platform::current().keyBag.setLockState(platform::KeyBag::kLocked));
  const auto locked = manager_.setDataProtectionClassOfItemAtURL(url("/f"), 2);
  EXPECT_TRUE(locked.error().isPosix(EPERM));
  EXPECT_EQ(locked.error().localizedDescription(),
            "Failed to setclass(2) on file " + platform_.path("/f") + ": Operation not permitted");
  EXPECT_TRUE(manager_.setDataProtectionClassOfItemAtURL(url("/l"), 2).error().isPosix(ELOOP));
}

TEST_F(TSYFileManagerTest, standardizesOwnersAndModes) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root gives files away";
  const std::string metadata = "/c/" + std::string(kTSYMetadataFileName);
  write("/c/sub/plain");
  write("/c/sub/run");
  write(metadata);
  write("/victim");
  std::filesystem::create_symlink(platform_.path("/victim"), platform_.path("/c/link"));
  for (const auto& [path, mode] : {std::pair{"/c", 0700U},
                                   {"/c/sub", 02777U},
                                   {"/c/sub/plain", 0666U},
                                   {"/c/sub/run", 06610U},
                                   {"/victim", 0600U}}) {
    ASSERT_EQ(::chmod(platform_.path(path).c_str(), mode), 0);
  }
  ASSERT_EQ(::chmod(platform_.path(metadata).c_str(), 0640), 0);
  ASSERT_TRUE(manager_.standardizeOwnershipAtURL(url("/c"), 501, 502));
  struct Expected {
    std::string path;
    mode_t mode;
    uid_t uid;
    gid_t gid;
  };
  for (const Expected& item :
       {Expected{"/c", 0755, 501, 502}, Expected{"/c/sub", 0755, 501, 502},
        Expected{"/c/sub/plain", 0644, 501, 502}, Expected{"/c/sub/run", 0755, 501, 502},
        Expected{"/c/link", 0777, 501, 502}, Expected{metadata, 0640, 0, 0},
        Expected{"/victim", 0600, 0, 0}}) {
    const struct stat status = Scratch::look(platform_.path(item.path));
    EXPECT_EQ(status.st_mode & 07777U, item.mode) << item.path;
    EXPECT_EQ(status.st_uid, item.uid) << item.path;
    EXPECT_EQ(status.st_gid, item.gid) << item.path;
  }
  const auto missing = manager_.standardizeOwnershipAtURL(url("/x"), 501, 501);
  EXPECT_EQ(missing.error().localizedDescription(),
            "Error for path " + platform_.path("/x") + ": No such file or directory");
}

TEST_F(TSYFileManagerTest, givesSystemContainersTheirLists) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root gives files away";
  const std::string metadata = "/all/c/" + std::string(kTSYMetadataFileName);
  write("/all/c/sub/file");
  write("/all/other/file");
  write(metadata);
  write("/victim");
  std::filesystem::create_symlink(platform_.path("/victim"), platform_.path("/all/c/link"));
  const struct stat before = Scratch::look(platform_.path("/all/c"));
  ASSERT_TRUE(manager_.standardizeAllSystemContainerACLsAtURL(url("/all")));
  struct Expected {
    std::string path;
    std::string access;
    uid_t uid;
  };
  for (const Expected& item :
       {Expected{"/all/c", kTopLevel, 0}, Expected{"/all/other", kTopLevel, 0},
        Expected{"/all/c/sub", kInner, 4294967294}, Expected{"/all/c/sub/file", kInner, 4294967294},
        Expected{metadata, "user::rw-,group::r--,other::r--,", 0},
        Expected{"/victim", "user::rw-,group::r--,other::r--,", 0}}) {
    EXPECT_EQ(aclText(platform_.path(item.path), ACL_TYPE_ACCESS), item.access) << item.path;
    EXPECT_EQ(Scratch::look(platform_.path(item.path)).st_uid, item.uid) << item.path;
  }
  EXPECT_EQ(aclText(platform_.path("/all/c"), ACL_TYPE_DEFAULT), kDefault);
  EXPECT_EQ(aclText(platform_.path("/all/c/sub"), ACL_TYPE_DEFAULT), kDefault);
  EXPECT_EQ(Scratch::look(platform_.path("/all/c")).st_ino, before.st_ino);
  // A directory that the daemon makes inside is open to the group at once.
  ASSERT_TRUE(manager_.createDirectoryAtURL(url("/all/c/Library/Caches"),
                                            /*withIntermediateDirectories=*/true, 0, 4294967294,
                                            0));
  EXPECT_EQ(aclText(platform_.path("/all/c/Library"), ACL_TYPE_ACCESS), kInner);
  EXPECT_EQ(aclText(platform_.path("/all/c/Library/Caches"), ACL_TYPE_ACCESS), kInner);
  // Outside a system container the root is an item like any other.
  ASSERT_TRUE(manager_.standardizeACLsAtURL(url("/all/c/sub/file"), /*isSystemContainer=*/false));
  ASSERT_TRUE(manager_.standardizeACLsAtURL(url("/all/other"), /*isSystemContainer=*/false));
  EXPECT_EQ(aclText(platform_.path("/all/other"), ACL_TYPE_ACCESS), kInner);
  EXPECT_TRUE(manager_.standardizeAllSystemContainerACLsAtURL(url("/none")));

  EXPECT_TRUE(
      manager_.setTopLevelSystemContainerACLAtURL(url("/victim")).error().is(TSYErrorACLFailed));
  write("/etc/group", "others:x:1:\n");
  const auto ungrouped = manager_.setTopLevelSystemContainerACLAtURL(url("/all/c"));
  EXPECT_TRUE(ungrouped.error().is(TSYErrorACLFailed));
  EXPECT_EQ(ungrouped.error().localizedDescription(),
            "mbr_identifier_to_uuid() failed: No such file or directory");
}

TEST_F(TSYFileManagerTest, measuresTrees) {
  write("/t/file", std::string(100000, 'x'));
  EXPECT_GE(manager_.diskUsageForURL(url("/t")), 100000U);
  EXPECT_EQ(manager_.fastDiskUsageForURL(url("/t")), manager_.diskUsageForURL(url("/t")));
  EXPECT_EQ(manager_.diskUsageForURL(url("/x")), 0U);
  EXPECT_TRUE(isLogged("Failed to get dirstats on " + platform_.path("/x") +
                       " using fallback: (err 2) No such file or directory"));
}

TEST_F(TSYFileManagerTest, acceptsOnlyPathsInsideTheBase) {
  const std::string base = kBase;
  write(base + "/a/file");
  write(base + "2/file");
  write("/private/var/mobile/x/file");
  write("/etc/secret");
  const auto link = [&](const std::string& text, const std::string& name) {
    std::filesystem::create_symlink(text, platform_.path(base + name));
  };
  link("/etc", "/absolute");
  link("../x", "/outside");
  link("../../x", "/a/climbing");
  link("a/file", "/inside");
  link(".", "/self");
  link("../a", "/a/sibling");
  link("absolute/secret", "/hidden");  // its text stays inside; what it passes through does not
  link("nothing", "/dangling");
  link("loop", "/loop");

  struct Case {
    std::string suspicious;
    std::string resolved;  // none when empty
    std::string log;
    std::string base = kBase;
  };
  const std::string kOutside = "as it is points outside or to the base";
  const Case cases[] = {
      {base + "/a/file", base + "/a/file", ""},
      {base + "/a/b/c", base + "/a/b/c", "appending non-existing components /b/c"},
      {base, base, ""},
      {base + "/a/./file", base + "/a/file", ""},
      {base + "/inside", base + "/a/file", ""},
      {base + "/a/sibling/new", base + "/a/new", ""},
      {base + "/self/a", base + "/a", ""},
      {"/var/mobile/base/a", base + "/a", ""},
      {"/private/var/mobile/x", "", "does not contain base path"},
      {base + "/a/../../x", "", "contains '..' paths, which are invalid"},
      {base + "2/file", "", "because components diverge at base != base2"},
      {base + "/absolute", "", "as absolute symlinks are not allowed"},
      {base + "/absolute/secret", "", "because base component count is greater"},
      {base + "/absolute/not/there/at/all", "", "because components diverge at private != etc"},
      {base + "/outside", "", kOutside},
      {base + "/outside/file", "", "because components diverge at base != x"},
      {base + "/a/climbing", "", kOutside},
      {base + "/hidden", "", "because base component count is greater"},
      {base + "/dangling", "", "Failed to retrieve realpath for suspicious path"},
      {base + "/dangling/new", "", "Failed to retrieve realpath for suspicious path"},
      {base + "/loop/x", "", "Readlink failed: Too many levels of symbolic links"},
      {base + "/a/file/x", "", "Readlink failed: Not a directory"},
      {base + "3/x", "", "Failed to retrieve realpath for base path", base + "3"},
      {"/x", "", "because real component counts don't make sense", "/"},
  };
  for (const Case& each : cases) {
    std::ofstream(platform_.path("/log"), std::ios::trunc);
    const auto real = manager_.realPathForURL(url(each.suspicious), url(each.base));
    if (each.resolved.empty()) {
      EXPECT_FALSE(real) << each.suspicious;
    } else {
      ASSERT_TRUE(real) << each.suspicious;
      EXPECT_EQ(real->path(), platform_.path(each.resolved)) << each.suspicious;
    }
    EXPECT_TRUE(isLogged(each.log)) << each.suspicious << ": " << each.log;
  }
  EXPECT_FALSE(manager_.realPathForURL(TSYURL(), url(base)));
  EXPECT_FALSE(manager_.realPathForURL(TSYURL("/etc/passwd"), TSYURL("/etc")));
  EXPECT_FALSE(manager_.realPathForURL(url(base + std::string("/a\0/x", 5)), url(base)));
}

TEST_F(TSYFileManagerTest, findsHomesBelowTheRoot) {
  write("/etc/passwd",
        "linked:x:601:601::/linked:/bin/sh\n"
        "far:x:602:602::/far:/bin/sh\n"
        "gone:x:603:603::/gone:/bin/sh\n");
  std::filesystem::create_symlink("/private/var/alice", platform_.path("/linked"));
  std::filesystem::create_symlink("/../../../../../../tmp", platform_.path("/far"));
  const std::pair<uid_t, const char*> cases[] = {{601, "/private/var/alice"},
                                                 {602, "/private/var/mobile"},
                                                 {603, "/private/var/mobile"},
                                                 {604, "/private/var/mobile"}};
  for (const auto& [uid, home] : cases) {
    EXPECT_EQ(TSYFileManager::homeDirectoryURLForPOSIXUID(uid), url(home)) << uid;
  }
  EXPECT_TRUE(isLogged("Failed to getpwuid for uid: 604"));
}

}  // namespace
