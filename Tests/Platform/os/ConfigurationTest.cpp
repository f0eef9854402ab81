// What the device is configured with: good files mean what they say, malformed ones the default.
#include "Platform/os/ContainerLayout.h"
#include "Platform/os/Device.h"
#include "Platform/os/KeyBag.h"
#include "Platform/os/Platform.h"
#include "Platform/os/SystemVersion.h"
#include "Tests/Platform/os/TestRoot.h"

namespace platform {
namespace {

using Paths = std::vector<std::string>;

TEST(Device, IsWhatItsFileSays) {
  TestRoot root;
  root.writePropertyList(
      "etc/tessary/device.plist",
      Value(Value::Dictionary{
          {"MultiUserFlags", uint64_t{0x80000000}},
          {"PersonasRuledOut", true},
          {"EphemeralStorage", 1},
          {"Features",
           Value::Dictionary{{"domain", Value::Dictionary{{"on", true}, {"off", false}}}}}}));
  const Device device(root.files());
  EXPECT_TRUE(device.isMultiUser() && device.personasRuledOut() && device.usesEphemeralStorage());
  EXPECT_TRUE(device.featureEnabled("domain", "on"));
  EXPECT_FALSE(device.featureEnabled("domain", "off"));
  EXPECT_FALSE(device.featureEnabled("on", "domain"));
}

TEST(Device, HasDefaultsForWhatIsMissingOrMalformed) {
  for (const std::string_view content : {"", "bplist00", "<plist><array/></plist>", "<plist>"}) {
    TestRoot root;
    if (!content.empty()) root.write("etc/tessary/device.plist", content);
    const Device device(root.files());
    EXPECT_EQ(device.multiUserFlags(), 0U) << content;
    EXPECT_FALSE(device.personasRuledOut() || device.usesEphemeralStorage()) << content;
    EXPECT_FALSE(device.featureEnabled("domain", "name")) << content;
  }
  TestRoot root;
  root.writePropertyList(
      "etc/tessary/device.plist",
      Value(Value::Dictionary{{"MultiUserFlags", uint64_t{1} << 32}, {"Features", "all"}}));
  EXPECT_EQ(Device(root.files()).multiUserFlags(), std::nullopt);
  EXPECT_FALSE(Device(root.files()).featureEnabled("domain", "name"));
}

TEST(ContainerLayout, TakesOverridesClassByClass) {
  TestRoot root;
  root.writePropertyList(
      "etc/tessary/container-layout.plist",
      Value(Value::Dictionary{
          {"2", Value::Array{"b/c/d", "a"}}, {"77", Value::Array{"x"}}, {"two", 2}}));
  const ContainerLayout layout(root.files());
  EXPECT_EQ(layout.subdirectoriesOfClass(2).value(), (Paths{"a", "b", "b/c", "b/c/d"}));
  EXPECT_EQ(layout.subdirectoriesOfClass(77).value(), Paths{"x"});
  EXPECT_EQ(layout.subdirectoriesOfClass(4).value(),
            (Paths{"Library", "Library/Caches", "Library/Preferences", "SystemData", "tmp"}));
  EXPECT_EQ(layout.subdirectoriesOfClass(8).value(), Paths{});
  EXPECT_EQ(layout.subdirectoriesOfClass(14).error(), ContainerLayout::kUnknownClass);
}

TEST(ContainerLayout, LeavesNoWayOutOfTheContainer) {
  const std::vector<Value> bad{"tmp", Value::Array{1}};
  const std::vector<std::string> badPaths{"",     "/",   "/etc", "..", "a/../b",
                                          "a/..", "./a", "a//b", "a/", std::string("a\0b", 3)};
  const auto codeOf = [](const Value& value) {
    TestRoot root;
    root.writePropertyList("etc/tessary/container-layout.plist",
                           Value(Value::Dictionary{{"2", value}}));
    const auto layout = ContainerLayout(root.files()).subdirectoriesOfClass(2);
    return layout ? 0 : layout.error();
  };
  for (const Value& value : bad) EXPECT_EQ(codeOf(value), 22U) << value.description();
  for (const std::string& path : badPaths) {
    EXPECT_EQ(codeOf(Value::Array{"fine", path}), 22U) << path;
  }
}

TEST(SystemVersion, ReadsWhatDistributionsWrite) {
  TestRoot root;
  const std::string text =
      "# a comment\nNAME=\"Some \\\"System\\\"\"\nVERSION_ID='1.2'\nVARIANT_ID=internal "
      "\r\nbroken\n";
  root.write("etc/os-release", text);
  const SystemVersion version(root.files());
  const Value::Dictionary expected{{"ProductName", "Some \"System\""},
                                   {"ProductVersion", "1.2"},
                                   {"ProductBuildVersion", "1.2"},
                                   {"ReleaseType", "internal"}};
  EXPECT_EQ(Value(version.dictionary()), Value(expected));
  EXPECT_TRUE(version.isInternalBuild());

  root.write("usr/lib/os-release", text + "BUILD_ID=7B1\nVARIANT_ID=release");
  std::filesystem::remove(root.path("etc/os-release"));
  std::filesystem::create_symlink("../usr/lib/os-release", root.path("etc/os-release"));
  const SystemVersion linked(root.files());
  EXPECT_EQ(*linked.dictionary().at("ProductBuildVersion").asString(), "7B1");
  EXPECT_FALSE(linked.isInternalBuild());
}

TEST(KeyBag, ReadsOneNumber) {
  TestRoot root;
  const KeyBag keyBag(root.files());
  EXPECT_EQ(keyBag.lockState(), 0);
  ASSERT_TRUE(keyBag.setLockState(KeyBag::kLocked));
  EXPECT_EQ(keyBag.lockState(), 1);
  const std::vector<std::pair<std::string_view, int>> cases{
      {"2", 2}, {"1\n", 1}, {"", 0}, {"1 1", 0}, {"-1", 0}, {"0x1", 0}, {"99999999999", 0}};
  for (const auto& [content, state] : cases) {
    root.write("run/tessary/keybag", content);
    EXPECT_EQ(keyBag.lockState(), state) << content;
  }
}

TEST(DevicePlatform, TellsTheFileSystemOfTheLock) {
  TestRoot root;
  const auto device = DevicePlatform::open(root.path("."));
  ASSERT_TRUE(device);
  Platform::setCurrent((*device)->platform());
  Platform& current = Platform::current();
  EXPECT_EQ(current.files.root(), root.files().root());
  root.write("file", "content");
  const auto file = current.files.openItem(root.path("file"));
  ASSERT_TRUE(file);
  ASSERT_TRUE(current.keyBag.setLockState(KeyBag::kLocked));
  EXPECT_EQ(current.files.setProtectionClass(file->get(), 1).error().value, EPERM);
  ASSERT_TRUE(current.keyBag.setLockState(KeyBag::kUnlocked));
  EXPECT_TRUE(current.files.setProtectionClass(file->get(), 1));
  EXPECT_EQ(DevicePlatform::open(root.path("nowhere")).error().value, ENOENT);
}

}  // namespace
}  // namespace platform
