#include "Platform/os/Accounts.h"

#include "Tests/Platform/os/TestRoot.h"

namespace platform {
namespace {

constexpr std::string_view kPasswords =
    "# accounts\n"
    "root:x:0:0:root:/private/var/root:/bin/sh\n"
    "mobile:x:501:501::/private/var/mobile/:/bin/sh\n"
    "mobile:x:0:0::/:/bin/sh\n"  // a second one of the name does not count
    "relative:x:502:502::home:/bin/sh\n"
    "short:x:503:503\n"
    "negative:x:-1:0::/:/bin/sh\n"
    "huge:x:4294967296:0::/:/bin/sh\n"
    "everybody:x:4294967295:0::/:/bin/sh";

TEST(Accounts, ComeFromTheFilesUnderTheRoot) {
  TestRoot root;
  root.write("etc/passwd", kPasswords);
  root.write("etc/group",
             "mobile:x:501:\nsystemusers:x:250:mobile,root\n"
             "broken:x:zero:mobile\nstaff:x:20:other,mobile\n");
  const Accounts accounts(root.files());
  const auto mobile = accounts.accountNamed("mobile");
  ASSERT_TRUE(mobile);
  EXPECT_EQ(mobile->uid, 501U);
  EXPECT_EQ(mobile->home, root.path("private/var/mobile"));
  for (const char* name : {"relative", "short", "negative", "huge", "everybody", "daemon", ""}) {
    EXPECT_FALSE(accounts.accountNamed(name)) << name;
  }
  EXPECT_FALSE(accounts.groupNamed("broken"));
  EXPECT_EQ(accounts.groupsOfAccount(*mobile), (std::vector<gid_t>{501, 250, 20}));

  root.write("etc/passwd", std::string(kPasswords) + "\nnew:x:600:600::/new:/bin/sh\n");
  EXPECT_EQ(accounts.accountNamed("new")->uid, 600U) << "read anew";
  // What cannot be read is not followed elsewhere; the last good content stays.
  std::filesystem::remove(root.path("etc/passwd"));
  root.write("etc/evil", "evil:x:0:0::/:/bin/sh\n");
  std::filesystem::create_symlink("evil", root.path("etc/passwd"));
  EXPECT_FALSE(accounts.accountNamed("evil"));
  EXPECT_TRUE(accounts.accountNamed("new"));
}

}  // namespace
}  // namespace platform
