#include "Daemon/TSYUserIdentityCache.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <thread>

#include "Tests/Daemon/ContainerDevice.h"

namespace {

using platform::PersonaKind;

FakePersonas::List makeList() {
  return {
      makePersona(PersonaKind::enterprise, 201, "E1"),
      makePersona(PersonaKind::universal, 300, "U"),
      makePersona(PersonaKind::enterprise, 202, std::nullopt),
      // Sorts behind the universal persona.
      makePersona(PersonaKind::personal, 100, "Z"),
  };
}

TEST(TSYUserIdentityCache, aRequestMeansThePersonaOfItsCaller) {
  const ContainerDevice device(makeList());
  TSYUserIdentityCache cache;
  const std::string mobile = device.path("/private/var/mobile");
  const std::string work = device.path("/private/var/E1");
  const std::string alice = device.path("/private/var/alice");
  constexpr auto kUnspecific = TSYPersonaType::unspecific;
  constexpr auto kPersonal = TSYPersonaType::personal;
  constexpr auto kEnterprise = TSYPersonaType::enterprise;
  const struct {
    std::optional<std::string> persona;
    uid_t uid;
    uid_t resultingUID;  // 0 for none
    TSYPersonaType type;
    std::string home;
  } cases[] = {
      {std::nullopt, 501, 501, kUnspecific, mobile},
      {std::nullopt, 0, 501, kUnspecific, mobile},
      {std::nullopt, 502, 502, kUnspecific, alice},
      {"Z", 501, 501, kPersonal, mobile},
      {"Z", 502, 502, kPersonal, alice},
      {"E1", 502, 502, kEnterprise, work},
      {"E1", 500, 501, kEnterprise, work},
      {"U", 501, 501, kUnspecific, mobile},
      {"gone", 501, 0, kPersonal, ""},
      {"", 501, 0, kPersonal, ""},
  };
  for (const auto& test : cases) {
    const TSYUserIdentityCache::CallerContext context(test.persona);
    const auto identity = cache.userIdentityForCurrentContextWithUID(test.uid, test.uid);
    SCOPED_TRACE(test.persona.value_or("none") + ", " + std::to_string(test.uid));
    ASSERT_EQ(identity != nullptr, test.resultingUID != 0);
    if (identity == nullptr) continue;
    EXPECT_EQ(identity->posixUID(), test.resultingUID);
    EXPECT_EQ(identity->posixGID(), test.resultingUID);
    EXPECT_EQ(identity->personaType(), test.type);
    EXPECT_EQ(identity->homeDirectoryURL()->path(), test.home);
  }
  // A context ends with its scope, the outer one comes back, and both are the thread's own.
  EXPECT_TRUE(cache.userIdentityForCurrentContext()->isNoSpecificPersona());
  const TSYUserIdentityCache::CallerContext context("E1");
  {
    const TSYUserIdentityCache::CallerContext inner("Z");
  }
  EXPECT_TRUE(cache.userIdentityForCurrentContext()->isEnterprise());
  std::thread([&] {
    EXPECT_TRUE(cache.userIdentityForCurrentContext()->isNoSpecificPersona());
  }).join();
}

TEST(TSYUserIdentityCache, waitsForAUsableList) {
  ContainerDevice device(FakePersonas::List{});
  int tries = 1;
  const auto sleep = [&](std::chrono::seconds time) {
    EXPECT_EQ(time, std::chrono::seconds(1));
    ++tries;
    // Without a personal persona, then with one that has no name, then with a good one.
    FakePersonas::List list = makeList();
    if (tries == 3) list.pop_back();
    if (tries == 4) list.back().uniqueString.reset();
    if (tries >= 3) device.personas().setList(list);
  };
  TSYUserIdentityCache cache(sleep);
  EXPECT_EQ(cache.userIdentityForPersonalPersona()->kernelPersonaID(), 100);
  EXPECT_EQ(tries, 5);
}

TEST(TSYUserIdentityCacheDeathTest, endsTheProcessWithoutAList) {
  const ContainerDevice device(FakePersonas::List{});
  const auto sleepsSixtyTimes = testing::Truly(
      [](const std::string& output) { return std::ranges::count(output, '#') == 60; });
  EXPECT_EXIT(
      {
        TSYUserIdentityCache cache([](std::chrono::seconds) { std::fputc('#', stderr); });
        cache.unspecificUserIdentity();
      },
      testing::KilledBySignal(SIGABRT), sleepsSixtyTimes);
}

// The entries of the device's settings.
class PersonasAreRuledOutBy : public testing::TestWithParam<const char*> {};

TEST_P(PersonasAreRuledOutBy, oneSettingOfTheDevice) {
  const ContainerDevice device(makeList(),
                               {{"/etc/tessary/device.plist",
                                 std::string("<plist><dict>") + GetParam() + "</dict></plist>"}});
  TSYUserIdentityCache cache;
  EXPECT_FALSE(TSYUserIdentityCache::personasAreSupported());
  // The one identity answers everything.
  const TSYUserIdentityRef mobile = TSYUserIdentityCache::defaultUserIdentity();
  const TSYUserIdentityCache::CallerContext context("E1");
  EXPECT_EQ(cache.userIdentityForCurrentContext(), mobile);
  EXPECT_EQ(cache.userIdentityForPersonaUniqueString("E1", 0, 0), mobile);
  EXPECT_EQ(cache.userIdentityWithPersonaID(201), nullptr);
  EXPECT_EQ(cache.userIdentityForCurrentContextWithUID(502, 502)->identifier(), "502");
}

INSTANTIATE_TEST_SUITE_P(Devices, PersonasAreRuledOutBy,
                         testing::Values("<key>MultiUserFlags</key><integer>2147483648</integer>",
                                         "<key>PersonasRuledOut</key><true/>",
                                         "<key>EphemeralStorage</key><true/>"));

TEST(TSYUserIdentityCache, copesWithoutADefaultUser) {
  const ContainerDevice device(
      makeList(),
      {{"/etc/passwd", "root:x:0:0::/private/var/root:\nalice:x:502:502::/private/var/alice:\n"}});
  TSYUserIdentityCache cache;
  EXPECT_EQ(TSYUserIdentityCache::defaultUserIdentity(), nullptr);
  EXPECT_FALSE(TSYUserIdentityCache::personasAreSupported());
  EXPECT_EQ(cache.userIdentityForCurrentContext(), nullptr);
  EXPECT_EQ(cache.userIdentityForPersonaUniqueString("E1", 0, 0), nullptr);
  cache.forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [](const auto&) { FAIL() << "there is nobody"; });
  // Other users are served all the same.
  EXPECT_NE(cache.userIdentityForCurrentContextWithUID(502, 502), nullptr);
}

}  // namespace
