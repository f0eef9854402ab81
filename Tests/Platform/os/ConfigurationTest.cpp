// What the device is configured with: good files mean what they say, malformed ones the default.
#include "Platform/os/ContainerLayout.h"
#include "Platform/os/Device.h"
#include "Platform/os/DevicePersonas.h"
#include "Platform/os/KeyBag.h"
#include "Platform/os/PersonaList.h"
#include "Tests/Platform/os/TestRoot.h"

namespace platform {
namespace {

TEST(Device, IsWhatItsFileSaysAndTheDefaultForTheRest) {
  TestRoot root;
  const char* const file = "etc/tessary/device.plist";
  root.writePropertyList(
      file, Value(Value::Dictionary{
                {"MultiUserFlags", uint64_t{1} << 32},
                {"PersonasRuledOut", true},
                {"Features", Value::Dictionary{{"domain", Value::Dictionary{{"on", true}}}}}}));
  const Device device(root.files());
  EXPECT_EQ(device.multiUserFlags(), std::nullopt) << "out of range";
  EXPECT_TRUE(device.personasRuledOut() && !device.usesEphemeralStorage());
  EXPECT_TRUE(device.featureEnabled("domain", "on"));
  EXPECT_FALSE(device.featureEnabled("on", "domain"));
  for (const std::string_view content :
       {"", "bplist00", "<plist><array/></plist>", "<dict><key>Features</key><string/></dict>"}) {
    root.write(file, content);
    const Device defaults(root.files());
    EXPECT_EQ(defaults.multiUserFlags(), 0U) << content;
    EXPECT_FALSE(defaults.personasRuledOut() || defaults.featureEnabled("domain", "on")) << content;
  }
}

TEST(ContainerLayout, TakesOverridesThatLeaveNoWayOutOfTheContainer) {
  using Paths = std::vector<std::string>;
  const std::pair<Value, Paths> cases[] = {{Value::Array{"b/c/d", "a"}, {"a", "b", "b/c", "b/c/d"}},
                                           {"tmp", {}},
                                           {Value::Array{1}, {}},
                                           {Value::Array{"fine", ""}, {}},
                                           {Value::Array{"fine", "/etc"}, {}},
                                           {Value::Array{"fine", "a/../b"}, {}},
                                           {Value::Array{"fine", "./a"}, {}},
                                           {Value::Array{"fine", "a//b"}, {}},
                                           {Value::Array{"fine", std::string("a\0b", 3)}, {}}};
  for (const auto& [value, paths] : cases) {
    TestRoot root;
    root.writePropertyList("etc/tessary/container-layout.plist",
                           Value(Value::Dictionary{{"2", value}, {"two", 2}}));
    const ContainerLayout layout(root.files());
    const auto names = layout.subdirectoriesOfClass(2);
    EXPECT_EQ(names.value_or(Paths{}), paths) << value.description();
    EXPECT_EQ(names ? 0 : names.error(), paths.empty() ? 22U : 0U);
    EXPECT_EQ(layout.subdirectoriesOfClass(4)->size(), 5U) << "the others stay";
    EXPECT_EQ(layout.subdirectoriesOfClass(14).error(), ContainerLayout::kUnknownClass);
  }
}

TEST(KeyBag, ReadsOneNumber) {
  TestRoot root;
  const KeyBag keyBag(root.files());
  EXPECT_EQ(keyBag.lockState(), 0);
  const std::pair<std::string_view, int> cases[] = {
      {"2", 2}, {"1\n", 1}, {"", 0}, {"1 1", 0}, {"-1", 0}, {"0x1", 0}, {"99999999999", 0}};
  for (const auto& [content, state] : cases) {
    root.write("run/tessary/keybag", content);
    EXPECT_EQ(keyBag.lockState(), state) << content;
  }
}

Value persona(Value uniqueString, Value id, Value kind, const char* key = "Other",
              Value value = "") {
  return Value::Dictionary{{"UniqueString", std::move(uniqueString)},
                           {"PersonaID", std::move(id)},
                           {"Kind", std::move(kind)},
                           {key, std::move(value)}};
}

TEST(PersonaList, IsGoodAsAWholeOrNotAtAll) {
  const Value good = persona("work", 1000, "enterprise", "LayoutPath", "/private/var/work");
  const auto list = parsePersonaList(Value::Array{good}, "/root");
  ASSERT_TRUE(list);
  EXPECT_EQ(list->front().layoutPath, "/root/private/var/work");
  for (const Value& bad :
       {Value("text"), persona("x", 1, "other"), persona("", 1, "system"),
        persona("x", -1, "system"), persona("work", 1, "system"), persona("x", 1000, "system"),
        persona("x", "1", "system"), persona("x", 1, 1), persona(1, 1, "system"),
        persona("x", uint64_t{1} << 31, "system"),
        persona("x", 1, "enterprise", "LayoutPath", "relative"),
        persona("x", 1, "enterprise", "LayoutPath", "/a/../b"),
        persona("x", 1, "enterprise", "LayoutPath", "/"),
        persona("x", 1, "enterprise", "BundleIdentifiers", "com.example.app"),
        persona("x", 1, "enterprise", "BundleIdentifiers", Value::Array{1})}) {
    EXPECT_FALSE(parsePersonaList(Value::Array{good, bad}, "")) << bad.description();
  }
}

TEST(DevicePersonas, ArePresentOrAbsentForGood) {
  TestRoot root;
  RunLoop loop;
  const DevicePersonas absent(root.files(), loop);
  root.write("etc/tessary/personas.plist", "garbage");
  EXPECT_FALSE(absent.present());
  const DevicePersonas broken(root.files(), loop);
  EXPECT_TRUE(broken.present() && broken.list().empty());
}

}  // namespace
}  // namespace platform
