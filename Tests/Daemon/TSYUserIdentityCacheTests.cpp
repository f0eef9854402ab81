#include "Daemon/TSYUserIdentityCache.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <thread>

#include "Tests/Daemon/TestPlatform.h"

namespace {

using platform::PersonaKind;
using testing::ElementsAre;
using testing::IsEmpty;

FakePersonas::List makeList() {
  FakePersonas::List list = {
      makePersona(PersonaKind::enterprise, 201, "E1", {"com.first"}),
      makePersona(PersonaKind::universal, 300, "U", {"com.shared", "com.first"}),
      makePersona(PersonaKind::enterprise, 202, std::nullopt),
      makePersona(PersonaKind::enterprise, 203, "E2", {"com.second"}),
      makePersona(PersonaKind::system, 500, std::nullopt),
      // Sorts behind the universal persona.
      makePersona(PersonaKind::personal, 100, "Z"),
  };
  list.front().layoutPath = "/layout/E1";
  return list;
}

std::vector<std::string> identifiersOf(const TSYUserIdentityCache::IdentitySet& identities) {
  std::vector<std::string> identifiers;
  for (const auto& identity : identities) identifiers.push_back(identity->identifier());
  return identifiers;
}

struct Counter : TSYUserIdentityCacheObserver {
  void userIdentityCacheDidInvalidateUserIdentity(TSYUserIdentityCache& cache,
                                                  const TSYUserIdentityRef& identity) override {
    seen.push_back(identity->identifier());
    // Calling back at once reads the list anew.
    personal = cache.userIdentityForPersonalPersona();
  }
  std::vector<std::string> seen;
  TSYUserIdentityRef personal;
};

TEST(TSYUserIdentityCache, mirrorsThePersonaList) {
  const TestPlatform platform(makeList());
  TSYUserIdentityCache cache;
  const auto bundle = [&](const char* identifier) {
    return identifiersOf(cache.userIdentitiesForBundleIdentifier(identifier));
  };
  EXPECT_THAT(bundle("com.shared"), ElementsAre("501", "E1", "E2"));
  EXPECT_THAT(bundle("com.first"), ElementsAre("501", "E1", "E2"));
  EXPECT_THAT(bundle("com.second"), ElementsAre("E2"));
  EXPECT_THAT(bundle("com.nobody"), ElementsAre("501"));
  const TSYUserIdentityRef personal = cache.userIdentityForPersonalPersona();
  EXPECT_FALSE(cache.isBundleIdentifierAssociatedWithUserIdentity("com.second", *personal));
  EXPECT_TRUE(cache.isBundleIdentifierAssociatedWithUserIdentity("com.nobody", *personal));

  EXPECT_EQ(personal->personaType(), TSYPersonaType::personal);
  EXPECT_EQ(personal->kernelPersonaID(), 100);
  EXPECT_EQ(personal->homeDirectoryURL()->path(), platform.path("/private/var/mobile"));
  EXPECT_TRUE(cache.unspecificUserIdentity()->isNoSpecificPersona());
  EXPECT_EQ(cache.userIdentityWithPersonaID(100), personal);
  EXPECT_EQ(cache.userIdentityWithPersonaID(300), cache.unspecificUserIdentity());
  EXPECT_EQ(cache.userIdentityWithPersonaID(500), cache.unspecificUserIdentity());
  EXPECT_EQ(cache.userIdentityWithPersonaID(203)->homeDirectoryURL(), personal->homeDirectoryURL());
  EXPECT_EQ(cache.userIdentityWithPersonaID(201)->homeDirectoryURL()->path(), "/layout/E1");
  EXPECT_EQ(cache.userIdentityWithPersonaID(202), nullptr);
  EXPECT_EQ(cache.userIdentityForCurrentUserWithPersonaUniqueString("none"), nullptr);

  std::vector<std::pair<std::string, TSYPersonaType>> accessible;
  cache.forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const auto& identity) {
    cache.unspecificUserIdentity();  // no lock is held
    accessible.emplace_back(identity->identifier(), identity->personaType());
  });
  EXPECT_THAT(accessible, ElementsAre(std::pair("501", TSYPersonaType::personal),
                                      std::pair("E1", TSYPersonaType::enterprise),
                                      std::pair("E2", TSYPersonaType::enterprise)));
}

TEST(TSYUserIdentityCache, aRequestMeansThePersonaOfItsCaller) {
  const TestPlatform platform(makeList());
  TSYUserIdentityCache cache;
  constexpr auto kEnterprise = TSYPersonaType::enterprise;
  const struct {
    std::optional<std::string> persona;
    uid_t uid;
    uid_t resultingUID;  // 0 for none
    TSYPersonaType type;
    std::string home;
  } cases[] = {
      {std::nullopt, 501, 501, TSYPersonaType::unspecific, platform.path("/private/var/mobile")},
      {std::nullopt, 0, 501, TSYPersonaType::unspecific, platform.path("/private/var/mobile")},
      {std::nullopt, 502, 502, TSYPersonaType::unspecific, platform.path("/private/var/alice")},
      {"Z", 501, 501, TSYPersonaType::personal, platform.path("/private/var/mobile")},
      {"Z", 502, 502, TSYPersonaType::personal, platform.path("/private/var/alice")},
      {"E1", 501, 501, kEnterprise, "/layout/E1"},
      {"E1", 502, 502, kEnterprise, "/layout/E1"},
      {"E1", 500, 501, kEnterprise, "/layout/E1"},
      {"U", 501, 501, TSYPersonaType::unspecific, platform.path("/private/var/mobile")},
      {"gone", 501, 0, TSYPersonaType::personal, ""},
      {"", 501, 0, TSYPersonaType::personal, ""},
  };
  for (const auto& test : cases) {
    const TSYUserIdentityCache::CallerContext context(test.persona);
    const auto identity = cache.userIdentityForCurrentContextWithUID(test.uid, test.uid);
    const std::string name = test.persona.value_or("none") + ", " + std::to_string(test.uid);
    ASSERT_EQ(identity != nullptr, test.resultingUID != 0) << name;
    if (identity == nullptr) continue;
    EXPECT_EQ(identity->posixUID(), test.resultingUID) << name;
    EXPECT_EQ(identity->posixGID(), test.resultingUID) << name;
    EXPECT_EQ(identity->personaType(), test.type) << name;
    EXPECT_EQ(identity->homeDirectoryURL()->path(), test.home) << name;
  }
  // A context ends with its scope, the outer one comes back, and both are the thread's own.
  EXPECT_TRUE(cache.userIdentityForCurrentContext()->isNoSpecificPersona());
  const TSYUserIdentityCache::CallerContext context("E1");
  {
    const TSYUserIdentityCache::CallerContext inner("Z");
  }
  EXPECT_TRUE(cache.userIdentityForCurrentContext()->isEnterprise());
  TSYPersonaType elsewhere = TSYPersonaType::personal;
  std::thread([&] { elsewhere = cache.userIdentityForCurrentContext()->personaType(); }).join();
  EXPECT_EQ(elsewhere, TSYPersonaType::unspecific);
}

TEST(TSYUserIdentityCache, aChangedListInvalidatesEnterpriseIdentitiesOnce) {
  TestPlatform platform(makeList());
  TSYUserIdentityCache cache;
  Counter counter;
  cache.addObserver(counter);
  cache.flush();  // nothing has been read yet
  EXPECT_THAT(counter.seen, IsEmpty());
  cache.unspecificUserIdentity();

  FakePersonas::List list = makeList();
  std::erase_if(list, [](const auto& persona) { return persona.uniqueString == "E1"; });
  platform.personas().setList(list);
  EXPECT_NE(cache.userIdentityWithPersonaID(201), nullptr);
  platform.personas().tellObservers();
  cache.waitForFlushes();
  // E2 is still there when the observer reads the new list; it is not reported for that.
  EXPECT_THAT(counter.seen, ElementsAre("E1", "E2"));
  EXPECT_EQ(counter.personal, cache.userIdentityForPersonalPersona());
  EXPECT_EQ(cache.userIdentityWithPersonaID(201), nullptr);
  EXPECT_NE(cache.userIdentityWithPersonaID(203), nullptr);

  cache.removeObserver(counter);
  cache.flush();
  EXPECT_EQ(counter.seen.size(), 2U);
  cache.userIdentityForPersonalPersona();
  cache.unregister();
  platform.personas().setList(makeList());
  platform.personas().tellObservers();
  cache.waitForFlushes();
  EXPECT_EQ(cache.userIdentityWithPersonaID(201), nullptr);
}

TEST(TSYUserIdentityCache, theServiceMayOutliveTheCache) {
  TestPlatform platform(makeList());
  std::make_unique<TSYUserIdentityCache>();
  platform.personas().tellObservers();
}

TEST(TSYUserIdentityCache, waitsForAUsableList) {
  TestPlatform platform(FakePersonas::List{});
  int tries = 1;
  const auto sleep = [&](std::chrono::seconds time) {
    EXPECT_EQ(time, std::chrono::seconds(1));
    ++tries;
    // Without a personal persona, then with one that has no name, then with a good one.
    FakePersonas::List list = makeList();
    if (tries == 3) list.pop_back();
    if (tries == 4) list.back().uniqueString.reset();
    if (tries >= 3) platform.personas().setList(list);
  };
  TSYUserIdentityCache cache(sleep);
  EXPECT_EQ(cache.userIdentityForPersonalPersona()->kernelPersonaID(), 100);
  EXPECT_EQ(tries, 5);
}

TEST(TSYUserIdentityCacheDeathTest, endsTheProcessWithoutAList) {
  const TestPlatform platform(FakePersonas::List{});
  const auto sleepsSixtyTimes = testing::Truly(
      [](const std::string& output) { return std::ranges::count(output, '#') == 60; });
  EXPECT_EXIT(
      {
        TSYUserIdentityCache cache([](std::chrono::seconds) { std::fputc('#', stderr); });
        cache.unspecificUserIdentity();
      },
      testing::KilledBySignal(SIGABRT), sleepsSixtyTimes);
}

TEST(TSYUserIdentityCache, takesAGivenListInstead) {
  const TestPlatform platform(makeList());
  TSYUserIdentityCache cache;
  Counter counter;
  cache.addObserver(counter);
  const auto make = [](uid_t uid, const char* uniqueString, TSYPersonaType type, int id) {
    return TSYUserIdentity::initWithUID(uid, uid, TSYURL("/home"), uniqueString, type, id);
  };
  cache.userIdentityForPersonalPersona();
  const auto enterprise = make(501, "E9", TSYPersonaType::enterprise, 900);
  const auto personal = make(600, "P9", TSYPersonaType::personal, 901);
  cache.flushAndRepopulateWithUserIdentities(
      {make(601, "P8", TSYPersonaType::personal, 902), enterprise, personal});
  EXPECT_THAT(counter.seen, IsEmpty());
  EXPECT_EQ(cache.userIdentityForPersonalPersona(), personal);
  EXPECT_TRUE(cache.unspecificUserIdentity()->isNoSpecificPersona());
  EXPECT_EQ(cache.unspecificUserIdentity()->kernelPersonaID(), 901);
  EXPECT_EQ(cache.userIdentityWithPersonaID(900), enterprise);
  EXPECT_EQ(cache.userIdentityForPersonaUniqueString("E9", 501, 501), enterprise);
  EXPECT_EQ(cache.userIdentityForPersonaUniqueString("E1", 501, 501), nullptr);
  EXPECT_THAT(identifiersOf(cache.userIdentitiesForBundleIdentifier("com.shared")),
              ElementsAre("600"));
  cache.removeObserver(counter);
}

struct SupportCase {
  const char* device;  // entries of the device's settings
  bool personas;
  bool supported;
};

class PersonaSupport : public testing::TestWithParam<SupportCase> {};

TEST_P(PersonaSupport, isDecidedByTheDevice) {
  const std::string settings =
      std::string("<plist version=\"1.0\"><dict>") + GetParam().device + "</dict></plist>";
  const TestPlatform platform(GetParam().personas ? std::optional(makeList()) : std::nullopt,
                              {{"/etc/tessary/device.plist", settings}});
  TSYUserIdentityCache cache;
  EXPECT_EQ(TSYUserIdentityCache::personasAreSupported(), GetParam().supported);
  if (GetParam().supported) return;
  // The one identity answers everything.
  const TSYUserIdentityRef mobile = TSYUserIdentityCache::defaultUserIdentity();
  const TSYUserIdentityCache::CallerContext context("E1");
  EXPECT_EQ(cache.userIdentityForCurrentContext(), mobile);
  EXPECT_EQ(cache.userIdentityForPersonaUniqueString("E1", 0, 0), mobile);
  EXPECT_EQ(cache.unspecificUserIdentity(), mobile);
  EXPECT_EQ(cache.userIdentityWithPersonaID(201), nullptr);
  EXPECT_EQ(cache.userIdentityForCurrentContextWithUID(502, 502)->identifier(), "502");
  const auto stranger = cache.userIdentityForPersonalPersonaWithUID(777, 777);
  EXPECT_TRUE(cache.isBundleIdentifierAssociatedWithUserIdentity("com.second", *stranger));
  int calls = 0;
  cache.forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const auto&) { ++calls; });
  EXPECT_EQ(calls, 1);
}

INSTANTIATE_TEST_SUITE_P(
    Devices, PersonaSupport,
    testing::Values(
        SupportCase{"", true, true}, SupportCase{"", false, false},
        SupportCase{"<key>MultiUserFlags</key><integer>2147483648</integer>", true, false},
        SupportCase{"<key>MultiUserFlags</key><integer>2147483647</integer>", true, true},
        SupportCase{"<key>PersonasRuledOut</key><true/>", true, false},
        SupportCase{"<key>EphemeralStorage</key><true/>", true, false}));

TEST(TSYUserIdentityCache, copesWithoutADefaultUser) {
  const TestPlatform platform(
      makeList(),
      {{"/etc/passwd", "root:x:0:0::/private/var/root:\nalice:x:502:502::/private/var/alice:\n"}});
  TSYUserIdentityCache cache;
  EXPECT_EQ(TSYUserIdentityCache::defaultUserIdentity(), nullptr);
  EXPECT_FALSE(TSYUserIdentityCache::personasAreSupported());
  EXPECT_EQ(cache.userIdentityForCurrentContext(), nullptr);
  EXPECT_EQ(cache.userIdentityForPersonaUniqueString("E1", 0, 0), nullptr);
  EXPECT_EQ(cache.unspecificUserIdentity(), nullptr);
  EXPECT_THAT(cache.userIdentitiesForBundleIdentifier("com.first"), IsEmpty());
  cache.forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [](const auto&) { FAIL() << "there is nobody"; });
  // Other users are served all the same.
  const auto alice = cache.userIdentityForCurrentContextWithUID(502, 502);
  ASSERT_NE(alice, nullptr);
  EXPECT_EQ(alice->homeDirectoryURL()->path(), platform.path("/private/var/alice"));
  cache.flush();
  cache.flushAndRepopulateWithUserIdentities({});
  EXPECT_EQ(cache.unspecificUserIdentity(), nullptr);
}

// For the thread sanitizer: readers, changes of the list, and observers that come, call back and
// go.
TEST(TSYUserIdentityCache, readersFlushesAndObserversMix) {
  TestPlatform platform(makeList());
  TSYUserIdentityCache cache;
  std::atomic<bool> ending = false;
  std::vector<std::thread> threads;
  for (int i = 0; i < 3; ++i) {
    threads.emplace_back([&] {
      while (!ending) {
        const TSYUserIdentityCache::CallerContext context("E1");
        EXPECT_EQ(cache.userIdentityForCurrentContextWithUID(501, 501)->identifier(), "E1");
        EXPECT_EQ(cache.userIdentitiesForBundleIdentifier("com.shared").size(), 3U);
      }
    });
  }
  threads.emplace_back([&] {
    while (!ending) {
      auto visitor = std::make_unique<Counter>();
      cache.addObserver(*visitor);
      std::this_thread::yield();
      cache.removeObserver(*visitor);
    }
  });
  Counter counter;
  cache.addObserver(counter);
  for (int i = 0; i < 200; ++i) {
    platform.personas().tellObservers();
    cache.waitForFlushes();
  }
  ending = true;
  for (std::thread& thread : threads) thread.join();
  cache.removeObserver(counter);
  // Each flush reported both or, when nobody had read in between, none.
  EXPECT_GT(counter.seen.size(), 0U);
  EXPECT_EQ(std::ranges::count(counter.seen, "E1"), std::ranges::count(counter.seen, "E2"));
}

}  // namespace
