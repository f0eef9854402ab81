#include "Platform/os/RuntimeDirectory.h"

#include <sys/stat.h>

#include <thread>
#include <vector>

#include "Platform/os/NamedSemaphores.h"
#include "Tests/Platform/os/TestRoot.h"

namespace platform {
namespace {

TEST(FileNameForIdentifier, IsAlwaysOneSafeComponent) {
  const std::vector<std::pair<std::string, std::string>> cases{
      {"com.example.App_1-2", "com.example.App_1-2"},
      {"", "%"},
      {"..", "%2E."},
      {"../../etc/passwd", "%2E.%2F..%2Fetc%2Fpasswd"},
      {std::string("a\0%\xC3", 4), "a%00%25%C3"},
      {std::string(200, 'a'), std::string(200, 'a')},
  };
  for (const auto& [identifier, name] : cases) EXPECT_EQ(fileNameForIdentifier(identifier), name);
  const std::string longer = fileNameForIdentifier(std::string(201, 'a'));
  EXPECT_EQ(longer.size(), 2U + 64U);
  EXPECT_TRUE(longer.starts_with("%%"));
  EXPECT_NE(longer, fileNameForIdentifier(std::string(202, 'a')));
  EXPECT_LE(fileNameForIdentifier(std::string(100, '/')).size(), 200U);
}

TEST(RuntimeDirectory, IsEmptiedByARebootOnly) {
  TestRoot root;
  const NamedSemaphores semaphores(root.files());
  ASSERT_TRUE(semaphores.create("first", 0444));
  EXPECT_EQ(semaphores.create("first", 0444).error().value, EEXIST);
  ASSERT_TRUE(prepareRuntimeDirectory(root.files()));
  EXPECT_TRUE(semaphores.exists("first"));
  for (const std::string_view stored : {"another boot\n", "", "0"}) {
    ASSERT_TRUE(semaphores.exists("first"));
    root.write("run/tessary/boot-id", stored);
    ASSERT_TRUE(prepareRuntimeDirectory(root.files()));
    EXPECT_FALSE(semaphores.exists("first"));
    ASSERT_TRUE(semaphores.create("first", 0444));
  }
}

// What one has put there after preparing must not be taken away by another that comes later.
TEST(RuntimeDirectory, IsPreparedByManyAtOnce) {
  for (int round = 0; round < 20; ++round) {
    TestRoot root;
    root.write("run/tessary/boot-id", "another boot");
    root.write("run/tessary/old/file", "old");
    std::vector<std::thread> threads;
    for (int i = 0; i < 8; ++i) {
      threads.emplace_back([&root, i] {
        EXPECT_TRUE(prepareRuntimeDirectory(root.files()));
        root.write("run/tessary/new" + std::to_string(i), std::string_view("new"));
      });
    }
    for (std::thread& thread : threads) thread.join();
    for (int i = 0; i < 8; ++i) EXPECT_EQ(root.read("run/tessary/new" + std::to_string(i)), "new");
    EXPECT_FALSE(std::filesystem::exists(root.path("run/tessary/old")));
  }
}

TEST(RuntimeDirectory, TrustsNothingThatOthersCouldWrite) {
  TestRoot root;
  const std::string directory = root.path("run/tessary");
  root.write("run/tessary/planted", "by somebody");
  ::chmod(directory.c_str(), 0777);
  ASSERT_TRUE(prepareRuntimeDirectory(root.files()));
  EXPECT_FALSE(std::filesystem::exists(root.path("run/tessary/planted")));
  struct stat status{};
  ASSERT_EQ(::stat(directory.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777U, 0755U);
  if (::geteuid() != 0) return;
  ::chown(directory.c_str(), 501, 501);
  EXPECT_EQ(prepareRuntimeDirectory(root.files()).error().value, EPERM);
}

}  // namespace
}  // namespace platform
