// tessary-platform, started as a program: what it leaves on the disk, and what the services make of
// it.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <filesystem>
#include <fstream>
#include <iterator>

#include "Platform/os/Accounts.h"
#include "Platform/os/ConfigurationFile.h"
#include "Platform/os/KeyBag.h"
#include "Platform/os/PersonaList.h"
#include "Platform/os/RuntimeDirectory.h"
#include "Platform/os/Tasks.h"

namespace platform {
namespace {

class PlatformTool : public ::testing::Test {
 protected:
  struct Outcome {
    int status;
    std::string output;  // and errors
  };

  PlatformTool() {
    std::string name = std::filesystem::temp_directory_path() / "tessary-tool-XXXXXX";
    root_ = std::filesystem::canonical(::mkdtemp(name.data()));
    ::chmod(root_.c_str(), 0755);
    files_ = std::move(FileSystem::open(root_, privilege()).value());
  }
  ~PlatformTool() override { std::filesystem::remove_all(root_); }

  static Privilege privilege() { return ::geteuid() == 0 ? Privilege::root : Privilege::none; }

  Outcome tool(const std::string& arguments) const {
    const std::string command = std::string(TESSARY_BINARY_DIRECTORY) +
                                "/tessary-platform --root " + root_ + " " + arguments + " 2>&1";
    FILE* const pipe = ::popen(command.c_str(), "r");
    std::string output;
    for (int c = ::fgetc(pipe); c != EOF; c = ::fgetc(pipe)) output += static_cast<char>(c);
    return {WEXITSTATUS(::pclose(pipe)), output};
  }
  std::string read(const std::string& relative) const {
    std::ifstream file(root_ + "/" + relative, std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
  }
  void write(const std::string& relative, std::string_view text) const {
    std::ofstream(root_ + "/" + relative, std::ios::binary) << text;
  }

  std::string root_;
  std::unique_ptr<FileSystem> files_;
};

TEST_F(PlatformTool, PreparesADeviceAndLeavesWhatIsThere) {
  ASSERT_EQ(tool("init --user alice:600").status, 0);
  const Accounts accounts(*files_);
  const auto mobile = accounts.accountNamed("mobile");
  ASSERT_TRUE(mobile);
  EXPECT_EQ(mobile->uid, ::geteuid() == 0 ? 501U : ::geteuid());
  EXPECT_EQ(accounts.groupNamed("systemusers"), 250U);
  EXPECT_EQ(accounts.groupNamed("alice"), 600U);
  for (const auto& account : {*mobile, *accounts.accountNamed("alice")}) {
    const auto home = files_->status(account.home);
    ASSERT_TRUE(home) << account.home;
    if (::geteuid() == 0) {
      EXPECT_EQ(home->st_uid, account.uid);
      EXPECT_EQ(home->st_gid, account.gid);
    }
  }
  EXPECT_EQ(files_->status(root_ + "/tmp")->st_mode & 07777U, 01777U);

  write("etc/os-release", "NAME=mine\n");
  const std::string passwords = read("etc/passwd");
  ::chmod((root_ + "/private/var/mobile").c_str(), 0700);
  ASSERT_EQ(tool("init --user bob:601").status, 0);
  EXPECT_EQ(read("etc/os-release"), "NAME=mine\n");
  EXPECT_EQ(read("etc/passwd"), passwords + "bob:x:601:601:bob:/private/var/users/bob:/bin/sh\n");
  EXPECT_EQ(files_->status(root_ + "/private/var/mobile")->st_mode & 07777U, 0700U);

  EXPECT_EQ(tool("init --user alice:602").status, 1) << "she has another user id";
  for (const char* bad : {"carol", "carol:", ":5", "carol:x", "a/b:700", "carol:0"}) {
    EXPECT_EQ(tool(std::string("init --user ") + bad).status, 2) << bad;
  }
}

TEST_F(PlatformTool, LocksAndUnlocksWithANotification) {
  ASSERT_EQ(tool("lock").status, 0);
  EXPECT_EQ(KeyBag(*files_).lockState(), KeyBag::kLocked);
  ASSERT_EQ(tool("unlock").status, 0);
  EXPECT_EQ(KeyBag(*files_).lockState(), KeyBag::kUnlocked);
  EXPECT_EQ(read("run/tessary/notifications/com.veltra.keybag.lock-status"), "2\n");
}

TEST_F(PlatformTool, RunsAProgramWithItsIdentity) {
  ASSERT_EQ(tool("init").status, 0);
  write("etc/group", read("etc/group") + "staff:x:20:mobile\n");
  write("entitlements.plist", "<plist><dict><key>com.example.right</key><true/></dict></plist>");
  const auto ran =
      tool("run --identifier com.example.app --sandboxed --persona work --entitlements " + root_ +
           "/entitlements.plist -- /bin/sh -c " +
           "'echo $$ $(cut -d \" \" -f 22 /proc/$$/stat) $(id -u) $(id -G)'");
  ASSERT_EQ(ran.status, 0) << ran.output;
  pid_t pid = 0;
  uint64_t startTime = 0;
  uid_t uid = 0;
  std::istringstream line(ran.output);
  ASSERT_TRUE(line >> pid >> startTime >> uid) << ran.output;
  const auto record = Tasks(*files_).record(pid, startTime);
  ASSERT_TRUE(record) << record.error().message();
  EXPECT_EQ(record->signingIdentifier, "com.example.app");
  EXPECT_EQ(record->personaUniqueString, "work");
  EXPECT_TRUE(record->sandboxed && !record->kernelTask);
  EXPECT_EQ(*record->entitlements, (Value::Dictionary{{"com.example.right", true}}));
  if (::geteuid() == 0) {
    EXPECT_EQ(uid, 501U);
    EXPECT_TRUE(ran.output.ends_with(" 501 501 20\n")) << ran.output;
    const auto other = tool("run --identifier x --uid 700 --gid 701 -- /bin/sh -c 'id -u; id -G'");
    EXPECT_EQ(other.output, "700\n701\n");
  }
  const std::string shown = tool("show").output;
  EXPECT_NE(shown.find("com.example.app, sandboxed, persona work"), std::string::npos) << shown;

  write("entitlements.plist", "<plist><array/></plist>");
  EXPECT_EQ(
      tool("run --identifier x --entitlements " + root_ + "/entitlements.plist -- true").status, 2);
  EXPECT_EQ(tool("run --identifier x --uid 999 -- true").status, 2) << "an account of no group";
  EXPECT_EQ(tool("run --identifier x -- /nonexistent").status, 1);
  EXPECT_EQ(tool("run -- true").status, 2);
}

TEST_F(PlatformTool, ChangesPersonasToGoodListsOnly) {
  const auto personas = [this] {
    const auto value = readConfigurationFile(*files_, personaListPath(*files_));
    return value ? parsePersonaList(*value, "").value() : std::vector<PersonaAttributes>();
  };
  ASSERT_EQ(tool("init").status, 0);
  const std::string work =
      "persona add --unique-string work --id 1000 --kind enterprise "
      "--layout-path /private/var/work --bundle com.example.a com.example.b";
  ASSERT_EQ(tool(work).status, 0);
  ASSERT_EQ(personas().size(), 2U) << "a personal one has come with it";
  EXPECT_EQ(personas()[0].kind, PersonaKind::personal);
  EXPECT_EQ(personas()[1].bundleIdentifiers,
            (std::vector<std::string>{"com.example.a", "com.example.b"}));
  const std::string before = read("etc/tessary/personas.plist");
  EXPECT_EQ(tool(work).status, 1) << "twice";
  EXPECT_EQ(tool("persona add --unique-string x --id 1 --kind strange").status, 1);
  EXPECT_EQ(tool("persona remove " + *personas()[0].uniqueString).status, 1);
  EXPECT_EQ(tool("persona remove unknown").status, 1);
  write("list.plist", "<plist><array><dict/></array></plist>");
  EXPECT_EQ(tool("persona replace-file " + root_ + "/list.plist").status, 1);
  EXPECT_EQ(read("etc/tessary/personas.plist"), before);

  write("list.plist",
        "<plist><array><dict><key>UniqueString</key><string>me</string><key>PersonaID</key>"
        "<integer>7</integer><key>Kind</key><string>personal</string></dict></array></plist>");
  ASSERT_EQ(tool("persona replace-file " + root_ + "/list.plist").status, 0);
  EXPECT_NE(tool("persona list").output.find("unique string = me"), std::string::npos);
  ASSERT_EQ(tool("persona remove me").status, 0);
  EXPECT_FALSE(files_->status(personaListPath(*files_)));
}

}  // namespace
}  // namespace platform
