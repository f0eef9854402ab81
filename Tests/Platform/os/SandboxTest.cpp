#include "Platform/os/Sandbox.h"

#include <sys/stat.h>

#include <thread>

#include "Tests/Platform/os/TestRoot.h"

namespace platform {
namespace {

constexpr char kLog[] = "run/tessary/sandbox/mappings";
constexpr SandboxMappingKey kApp{501, 501, 2, "com.example.app"};
constexpr SandboxMappingKey kOther{501, -1, 2, "com.example.other"};

TEST(Sandbox, WritesOneLineForWhatChanges) {
  TestRoot root;
  Sandbox sandbox(root.files());
  EXPECT_EQ(sandbox.setContainerPath(kApp, "/a b"), 0);
  EXPECT_EQ(sandbox.setContainerPath(kApp, "/a b"), 0);
  EXPECT_EQ(sandbox.setContainerPath(kOther, std::nullopt), 0) << "was never set";
  EXPECT_EQ(sandbox.setContainerPath(kApp, "/c"), 0);
  EXPECT_EQ(sandbox.setContainerPath(kApp, std::nullopt), 0);
  EXPECT_EQ(sandbox.setContainerPath({1, -2, 3, "a\tb\n%\x7F\xC3\xA4"}, "/\n"), 0);
  EXPECT_EQ(sandbox.setContainerPath(kApp, std::string(70'000, 'x')), ENAMETOOLONG);
  EXPECT_EQ(root.read(kLog),
            "set\t501\t501\t2\tcom.example.app\t/a%20b\n"
            "set\t501\t501\t2\tcom.example.app\t/c\n"
            "clear\t501\t501\t2\tcom.example.app\n"
            "set\t1\t-2\t3\ta%09b%0A%25%7F\xC3\xA4\t/%0A\n");
}

TEST(Sandbox, CompactsItsLogAtTheStart) {
  TestRoot root;
  root.write(kLog,
             "set\t501\t501\t2\tcom.example.app\t/old\n"
             "set\t501\t501\t2\tcom.example.gone\t/gone\n"
             "set\t501\t-1\t2\tcom.example.other\t/other\n"
             "nonsense\n"
             "set\t501\t501\t2\tbad.escape\t/%4\n"
             "set\t501\t501\t2\ttoo.many\t/\t/\n"
             "set\t-1\t501\t2\tbad.uid\t/\n"
             "clear\t501\t501\t2\tcom.example.gone\n"
             "set\t501\t501\t2\tcom.example.app\t/new%20path\n"
             "set\t501\t501\t2\ttorn\t/to" +
                 std::string(200'000, 'x'));
  Sandbox sandbox(root.files());
  const std::string compact =
      "set\t501\t-1\t2\tcom.example.other\t/other\n"
      "set\t501\t501\t2\tcom.example.app\t/new%20path\n";
  EXPECT_EQ(root.read(kLog), compact);
  EXPECT_EQ(sandbox.setContainerPath(kOther, "/other"), 0);
  EXPECT_EQ(root.read(kLog), compact) << "known from the log";
}

TEST(SandboxBatch, LeavesOutWhatCancelsItself) {
  TestRoot root;
  Sandbox sandbox(root.files());
  ASSERT_EQ(sandbox.setContainerPath(kApp, "/a"), 0);
  {
    const Sandbox::Batch batch(sandbox);
    EXPECT_EQ(sandbox.setContainerPath(kApp, std::nullopt), 0);
    EXPECT_EQ(sandbox.setContainerPath(kApp, "/a"), 0);
    EXPECT_EQ(sandbox.setContainerPath(kOther, "/b"), 0);
    EXPECT_EQ(sandbox.setContainerPath(kOther, "/c"), 0);
    EXPECT_EQ(root.read(kLog), "set\t501\t501\t2\tcom.example.app\t/a\n");
  }
  EXPECT_EQ(root.read(kLog),
            "set\t501\t501\t2\tcom.example.app\t/a\n"
            "set\t501\t-1\t2\tcom.example.other\t/c\n");
}

TEST(SandboxBatch, KeepsTheOrderOfPushesBetweenThreads) {
  TestRoot root;
  Sandbox sandbox(root.files());
  {
    const Sandbox::Batch batch(sandbox);
    ASSERT_EQ(sandbox.setContainerPath(kApp, "/batch"), 0);
    std::thread([&] { EXPECT_EQ(sandbox.setContainerPath(kApp, "/later"), 0); }).join();
  }
  EXPECT_EQ(root.read(kLog), "set\t501\t501\t2\tcom.example.app\t/later\n");
}

TEST(FileExtension, IsGoodForOneClassPathAndProcess) {
  TestRoot root;
  const Sandbox sandbox(root.files());
  const AuditToken process = AuditToken::make(501, 501, 77, 1234);
  const std::string path = "/a;b/c";
  const auto token = sandbox.issueFileExtension("read", path, process);
  ASSERT_TRUE(token);
  EXPECT_TRUE(token->starts_with("read;77;/a;b/c;"));
  EXPECT_TRUE(sandbox.verifyExtension(*token, process));
  EXPECT_TRUE(Sandbox(root.files()).verifyExtension(*token, process)) << "the key is the boot's";

  const std::string hex = token->substr(token->rfind(';') + 1);
  std::string flipped = *token;
  flipped.back() = flipped.back() == '0' ? '1' : '0';
  for (const std::string& forged : std::vector<std::string>{
           "", ";;;", "read;77;/a;b/d;" + hex, "write;77;/a;b/c;" + hex, "read;78;/a;b/c;" + hex,
           "read;77;" + hex, "read;77;/a;b/c;", *token + "0", *token + ";", flipped}) {
    EXPECT_FALSE(sandbox.verifyExtension(forged, process)) << forged;
  }
  EXPECT_FALSE(sandbox.verifyExtension(*token, AuditToken::make(501, 501, 77, 1235)));
  EXPECT_EQ(sandbox.issueFileExtension("a;1", path, process).error().value, EINVAL);

  struct stat status{};
  ASSERT_EQ(::stat(root.path("run/tessary/extension.key").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777U, 0600U);
  // A key that others could have read is no secret any more.
  ::chmod(root.path("run/tessary/extension.key").c_str(), 0644);
  EXPECT_FALSE(Sandbox(root.files()).verifyExtension(*token, process));
}

}  // namespace
}  // namespace platform
