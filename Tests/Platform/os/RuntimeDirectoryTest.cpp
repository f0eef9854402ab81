#include "Platform/os/RuntimeDirectory.h"

#include <sys/stat.h>

#include <thread>
#include <vector>

#include "Tests/Platform/os/TestRoot.h"

namespace platform {
namespace {

TEST(FileNameForIdentifier, IsAlwaysOneSafeComponent) {
  const std::pair<std::string, std::string> cases[] = {
      {"com.example.App_1-2", "com.example.App_1-2"},
      {"", "%"},
      {"..", "%2E."},
      {"../etc", "%2E.%2Fetc"},
      {std::string("a\0%\xC3", 4), "a%00%25%C3"},
      {std::string(200, 'a'), std::string(200, 'a')},
  };
  for (const auto& [identifier, name] : cases) EXPECT_EQ(fileNameForIdentifier(identifier), name);
  const std::string longer = fileNameForIdentifier(std::string(201, 'a'));
  EXPECT_TRUE(longer.size() == 66 && longer.starts_with("%%")) << longer;
  EXPECT_NE(longer, fileNameForIdentifier(std::string(202, 'a')));
  EXPECT_LE(fileNameForIdentifier(std::string(100, '/')).size(), 200U);
}

// What one has put there after preparing must not be taken away by another that comes later.
TEST(RuntimeDirectory, IsEmptiedOnceByARebootAlsoWhenManyPrepareIt) {
  for (const std::string_view stored : {"another boot\n", "", "0", "another boot"}) {
    TestRoot root;
    root.write("run/tessary/boot-id", stored);
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
