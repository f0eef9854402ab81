// tessary-platform, started as a program: what the harness itself does not show of it.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <iterator>

#include "Platform/os/KeyBag.h"
#include "Tests/Integration/Device.h"
#include "Tests/Integration/Subprocess.h"

namespace {

TEST(PlatformTool, LeavesWhatIsThereAndRefusesWhatIsNoGood) {
  if (::geteuid() != 0) GTEST_SKIP() << "owners are needed";
  const Device device(/*parent=*/"", /*user=*/"alice:600");
  const auto tool = [&](const std::string& arguments) {
    return runToEnd(
        {"/bin/sh", "-c",
         Device::program("tessary-platform") + " --root " + device.root() + " " + arguments});
  };
  const auto read = [&](const char* path) {
    std::ifstream file(device.path(path));
    return std::string{std::istreambuf_iterator<char>(file), {}};
  };
  std::ofstream(device.path("/etc/os-release")) << "NAME=mine\n";
  ::chmod(device.path("/private/var/mobile").c_str(), 0700);
  const std::string users = read("/etc/passwd");
  EXPECT_EQ(tool("init --user bob:601").exitStatus, 0);
  EXPECT_EQ(read("/etc/passwd"), users + "bob:x:601:601:bob:/private/var/users/bob:/bin/sh\n");
  EXPECT_EQ(read("/etc/os-release"), "NAME=mine\n");
  EXPECT_EQ(device.files().status(device.path("/private/var/mobile"))->st_mode & 07777U, 0700U);
  EXPECT_EQ(device.files().status(device.path("/private/var/users/bob"))->st_uid, 601U);

  EXPECT_EQ(tool("lock").exitStatus, 0);
  EXPECT_EQ(platform::KeyBag(device.files()).lockState(), platform::KeyBag::kLocked);

  std::ofstream(device.path("/etc/group"), std::ios::app) << "staff:x:20:mobile\n";
  EXPECT_EQ(tool("run --identifier x -- /bin/sh -c 'id -u; id -G'").output, "501\n501 20\n");
  EXPECT_EQ(tool("run --identifier x --uid 700 --gid 701 -- /usr/bin/id -G").output, "701\n");

  const std::string work = "persona add --unique-string work --id 1000 --kind enterprise";
  EXPECT_EQ(tool(work).exitStatus, 0);
  const std::string personas = read("/etc/tessary/personas.plist");
  EXPECT_NE(personas.find("personal"), std::string::npos) << "one has come with it";
  std::ofstream(device.path("/list.plist")) << "<plist><array><dict/></array></plist>";
  const std::pair<std::string, int> kRefused[] = {
      {"init --user alice:602", 1},  // she has another user id
      {"init --user :5", 2},
      {"init --user a/b:700", 2},
      {"init --user carol:0", 2},
      {"run --identifier x --uid 999 -- true", 2},  // an account of no group
      {"run --identifier x -- /nonexistent", 1},
      {"run -- true", 2},
      {work, 1},  // twice
      {"persona add --unique-string x --id 1 --kind strange", 1},
      {"persona remove unknown", 1},
      {"persona replace-file " + device.path("/list.plist"), 1},
  };
  for (const auto& [arguments, status] : kRefused) {
    EXPECT_EQ(tool(arguments).exitStatus, status) << arguments;
  }
  EXPECT_EQ(read("/etc/tessary/personas.plist"), personas);
}

}  // namespace
