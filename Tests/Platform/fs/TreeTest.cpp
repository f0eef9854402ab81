// Walks, copies, measurements and removals of whole trees.
#include <fcntl.h>
#include <fmt/format.h>
#include <linux/fs.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/xattr.h>

#include <algorithm>
#include <atomic>
#include <map>
#include <thread>

#include "Platform/fs/AccessControl.h"
#include "Platform/fs/FileSystem.h"
#include "Tests/Platform/fs/Scratch.h"

namespace platform {
namespace {

constexpr int kDeep = 10000;

// A chain of directories, each with a file beside the next one: deeper than any path can be.
void buildDeepTree(const std::string& path) {
  std::filesystem::create_directory(path);
  FileDescriptor directory(::open(path.c_str(), O_RDONLY | O_DIRECTORY));
  for (int depth = 0; depth < kDeep; ++depth) {
    ASSERT_EQ(::mkdirat(directory.get(), "d", 0700), 0);
    ASSERT_EQ(::mknodat(directory.get(), "f", S_IFREG | 0600, 0), 0);
    directory = FileDescriptor(::openat(directory.get(), "d", O_RDONLY | O_DIRECTORY));
  }
}

size_t countOpenDescriptors() {
  const std::filesystem::directory_iterator open("/proc/self/fd");
  return static_cast<size_t>(std::distance(begin(open), end(open)));
}

// Swaps a directory with a link to another one, over and over, while it lives.
class Swapper {
 public:
  Swapper(std::string directory, const std::string& target)
      : directory_(std::move(directory)), link_(directory_ + ".link") {
    std::filesystem::create_symlink(target, link_);
    thread_ = std::thread([this] {
      while (!ends_) {
        ::syscall(SYS_renameat2, AT_FDCWD, directory_.c_str(), AT_FDCWD, link_.c_str(),
                  RENAME_EXCHANGE);
      }
    });
  }
  ~Swapper() {
    ends_ = true;
    thread_.join();
  }

 private:
  const std::string directory_;
  const std::string link_;
  std::atomic<bool> ends_ = false;
  std::thread thread_;
};

TEST(TreeTest, GoesThroughTreesOfAnyDepthWithFewDescriptors) {
  Scratch scratch;
  // In memory where that may be mounted: a disk takes a minute for that many directories.
  if (!scratch.mount("m")) std::filesystem::create_directories(scratch.path("m"));
  const FileSystem& files = scratch.files();
  buildDeepTree(scratch.path("m/deep"));
  const size_t before = countOpenDescriptors();
  size_t most = 0;
  std::map<FileSystem::Visit, int> visits;
  const auto count = [&](const FileSystem::WalkEntry& entry) {
    if (++visits[entry.visit] % 1000 == 0) most = std::max(most, countOpenDescriptors());
    return true;
  };
  ASSERT_TRUE(files.walk(scratch.path("m/deep"), count));
  EXPECT_EQ(visits[FileSystem::Visit::item], kDeep);
  EXPECT_EQ(visits[FileSystem::Visit::directoryBefore], kDeep + 1);
  EXPECT_EQ(visits[FileSystem::Visit::directoryAfter], kDeep + 1);
  EXPECT_LT(most, before + 64);

  ASSERT_TRUE(files.copy(scratch.path("m/deep"), scratch.path("m/copy")));
  EXPECT_EQ(files.measure(scratch.path("m/copy"))->descendants, 2U * kDeep);
  for (const char* tree : {"m/deep", "m/copy"}) {
    ASSERT_TRUE(files.remove(scratch.path(tree), nullptr));
    EXPECT_EQ(errorOf(files.status(scratch.path(tree))), ENOENT);
  }
  EXPECT_EQ(countOpenDescriptors(), before);
}

TEST(TreeTest, WalksAsTheVisitorWishes) {
  Scratch scratch;
  scratch.write(scratch.path("t/a/f"), "");
  scratch.write(scratch.outside("secret/file"), "");
  std::filesystem::create_symlink(scratch.outside("secret"), scratch.path("t/a/l"));
  std::vector<std::string> seen;
  const auto record = [&](const FileSystem::WalkEntry& entry) {
    const char marks[] = {'i', 'b', 'a'};
    EXPECT_TRUE(entry.path.ends_with('/' + entry.name));
    EXPECT_EQ(entry.isRoot, entry.name == "t");
    struct stat status{};
    EXPECT_EQ(::fstatat(entry.parent, entry.name.c_str(), &status, AT_SYMLINK_NOFOLLOW), 0);
    EXPECT_EQ(status.st_ino, entry.status.st_ino);
    EXPECT_EQ(status.st_mode, entry.status.st_mode);
    seen.push_back(marks[static_cast<int>(entry.visit)] +
                   entry.path.substr(scratch.path("").size()));
    return true;
  };
  ASSERT_TRUE(scratch.files().walk(scratch.path("t"), record));
  ASSERT_EQ(seen.size(), 6U);
  std::sort(seen.begin() + 2, seen.begin() + 4);  // the order of the directory is its own
  EXPECT_EQ(seen, (std::vector<std::string>{"bt", "bt/a", "it/a/f", "it/a/l", "at/a", "at"}));

  int visits = 0;
  ASSERT_TRUE(scratch.files().walk(scratch.path("t"), [&](const auto&) { return ++visits < 2; }));
  EXPECT_EQ(visits, 2);
  EXPECT_EQ(errorOf(scratch.files().walk(scratch.path("x"), record)), ENOENT);
}

TEST(TreeTest, StaysOutOfWhatIsMountedInside) {
  Scratch scratch;
  scratch.write(scratch.path("t/before"), "");
  scratch.write(scratch.path("t/file"), "");
  if (!scratch.mount("t/m")) GTEST_SKIP() << "may not mount";
  scratch.write(scratch.path("t/m/inner"), "inner");
  ASSERT_EQ(::mount(scratch.path("t/m/inner").c_str(), scratch.path("t/file").c_str(), nullptr,
                    MS_BIND, nullptr),
            0);
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
  EXPECT_EQ(failures,
            (std::map<std::string, int>{{"m", EXDEV}, {"file", EBUSY}, {"t", ENOTEMPTY}}));
  EXPECT_EQ(errorOf(scratch.files().remove(scratch.path("t/m"), nullptr)), EXDEV);
  EXPECT_EQ(errorOf(scratch.files().status(scratch.path("t/before"))), ENOENT);
  EXPECT_EQ(scratch.read(scratch.path("t/m/inner")), "inner");
  EXPECT_EQ(errorOf(scratch.files().rename(scratch.path("t/m/inner"), scratch.path("i"))), EXDEV);
  ::umount(scratch.path("t/file").c_str());
}

TEST(TreeTest, RemovesEveryKindOfItem) {
  Scratch scratch;
  scratch.write(scratch.path("t/a/b/file"), "");
  scratch.write(scratch.outside("secret/file"), "kept");
  std::filesystem::create_directory_symlink(scratch.outside("secret"), scratch.path("t/a/link"));
  ::mkfifo(scratch.path("t/fifo").c_str(), 0);
  std::filesystem::create_directory(scratch.path("t/closed"));
  scratch.write(scratch.path("t/closed/file"), "");
  if (scratch.files().privilege() == Privilege::root) {
    ASSERT_EQ(::chmod(scratch.path("t/closed").c_str(), 0), 0);
  }
  for (int i = 0; i < 5000; ++i) scratch.write(scratch.path(fmt::format("t/many/{:060}", i)), "");
  std::filesystem::create_directory_symlink(scratch.outside("secret"), scratch.path("l"));
  for (const char* gone : {"t", "l", "never/was", "never"}) {
    EXPECT_TRUE(scratch.files().remove(scratch.path(gone), nullptr)) << gone;
    EXPECT_EQ(errorOf(scratch.files().status(scratch.path(gone))), ENOENT) << gone;
  }
  EXPECT_EQ(scratch.read(scratch.outside("secret/file")), "kept");
}

TEST(TreeTest, TellsOfTheFirstErrorAndGoesOn) {
  Scratch scratch;
  for (const char* file : {"t/a/1", "t/b/2", "t/c"}) scratch.write(scratch.path(file), "");
  if (std::system(("chattr +i '" + scratch.path("t/a/1") + "' 2>/dev/null").c_str()) != 0) {
    GTEST_SKIP() << "no immutable flags here";
  }
  std::vector<std::string> paths;
  const auto record = [&](int, const std::string&, const std::string& path, Errno error) {
    paths.push_back(path);
    return std::optional(error);
  };
  EXPECT_EQ(errorOf(scratch.files().remove(scratch.path("t"), record)), EPERM);
  EXPECT_EQ(paths, (std::vector{scratch.path("t/a/1"), scratch.path("t/a"), scratch.path("t")}));
  EXPECT_EQ(scratch.files().list(scratch.path("t"))->size(), 1U);
  // Somebody who removes the item himself makes it no error at all.
  const auto overcome = [&](int parent, const std::string& name, const std::string&, Errno) {
    EXPECT_TRUE(scratch.files().clearImmutableAt(parent, name));
    EXPECT_EQ(::unlinkat(parent, name.c_str(), 0), 0);
    return std::optional<Errno>();
  };
  EXPECT_TRUE(scratch.files().remove(scratch.path("t"), overcome));
}

TEST(TreeTest, IsNotLedAwayByASwap) {
  Scratch scratch;
  const std::string secret = scratch.outside("secret");
  for (int i = 0; i < 20; ++i) scratch.write(secret + fmt::format("/d{}/file", i), "kept");
  const mode_t mode = Scratch::mode(secret);
  for (int round = 0; round < 100; ++round) {
    for (int i = 0; i < 10; ++i) scratch.write(scratch.path(fmt::format("t/a/b{}/f", i)), "");
    const Swapper swapper(scratch.path("t/a"), secret);
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
  const bool isRoot = files.privilege() == Privilege::root;
  scratch.write(scratch.path("t/file"), "content");
  scratch.write(scratch.path("t/sub/run"), "#!");
  std::filesystem::create_symlink("../nowhere", scratch.path("t/link"));
  ::mkfifo(scratch.path("t/fifo").c_str(), 0640);
  ::mknod(scratch.path("t/socket").c_str(), S_IFSOCK | 0600, 0);
  // A hole, data, a hole.
  scratch.write(scratch.path("t/sparse"), "");
  std::filesystem::resize_file(scratch.path("t/sparse"), 64 << 20);
  {
    std::fstream sparse(scratch.path("t/sparse"));
    sparse.seekp(32 << 20);
    sparse << "middle";
  }
  ASSERT_EQ(::chmod(scratch.path("t/sub/run").c_str(), 04711), 0);
  ASSERT_EQ(::setxattr(scratch.path("t/file").c_str(), "user.mark", "x", 1, 0), 0);
  const std::string longName = "user." + std::string(200, 'n');  // a list beyond the first buffer
  ASSERT_EQ(::setxattr(scratch.path("t/file").c_str(), longName.c_str(), "y", 1, 0), 0);
  if (isRoot) {
    ASSERT_EQ(::setxattr(scratch.path("t/sub").c_str(), "trusted.mark", "z", 1, 0), 0);
    ASSERT_EQ(::lchown(scratch.path("t/link").c_str(), 501, 502), 0);
    ASSERT_EQ(::chown(scratch.path("t/sub").c_str(), 503, 504), 0);
  }
  const auto place = files.locate(scratch.path("t/sub"));
  // Nobody but root opens what its list closes.
  if (isRoot) {
    ASSERT_TRUE(setACL(place->parent.get(), "fifo", ACLShape::file, 54321));
  }
  ASSERT_TRUE(setACL(place->parent.get(), "sub", ACLShape::topLevelDirectory, 54321));
  const timespec times[] = {{1000, 0}, {2000, 5}};
  for (const char* name : {"t/link", "t/file", "t/sub", "t"}) {
    ASSERT_EQ(::utimensat(AT_FDCWD, scratch.path(name).c_str(), times, AT_SYMLINK_NOFOLLOW), 0);
  }
  // The copy must not inherit from where it is made.
  std::filesystem::create_directory(scratch.path("c"));
  const auto target = files.locate(scratch.path("c"));
  ASSERT_TRUE(setACL(target->parent.get(), "c", ACLShape::topLevelDirectory, 99));

  ASSERT_TRUE(files.copy(scratch.path("t"), scratch.path("c/t")));
  EXPECT_EQ(files.list(scratch.path("c"))->size(), 1U) << "a rest was left";
  for (const char* name : {"", "/file", "/sub", "/sub/run", "/link", "/fifo", "/sparse"}) {
    const std::string source = scratch.path("t") + name;
    const std::string copy = scratch.path("c/t") + name;
    const struct stat one = Scratch::look(source);
    const struct stat other = Scratch::look(copy);
    EXPECT_EQ(one.st_mode, other.st_mode) << name;
    EXPECT_EQ(one.st_uid, other.st_uid) << name;
    EXPECT_EQ(one.st_gid, other.st_gid) << name;
    EXPECT_EQ(one.st_mtim.tv_sec, other.st_mtim.tv_sec) << name;
    EXPECT_EQ(one.st_mtim.tv_nsec, other.st_mtim.tv_nsec) << name;
    if (S_ISLNK(one.st_mode)) continue;
    EXPECT_EQ(aclText(source, ACL_TYPE_ACCESS), aclText(copy, ACL_TYPE_ACCESS)) << name;
    if (!S_ISDIR(one.st_mode)) continue;
    EXPECT_EQ(aclText(source, ACL_TYPE_DEFAULT), aclText(copy, ACL_TYPE_DEFAULT)) << name;
  }
  char value = 0;
  EXPECT_EQ(::getxattr(scratch.path("c/t/file").c_str(), "user.mark", &value, 1), 1);
  EXPECT_EQ(value, 'x');
  EXPECT_EQ(::getxattr(scratch.path("c/t/file").c_str(), longName.c_str(), &value, 1), 1);
  if (isRoot) {
    EXPECT_EQ(::getxattr(scratch.path("c/t/sub").c_str(), "trusted.mark", &value, 1), 1);
  }
  EXPECT_EQ(scratch.read(scratch.path("c/t/file")), "content");
  EXPECT_EQ(std::filesystem::read_symlink(scratch.path("c/t/link")), "../nowhere");
  EXPECT_EQ(errorOf(files.status(scratch.path("c/t/socket"))), ENOENT);
  EXPECT_EQ(scratch.read(scratch.path("t/sparse")), scratch.read(scratch.path("c/t/sparse")));
  EXPECT_LT(Scratch::look(scratch.path("c/t/sparse")).st_blocks, (1 << 20) / 512);

  EXPECT_EQ(errorOf(files.copy(scratch.path("t"), scratch.path("t/sub/t"))), EINVAL);
  EXPECT_EQ(errorOf(files.copy(scratch.path("none"), scratch.path("c/none"))), ENOENT);
  EXPECT_EQ(errorOf(files.copy(scratch.path("t"), scratch.path("c/t"))), ENOTEMPTY);
  EXPECT_EQ(files.list(scratch.path("c"))->size(), 1U) << "a rest was left";
}

TEST(TreeTest, CountsAFileWithSeveralNamesOnce) {
  Scratch scratch;
  scratch.write(scratch.path("t/one"), std::string(1 << 20, 'x'));
  const auto before = scratch.files().measure(scratch.path("t")).value();
  EXPECT_EQ(before.descendants, 1U);
  EXPECT_GE(before.bytes, 1U << 20);
  std::filesystem::create_directory(scratch.path("t/d"));
  std::filesystem::create_hard_link(scratch.path("t/one"), scratch.path("t/d/two"));
  scratch.write(scratch.outside("big"), std::string(1 << 20, 'x'));
  std::filesystem::create_symlink(scratch.outside("big"), scratch.path("t/link"));
  const auto after = scratch.files().measure(scratch.path("t")).value();
  EXPECT_EQ(after.descendants, 4U);
  EXPECT_LT(after.bytes, before.bytes + (64 << 10));
}

}  // namespace
}  // namespace platform
