// Walks, copies, measurements and removals of whole trees.
#include <fcntl.h>
#include <fmt/format.h>
#include <linux/fs.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/xattr.h>

#include <algorithm>
#include <cerrno>
#include <map>
#include <system_error>
#include <thread>

#include "Platform/fs/AccessControl.h"
#include "Platform/fs/FileSystem.h"
#include "Tests/Platform/fs/Scratch.h"

namespace platform {
namespace {

constexpr int kDeep = 10000;

FileDescriptor directoryAt(int parent, const std::string& path) {
  FileDescriptor directory(::openat(parent, path.c_str(), O_RDONLY | O_DIRECTORY));
  if (!directory.valid()) throw std::system_error(errno, std::generic_category(), path);
  return directory;
}

// A chain of directories, each with a file beside the next one: deeper than any path can be.
void buildDeepTree(const std::string& path) {
  std::filesystem::create_directory(path);
  FileDescriptor directory = directoryAt(AT_FDCWD, path);
  for (int depth = 0; depth < kDeep; ++depth) {
    ASSERT_EQ(::mkdirat(directory.get(), "d", 0700), 0);
    ASSERT_EQ(::mknodat(directory.get(), "f", S_IFREG | 0600, 0), 0);
    directory = directoryAt(directory.get(), "d");
  }
}

size_t countOpenDescriptors() {
  const std::filesystem::directory_iterator open("/proc/self/fd");
  return static_cast<size_t>(std::distance(begin(open), end(open)));
}

TEST(TreeTest, GoesThroughTreesOfAnyDepthWithFewDescriptors) {
  Scratch scratch;
  // In memory where that may be mounted: a disk takes a minute for that many directories.
  if (!scratch.mount("m")) std::filesystem::create_directories(scratch.path("m"));
  const FileSystem& files = scratch.files();
  buildDeepTree(scratch.path("m/deep"));
  const size_t before = countOpenDescriptors();
  size_t most = 0;
  int visits = 0;
  const auto count = [&](const FileSystem::WalkEntry&) {
    if (++visits % 1000 == 0) most = std::max(most, countOpenDescriptors());
    return true;
  };
  ASSERT_TRUE(files.walk(scratch.path("m/deep"), count));
  EXPECT_EQ(visits, 3 * kDeep + 2);
  EXPECT_LT(most, before + 64);

  ASSERT_TRUE(files.copy(scratch.path("m/deep"), scratch.path("m/copy")));
  EXPECT_EQ(files.measure(scratch.path("m/copy"))->descendants, 2U * kDeep);
  for (const char* tree : {"m/deep", "m/copy"}) {
    ASSERT_TRUE(files.remove(scratch.path(tree), nullptr));
    EXPECT_EQ(errorOf(files.status(scratch.path(tree))), ENOENT);
  }
  EXPECT_EQ(countOpenDescriptors(), before);
}

TEST(TreeTest, StaysOutOfWhatIsMountedInside) {
  Scratch scratch;
  scratch.write(scratch.path("t/before"), "");
  if (!scratch.mount("t/m")) GTEST_SKIP() << "may not mount";
  scratch.write(scratch.path("t/m/inner"), "inner");
  EXPECT_EQ(scratch.files().measure(scratch.path("t"))->descendants, 1U);
  EXPECT_EQ(errorOf(scratch.files().copy(scratch.path("t"), scratch.path("c"))), EXDEV);
  EXPECT_EQ(scratch.files().list(scratch.path(""))->size(), 1U) << "half a copy was left";
  std::map<std::string, int> failures;
  const auto removed = scratch.files().remove(
      scratch.path("t"), [&](int, const std::string& name, const std::string&, Errno error) {
        failures[name] = error.value;
        return std::optional(error);
      });
  EXPECT_FALSE(removed);
  EXPECT_EQ(failures, (std::map<std::string, int>{{"m", EXDEV}, {"t", ENOTEMPTY}}));
  EXPECT_EQ(errorOf(scratch.files().status(scratch.path("t/before"))), ENOENT);
  EXPECT_EQ(scratch.read(scratch.path("t/m/inner")), "inner");
}

TEST(TreeTest, IsNotLedAwayByASwap) {
  Scratch scratch;
  const std::string secret = scratch.outside("secret");
  for (int i = 0; i < 20; ++i) scratch.write(secret + fmt::format("/d{}/file", i), "kept");
  const mode_t mode = Scratch::mode(secret);
  for (int round = 0; round < 100; ++round) {
    for (int i = 0; i < 10; ++i) scratch.write(scratch.path(fmt::format("t/a/b{}/f", i)), "");
    const std::string directory = scratch.path("t/a");
    const std::string link = directory + ".link";
    std::filesystem::create_symlink(secret, link);
    const std::jthread swapper([&](const std::stop_token& end) {
      while (!end.stop_requested()) {
        ::syscall(SYS_renameat2, AT_FDCWD, directory.c_str(), AT_FDCWD, link.c_str(),
                  RENAME_EXCHANGE);
      }
    });
    const auto change = [&](const FileSystem::WalkEntry& entry) {
      EXPECT_NE(entry.name, "file");
      if (!S_ISLNK(entry.status.st_mode)) {
        static_cast<void>(scratch.files().setModeAt(entry.parent, entry.name, 0711));
      }
      return true;
    };
    static_cast<void>(scratch.files().walk(scratch.path("t"), change));
    // The swap can keep a directory alive for the length of one removal.
    for (int attempt = 0; attempt < 100; ++attempt) {
      if (scratch.files().remove(scratch.path("t"), nullptr)) break;
    }
    EXPECT_EQ(errorOf(scratch.files().status(scratch.path("t"))), ENOENT);
  }
  EXPECT_EQ(Scratch::mode(secret), mode);
  for (int i = 0; i < 20; ++i)
    EXPECT_EQ(scratch.read(secret + fmt::format("/d{}/file", i)), "kept");
}

TEST(TreeTest, EndsWhenTheWayBackIsGone) {
  Scratch scratch;
  std::string path = scratch.path("t");
  for (int i = 0; i < 100; ++i) path += "/d";
  scratch.write(path + "/file", "");
  scratch.write(scratch.path("other/kept"), "");
  int visits = 0;
  const auto move = [&](const FileSystem::WalkEntry& entry) {
    // Out of an outer directory that is closed by now.
    if (entry.visit == FileSystem::Visit::item) {
      std::filesystem::rename(scratch.path("t/d/d/d/d"), scratch.path("other/moved"));
    }
    EXPECT_NE(entry.name, "kept");
    ++visits;
    return true;
  };
  EXPECT_EQ(errorOf(scratch.files().walk(scratch.path("t"), move)), ESTALE);
  EXPECT_GT(visits, 101);
}

TEST(TreeTest, CopiesEverythingThatMakesAnItem) {
  Scratch scratch;
  const FileSystem& files = scratch.files();
  const auto inTree = [&](const std::string& name) { return scratch.path("t") + name; };
  scratch.write(inTree("/file"), "content");
  scratch.write(inTree("/sub/run"), "#!");
  std::filesystem::create_symlink("../nowhere", inTree("/link"));
  ::mkfifo(inTree("/fifo").c_str(), 0640);
  ::mknod(inTree("/socket").c_str(), S_IFSOCK | 0600, 0);
  // A hole, data, a hole.
  scratch.write(inTree("/sparse"), "");
  std::filesystem::resize_file(inTree("/sparse"), 64 << 20);
  {
    std::fstream sparse(inTree("/sparse"));
    sparse.seekp(32 << 20);
    sparse << "middle";
  }
  ASSERT_EQ(::chmod(inTree("/sub/run").c_str(), 04711), 0);
  ASSERT_EQ(::setxattr(inTree("/file").c_str(), "user.mark", "x", 1, 0), 0);
  const std::string longName = "user." + std::string(200, 'n');  // a list beyond the first buffer
  ASSERT_EQ(::setxattr(inTree("/file").c_str(), longName.c_str(), "y", 1, 0), 0);
  if (files.privilege() == Privilege::root) {
    ASSERT_EQ(::lchown(inTree("/link").c_str(), 501, 502), 0);
    ASSERT_EQ(::chown(inTree("/sub").c_str(), 503, 504), 0);
  }
  const auto setList = [&](const std::string& path, gid_t group) {
    const auto place = files.locate(path);
    return setACL(place->parent.get(), place->name, ACLShape::topLevelDirectory, group);
  };
  ASSERT_TRUE(setList(inTree("/sub"), 54321));
  const timespec times[] = {{1000, 0}, {2000, 5}};
  for (const char* name : {"/link", "/file", "/sub", ""}) {
    ASSERT_EQ(::utimensat(AT_FDCWD, inTree(name).c_str(), times, AT_SYMLINK_NOFOLLOW), 0);
  }
  // The copy must not inherit from where it is made.
  std::filesystem::create_directory(scratch.path("c"));
  ASSERT_TRUE(setList(scratch.path("c"), 99));

  ASSERT_TRUE(files.copy(inTree(""), scratch.path("c/t")));
  for (const char* name : {"", "/file", "/sub", "/sub/run", "/link", "/fifo", "/sparse"}) {
    SCOPED_TRACE(name);
    const std::string copy = scratch.path("c/t") + name;
    const struct stat one = Scratch::look(inTree(name));
    const struct stat other = Scratch::look(copy);
    EXPECT_EQ(one.st_mode, other.st_mode);
    EXPECT_EQ(one.st_uid, other.st_uid);
    EXPECT_EQ(one.st_gid, other.st_gid);
    EXPECT_EQ(one.st_mtim.tv_sec, other.st_mtim.tv_sec);
    EXPECT_EQ(one.st_mtim.tv_nsec, other.st_mtim.tv_nsec);
    if (S_ISLNK(one.st_mode)) continue;
    for (const acl_type_t type : {acl_type_t{ACL_TYPE_ACCESS}, acl_type_t{ACL_TYPE_DEFAULT}}) {
      EXPECT_EQ(aclText(inTree(name), type), aclText(copy, type));
    }
  }
  for (const std::string& attribute : {std::string("user.mark"), longName}) {
    EXPECT_EQ(::getxattr(scratch.path("c/t/file").c_str(), attribute.c_str(), nullptr, 0), 1);
  }
  EXPECT_EQ(std::filesystem::read_symlink(scratch.path("c/t/link")), "../nowhere");
  EXPECT_EQ(errorOf(files.status(scratch.path("c/t/socket"))), ENOENT);
  EXPECT_EQ(scratch.read(inTree("/sparse")), scratch.read(scratch.path("c/t/sparse")));
  EXPECT_LT(Scratch::look(scratch.path("c/t/sparse")).st_blocks, (1 << 20) / 512);

  EXPECT_EQ(errorOf(files.copy(inTree(""), inTree("/sub/t"))), EINVAL);
  EXPECT_EQ(errorOf(files.copy(inTree(""), scratch.path("c/t"))), ENOTEMPTY);
  EXPECT_EQ(files.list(scratch.path("c"))->size(), 1U) << "a rest was left";
}

TEST(TreeTest, CountsAFileWithSeveralNamesOnceAndNoneBehindALink) {
  Scratch scratch;
  scratch.write(scratch.path("t/one"), std::string(1 << 20, 'x'));
  scratch.write(scratch.outside("big"), std::string(1 << 20, 'x'));
  std::filesystem::create_hard_link(scratch.path("t/one"), scratch.path("t/two"));
  std::filesystem::create_symlink(scratch.outside("big"), scratch.path("t/link"));
  const auto size = scratch.files().measure(scratch.path("t")).value();
  EXPECT_EQ(size.descendants, 3U);
  EXPECT_GE(size.bytes, 1U << 20);
  EXPECT_LT(size.bytes, (1U << 20) + (64 << 10));
}

}  // namespace
}  // namespace platform
