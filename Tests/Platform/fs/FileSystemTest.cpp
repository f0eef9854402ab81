#include <sys/stat.h>

#include <functional>
#include <map>

#include "Platform/fs/FileSystem.h"
#include "Tests/Platform/fs/Scratch.h"

namespace platform {
namespace {

constexpr size_t kLimit = 64;
const std::vector<uint8_t> kBytes = {'n', 'e', 'w'};

// The error of every operation on a path, by name.
std::map<std::string, int> errorsOf(const FileSystem& files, const std::string& path) {
  return {{"locate", errorOf(files.locate(path))},
          {"status", errorOf(files.status(path))},
          {"openItem", errorOf(files.openItem(path))},
          {"list", errorOf(files.list(path))},
          {"readFile", errorOf(files.readFile(path, kLimit))},
          {"writeFile", errorOf(files.writeFile(path, kBytes, {}))},
          {"makePath", errorOf(files.makePath(path, 0755))},
          {"rename", errorOf(files.rename(path, path))},
          {"copy", errorOf(files.copy(path, path + "2"))},
          {"remove", errorOf(files.remove(path, nullptr))},
          {"measure", errorOf(files.measure(path))}};
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
    for (const auto& [operation, error] : errorsOf(scratch.files(), path)) {
      EXPECT_EQ(error, EINVAL) << operation << ' ' << path;
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
  for (const auto& [place, expected] : obstacles) {
    place();
    for (const auto& [operation, error] : errorsOf(scratch.files(), directory + "/inner/file")) {
      EXPECT_EQ(error, expected) << operation;
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

TEST(FileSystemTest, KeepsTheKeysOfALockedDevice) {
  Scratch scratch;
  bool isLocked = false;
  scratch.files().setLockStateSource([&] { return isLocked; });
  scratch.write(scratch.path("f"), "");
  const auto file = scratch.files().openItem(scratch.path("f"));
  const auto directory = scratch.files().openItem(scratch.path(""));
  const std::tuple<bool, int, int> steps[] = {{true, 1, EPERM}, {true, 4, 0}, {false, 1, 0},
                                              {true, 3, EPERM}, {true, 1, 0}, {false, 3, 0}};
  for (const auto& [locked, toClass, error] : steps) {
    isLocked = locked;
    EXPECT_EQ(errorOf(scratch.files().setProtectionClass(file->get(), toClass)), error);
    EXPECT_TRUE(scratch.files().setProtectionClass(directory->get(), toClass));
  }
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

}  // namespace
}  // namespace platform
