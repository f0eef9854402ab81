#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <algorithm>
#include <functional>

#include "Platform/fs/FileSystem.h"
#include "Tests/Platform/fs/Scratch.h"

namespace platform {
namespace {

constexpr size_t kLimit = 64;
const std::vector<uint8_t> kBytes = {'n', 'e', 'w'};

// Every operation on a path, for tables.
struct Operation {
  const char* name;
  std::function<int(const FileSystem&, const std::string&)> run;
};

const std::vector<Operation>& operations() {
  static const std::vector<Operation> all = {
      {"locate", [](const auto& files, const auto& path) { return errorOf(files.locate(path)); }},
      {"status", [](const auto& files, const auto& path) { return errorOf(files.status(path)); }},
      {"openItem",
       [](const auto& files, const auto& path) { return errorOf(files.openItem(path)); }},
      {"list", [](const auto& files, const auto& path) { return errorOf(files.list(path)); }},
      {"readFile",
       [](const auto& files, const auto& path) { return errorOf(files.readFile(path, kLimit)); }},
      {"writeFile", [](const auto& files,
                       const auto& path) { return errorOf(files.writeFile(path, kBytes, {})); }},
      {"makePath",
       [](const auto& files, const auto& path) { return errorOf(files.makePath(path, 0755)); }},
      {"rename",
       [](const auto& files, const auto& path) { return errorOf(files.rename(path, path)); }},
      {"copy",
       [](const auto& files, const auto& path) { return errorOf(files.copy(path, path + "2")); }},
      {"remove",
       [](const auto& files, const auto& path) { return errorOf(files.remove(path, nullptr)); }},
      {"measure", [](const auto& files, const auto& path) { return errorOf(files.measure(path)); }},
  };
  return all;
}

TEST(FileSystemTest, RefusesPathsThatAreNotPlainlyBelowTheRoot) {
  Scratch scratch;
  const std::string root = scratch.path("");
  scratch.write(scratch.path("a/b"), "old");
  const std::string paths[] = {"",
                               "/",
                               "a/b",
                               "/etc/passwd",
                               scratch.outside("rootx/a"),
                               scratch.outside("roo"),
                               root + "a/../a/b",
                               root + "./a/b",
                               root + "a/b/..",
                               root + "..",
                               root + std::string("a\0b", 3)};
  for (const std::string& path : paths) {
    for (const Operation& operation : operations()) {
      EXPECT_EQ(operation.run(scratch.files(), path), EINVAL) << operation.name << ' ' << path;
    }
  }
  EXPECT_EQ(scratch.read(scratch.path("a/b")), "old");
}

TEST(FileSystemTest, FollowsNothingThatStandsInPlaceOfADirectory) {
  Scratch scratch;
  scratch.write(scratch.outside("secret/inner/file"), "secret");
  const std::string directory = scratch.path("a/b");
  const std::pair<std::function<void()>, int> obstacles[] = {
      {[&] { std::filesystem::create_symlink(scratch.outside("secret"), directory); }, ELOOP},
      {[&] { std::filesystem::create_symlink("../../../secret", directory); }, ELOOP},
      {[&] { ::mkfifo(directory.c_str(), 0666); }, ENOTDIR},
      {[&] { scratch.write(directory, "file"); }, ENOTDIR},
  };
  std::filesystem::create_directory(scratch.path("a"));
  for (const auto& [place, error] : obstacles) {
    place();
    for (const Operation& operation : operations()) {
      EXPECT_EQ(operation.run(scratch.files(), directory + "/inner/file"), error)
          << operation.name << ' ' << error;
    }
    std::filesystem::remove(directory);
  }
  EXPECT_EQ(scratch.read(scratch.outside("secret/inner/file")), "secret");
}

TEST(FileSystemTest, NeitherReadsNorWritesThroughWhatStandsAtTheName) {
  Scratch scratch;
  const std::string name = scratch.path("item");
  const std::string victim = scratch.outside("victim");
  const std::pair<std::function<void()>, int> obstacles[] = {
      {[&] { std::filesystem::create_symlink(victim, name); }, ELOOP},
      {[&] { ::mkfifo(name.c_str(), 0666); }, EINVAL},
      {[&] { std::filesystem::create_hard_link(victim, name); }, 0},
      {[&] { scratch.write(name, std::string(kLimit + 1, 'x')); }, EFBIG},
      {[&] { ::mknod(name.c_str(), S_IFSOCK | 0666, 0); }, EINVAL},
  };
  for (const bool atomic : {false, true}) {
    for (const auto& [place, error] : obstacles) {
      scratch.write(victim, "victim");
      place();
      EXPECT_EQ(errorOf(scratch.files().readFile(name, kLimit)), error);
      const WriteOptions options{.mode = 0640, .protectionClass = 2, .atomic = atomic};
      ASSERT_EQ(errorOf(scratch.files().writeFile(name, kBytes, options)), 0);
      EXPECT_EQ(scratch.files().readFile(name, kLimit).value(), kBytes);
      EXPECT_EQ(Scratch::mode(name), 0640U);
      EXPECT_EQ(scratch.files().protectionClass(scratch.files().openItem(name)->get()).value(), 2);
      EXPECT_EQ(scratch.read(victim), "victim");
      std::filesystem::remove(name);
    }
    std::filesystem::create_directory(name);
    EXPECT_EQ(errorOf(scratch.files().readFile(name, kLimit)), EINVAL);
    EXPECT_EQ(errorOf(scratch.files().writeFile(name, kBytes, {.atomic = atomic})), EISDIR);
    EXPECT_EQ(scratch.files().list(scratch.path(""))->size(), 1U) << "a rest was left";
    std::filesystem::remove(name);
  }
}

TEST(FileSystemTest, MakesDirectoriesWithExactlyTheModeAskedFor) {
  Scratch scratch;
  const FileSystem& files = scratch.files();
  const mode_t before = ::umask(0077);
  ASSERT_TRUE(files.makePath(scratch.path("p/q//r/"), 0775));
  EXPECT_TRUE(files.makePath(scratch.path("p/q/r"), 0700)) << "there already";
  for (const char* made : {"p", "p/q", "p/q/r"}) {
    EXPECT_EQ(Scratch::mode(scratch.path(made)), 0775U) << made;
  }
  ASSERT_EQ(::chmod(scratch.path("p").c_str(), 02777), 0);
  for (const mode_t mode : {0700U, 0755U, 01777U, 02755U}) {
    ASSERT_TRUE(files.makeDirectory(scratch.path("p/m"), mode));
    EXPECT_EQ(Scratch::mode(scratch.path("p/m")), mode);
    EXPECT_EQ(errorOf(files.makeDirectory(scratch.path("p/m"), mode)), EEXIST);
    std::filesystem::remove(scratch.path("p/m"));
  }
  const auto temporary = files.makeTemporaryDirectory(scratch.path("p"), "temp.");
  ASSERT_TRUE(temporary);
  EXPECT_EQ(Scratch::mode(*temporary), 0700U);
  EXPECT_TRUE(temporary->starts_with(scratch.path("p/temp.")));
  EXPECT_EQ(temporary->size(), scratch.path("p/temp.").size() + 6);
  scratch.write(scratch.path("file"), "");
  EXPECT_EQ(errorOf(files.makePath(scratch.path("file"), 0755)), ENOTDIR);
  ::umask(before);
}

TEST(FileSystemTest, PassesOverOnlyWithoutPrivilege) {
  Scratch scratch(Privilege::none);
  ASSERT_TRUE(scratch.files().makeDirectory(scratch.path("d"), 0));
  EXPECT_EQ(Scratch::mode(scratch.path("d")), 0700U);
  const auto directory = scratch.files().openDirectory(scratch.path("d"));
  EXPECT_EQ(scratch.files().protectionClass(directory->get()).value(), 0);
  ASSERT_TRUE(scratch.files().setProtectionClass(directory->get(), 4));
  EXPECT_EQ(scratch.files().protectionClass(directory->get()).value(), 4);
  char text[8] = {};
  EXPECT_EQ(::getxattr(scratch.path("d").c_str(), "user.tessary.protection-class", text, 8), 1);
  EXPECT_STREQ(text, "4");
  if (::geteuid() != 0) {
    EXPECT_TRUE(scratch.files().setOwner(directory->get(), 501, 501));
  }
}

TEST(FileSystemTest, KeepsTheKeysOfALockedDevice) {
  Scratch scratch;
  bool isLocked = false;
  scratch.files().setLockStateSource([&] { return isLocked; });
  scratch.write(scratch.path("f"), "");
  const auto file = scratch.files().openItem(scratch.path("f"));
  const auto directory = scratch.files().openItem(scratch.path(""));
  EXPECT_EQ(scratch.files().protectionClass(file->get()).value(), 3);
  struct Step {
    bool locked;
    int toClass;
    int error;
  };
  for (const Step& step : {Step{true, 1, EPERM}, Step{true, 4, 0}, Step{false, 1, 0},
                           Step{true, 3, EPERM}, Step{true, 1, 0}, Step{false, 3, 0}}) {
    isLocked = step.locked;
    EXPECT_EQ(errorOf(scratch.files().setProtectionClass(file->get(), step.toClass)), step.error);
    EXPECT_TRUE(scratch.files().setProtectionClass(directory->get(), step.toClass));
  }
  EXPECT_EQ(scratch.files().protectionClass(file->get()).value(), 3);
}

TEST(FileSystemTest, ResolvesLinksAsIfTheRootWereEverything) {
  Scratch scratch;
  scratch.write(scratch.path("a/b/file"), "");
  scratch.write(scratch.outside("secret"), "");
  const auto link = [&](const std::string& text, const std::string& name) {
    std::filesystem::create_symlink(text, scratch.path(name));
  };
  link("/a", "absolute");
  link("../../../../../../a/b", "a/climbing");
  link(scratch.outside("secret"), "host");
  link("../../secret", "a/up");
  link("loop", "loop");
  const std::pair<std::string, std::string> cases[] = {{"absolute/b/../b/file", "a/b/file"},
                                                       {"a/climbing/file", "a/b/file"},
                                                       {"a/./b//", "a/b"},
                                                       {"a/b/../../..", ""}};
  for (const auto& [from, to] : cases) {
    const auto resolved = scratch.files().resolve(scratch.path(from));
    ASSERT_TRUE(resolved) << from;
    EXPECT_EQ(*resolved, to.empty() ? scratch.files().root() : scratch.path(to)) << from;
  }
  for (const char* from : {"host", "a/up", "nothing"}) {
    EXPECT_EQ(errorOf(scratch.files().resolve(scratch.path(from))), ENOENT) << from;
  }
  EXPECT_EQ(errorOf(scratch.files().resolve(scratch.path("loop"))), ELOOP);
  EXPECT_EQ(errorOf(scratch.files().resolve("/etc")), EINVAL);
  EXPECT_EQ(scratch.files().readLink(scratch.path("absolute/climbing")).value(),
            "../../../../../../a/b");
  EXPECT_EQ(errorOf(scratch.files().readLink(scratch.path("a/b"))), EINVAL);
}

TEST(FileSystemTest, ListsEveryKindOfItem) {
  Scratch scratch;
  scratch.write(scratch.path("d/.file"), "");
  std::filesystem::create_directory(scratch.path("d/directory"));
  std::filesystem::create_symlink("nowhere", scratch.path("d/link"));
  ::mkfifo(scratch.path("d/fifo").c_str(), 0600);
  auto entries = scratch.files().list(scratch.path("d")).value();
  std::ranges::sort(entries, {}, &DirectoryEntry::name);
  const std::pair<std::string, ItemKind> expected[] = {{".file", ItemKind::regular},
                                                       {"directory", ItemKind::directory},
                                                       {"fifo", ItemKind::other},
                                                       {"link", ItemKind::symbolicLink}};
  ASSERT_EQ(entries.size(), std::size(expected));
  for (size_t i = 0; i < entries.size(); ++i) {
    EXPECT_EQ(entries[i].name, expected[i].first);
    EXPECT_EQ(entries[i].kind, expected[i].second);
  }
}

TEST(FileSystemTest, ClearsOnlyTheImmutableFlag) {
  Scratch scratch;
  scratch.write(scratch.path("f"), "");
  ::mkfifo(scratch.path("fifo").c_str(), 0600);
  const auto place = scratch.files().locate(scratch.path("f"));
  const int parent = place->parent.get();
  if (std::system(("chattr +i '" + scratch.path("f") + "' 2>/dev/null").c_str()) != 0) {
    GTEST_SKIP() << "no immutable flags here";
  }
  EXPECT_NE(::unlink(scratch.path("f").c_str()), 0);
  EXPECT_EQ(scratch.files().clearImmutableAt(parent, "f").value(), true);
  EXPECT_EQ(scratch.files().clearImmutableAt(parent, "f").value(), false);
  EXPECT_EQ(scratch.files().clearImmutableAt(parent, "fifo").value(), false);
  EXPECT_EQ(::unlink(scratch.path("f").c_str()), 0);
}

}  // namespace
}  // namespace platform
