#include "Platform/os/DevicePersonas.h"

#include <thread>

#include "Platform/os/PersonaList.h"
#include "Tests/Platform/os/TestRoot.h"

namespace platform {
namespace {

constexpr char kFile[] = "etc/tessary/personas.plist";

Value::Dictionary persona(const char* uniqueString, int id, const char* kind) {
  return {{"UniqueString", uniqueString}, {"PersonaID", id}, {"Kind", kind}};
}

Value::Dictionary with(Value::Dictionary entry, const char* key, Value value) {
  entry[key] = std::move(value);
  return entry;
}

TEST(PersonaList, IsGoodAsAWholeOrNotAtAll) {
  auto work = with(persona("work", 1000, "enterprise"), "LayoutPath", "/private/var/work");
  work["BundleIdentifiers"] = Value::Array{"com.example.app"};
  const Value::Dictionary nameless{{"PersonaID", uint64_t{3}}, {"Kind", "system"}};
  const auto list = parsePersonaList(Value::Array{work, nameless}, "/root");
  ASSERT_TRUE(list);
  ASSERT_EQ(list->size(), 2U);
  EXPECT_EQ((*list)[0].layoutPath, "/root/private/var/work");
  EXPECT_EQ((*list)[0].bundleIdentifiers, std::vector<std::string>{"com.example.app"});
  EXPECT_EQ((*list)[1].kind, PersonaKind::system);
  EXPECT_EQ((*list)[1].uniqueString, std::nullopt);

  const auto good = persona("work", 1000, "enterprise");
  for (const Value& bad : std::vector<Value>{
           "text", persona("x", 1, "other"), persona("", 1, "system"), persona("x", -1, "system"),
           persona("work", 1, "system"), persona("x", 1000, "system"), with(good, "PersonaID", "1"),
           with(good, "Kind", 1), with(good, "UniqueString", 1),
           with(persona("x", 1, "system"), "PersonaID", uint64_t{1} << 31),
           with(persona("x", 1, "enterprise"), "LayoutPath", "relative"),
           with(persona("x", 1, "enterprise"), "LayoutPath", "/a/../b"),
           with(persona("x", 1, "enterprise"), "LayoutPath", "/"),
           with(persona("x", 1, "enterprise"), "BundleIdentifiers", "com.example.app"),
           with(persona("x", 1, "enterprise"), "BundleIdentifiers", Value::Array{1})}) {
    EXPECT_FALSE(parsePersonaList(Value::Array{good, bad}, "")) << bad.description();
  }
  EXPECT_FALSE(parsePersonaList(good, ""));
}

TEST(DevicePersonas, ArePresentOrAbsentForGood) {
  TestRoot root;
  RunLoop loop;
  const DevicePersonas absent(root.files(), loop);
  root.write(kFile, "garbage");
  EXPECT_FALSE(absent.present());
  DevicePersonas broken(root.files(), loop);
  EXPECT_TRUE(broken.present());
  EXPECT_TRUE(broken.list().empty());
  std::filesystem::remove(root.path(kFile));
  EXPECT_TRUE(broken.present());
}

TEST(DevicePersonas, FollowTheFileAndKeepTheLastGoodList) {
  TestRoot root;
  root.writePropertyList(kFile, Value(Value::Array{persona("me", 501, "personal")}));
  RunLoop loop;
  DevicePersonas personas(root.files(), loop);
  ASSERT_EQ(personas.list().size(), 1U);
  std::atomic<int> updates = 0;
  ASSERT_FALSE(personas.observe("test", [&] { ++updates; }));
  const Value longer(Value::Array{persona("me", 501, "personal"), persona("we", 7, "system")});
  std::thread other([&] {
    const auto expect = [&](size_t size, int count) {
      ::usleep(100'000);
      EXPECT_EQ(personas.list().size(), size);
      EXPECT_EQ(updates, count);
    };
    root.replace(kFile, longer);
    expect(2, 1);
    root.replace(kFile, longer);  // the same again is no change
    expect(2, 1);
    root.write(kFile, "garbage");
    expect(2, 1);
    std::filesystem::remove(root.path(kFile));
    expect(2, 1);
    root.replace(kFile, Value(Value::Array{persona("me", 501, "personal")}));
    expect(1, 2);
    loop.stop();
  });
  loop.run();
  other.join();
}

}  // namespace
}  // namespace platform
