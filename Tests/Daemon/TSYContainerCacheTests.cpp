#include "Daemon/TSYContainerCache.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <thread>

#include "Daemon/TSYCodeSigningMapping.h"
#include "Tests/Daemon/ContainerDevice.h"

namespace {

using platform::UUID;
using testing::IsEmpty;
using testing::UnorderedElementsAre;
using Mappings = std::map<std::string, std::string>;

constexpr char kApplications[] = "/private/var/mobile/Containers/Data/Application";
constexpr char kSystem[] = "/private/var/containers/Data/System";

class ContainerCache : public testing::Test {
 protected:
  TSYUserIdentityRef user(const char* uniqueString) {
    return users_.userIdentityForCurrentUserWithPersonaUniqueString(uniqueString);
  }
  // Puts a container on the disk, behind the cache's back. Returns its path on the device.
  std::string put(const std::string& directory, const std::string& identifier,
                  TSYContainerClass class_, const TSYUserIdentityRef& owner,
                  const std::string& name = UUID::random().string()) {
    std::string container = directory + "/" + name;
    std::filesystem::create_directories(device_.path(container));
    const TSYMetadata metadata(concreteContainerOf(owner, identifier, class_), nullptr,
                               TSYURL(device_.path(container)), std::nullopt);
    EXPECT_TRUE(metadata.writeMetadataToDisk().has_value());
    return container;
  }
  // 1 when the cache has the container, else the code.
  uint64_t look(const TSYUserIdentityRef& owner, const std::string& identifier,
                TSYContainerClass class_, bool transient = false) {
    const auto found = cache_.containerForContainerIdentity(containerOf(owner, identifier, class_),
                                                            transient, /*updateSandbox=*/true);
    return found ? TSYErrorSuccess : found.error().code();
  }
  std::vector<std::string> list(const TSYUserIdentityRef& owner, TSYContainerClass class_) {
    const auto all = cache_.allContainersForUserIdentity(owner, class_, /*transient=*/false);
    if (!all) return {std::to_string(all.error().code())};
    std::vector<std::string> identifiers;
    for (const TSYMetadataRef& container : *all) {
      identifiers.push_back(container->userIdentity()->identifier() + ":" +
                            container->identifier());
    }
    return identifiers;
  }

  const ContainerDevice device_{workPersonas()};
  TSYUserIdentityCache users_;
  TSYContainerCache cache_{users_, TSYCodeSigningMapping::sharedInstance()};
};

TEST_F(ContainerCache, aScanTakesWhatIsAContainerOfTheClassAndNothingElse) {
  const TSYUserIdentityRef personal = user("P");
  const TSYUserIdentityRef global = TSYUserIdentityCache::defaultUserIdentity();
  const std::string good = put(kApplications, "good", 2, personal);
  put(kApplications, "lower", 2, personal, "0f8fad5b-d9cb-469f-a165-70867728950e");
  put(kApplications, "not-a-uuid", 2, personal, "com.example.app");
  put(kApplications, "known", 2, personal, "com.veltra.exampled");
  put(kApplications, "class-4", 4, personal);
  put(kApplications, "works", 2, user("E1"));
  const std::string outside = put("/elsewhere/Data/Application", "linked", 2, personal);
  std::filesystem::create_symlink(
      device_.path(outside),
      device_.path(std::string(kApplications) + "/" + UUID::random().string()));
  device_.write(std::string(kApplications) + "/" + UUID::random().string(), "a file");
  device_.write(
      std::string(kApplications) + "/" + UUID::random().string() + "/" + kTSYMetadataFileName,
      "bplist00");
  put(kSystem, "com.veltra.exampled", 12, global, "com.veltra.exampled");
  put(kSystem, "palette", 12, global, "systemgroup.com.veltra.palette");
  put("/private/var/containers/Shared/SystemGroup", "palette", 13, global,
      "systemgroup.com.veltra.palette");

  EXPECT_THAT(list(personal, 2), UnorderedElementsAre("501:good", "501:lower"));
  EXPECT_THAT(list(personal, 12), UnorderedElementsAre("501:com.veltra.exampled"));
  EXPECT_THAT(list(personal, 13), UnorderedElementsAre("501:palette"));
  EXPECT_THAT(list(personal, 4), IsEmpty());
  EXPECT_THAT(list(personal, 0), UnorderedElementsAre("47"));
  EXPECT_THAT(list(personal, 14), UnorderedElementsAre("47"));
  const auto found = cache_.containerForContainerIdentity(containerOf(personal, "good", 2),
                                                          /*transient=*/false,
                                                          /*updateSandbox=*/true);
  ASSERT_TRUE(found.has_value());
  EXPECT_EQ((*found)->url().path(), device_.path(good));
  EXPECT_TRUE((*found)->existed());
  expectFailure(cache_.containerForContainerIdentity(containerOf(personal, "none", 2), false, true),
                21, "Cache: [501]-appData: Container Not Found with ID: none");
  EXPECT_EQ(device_.countInLog("Container Not Found"), 0U) << "a lookup may miss";
}

TEST_F(ContainerCache, ofTwoWithOneIdentifierOneIsKeptAndMapped) {
  put(kApplications, "twice", 2, user("P"));
  put(kApplications, "twice", 2, user("P"));
  const auto all = cache_.allContainersForUserIdentity(user("P"), 2, /*transient=*/false);
  ASSERT_EQ(all->size(), 1U);
  EXPECT_EQ(device_.path(device_.mappings().at("501/100/1/twice")), all->front()->url().path());
}

TEST_F(ContainerCache, aContainerThatHasGoneIsInconsistentOnceAndThenNotFound) {
  const std::string first = put(kApplications, "first", 2, user("P"));
  const std::string second = put(kApplications, "second", 2, user("P"));
  put(kApplications, "third", 2, user("P"));
  EXPECT_EQ(look(user("P"), "first", 2), 1U);
  EXPECT_EQ(device_.mappings().size(), 3U);
  std::filesystem::remove_all(device_.path(first));
  std::filesystem::remove_all(device_.path(second));
  EXPECT_EQ(look(user("P"), "first", 2), 44U);
  EXPECT_EQ(look(user("P"), "first", 2), 21U);
  EXPECT_THAT(list(user("P"), 2), UnorderedElementsAre("501:third"));
  EXPECT_EQ(look(user("P"), "second", 2), 21U) << "the listing dropped it";
  EXPECT_EQ(device_.mappings().size(), 1U);
}

TEST_F(ContainerCache, theUnspecificIdentityListsEveryPersonaOnce) {
  const TSYUserIdentityRef unspecific = users_.unspecificUserIdentity();
  put(kApplications, "app", 2, user("P"));
  put("/private/var/E1/Containers/Data/Application", "app", 2, user("E1"));
  put("/private/var/E2/Containers/Data/Application", "app", 2, user("E2"));
  put("/private/var/containers/Bundle/Application", "app", 1,
      TSYUserIdentityCache::defaultUserIdentity());
  EXPECT_THAT(list(unspecific, 2), UnorderedElementsAre("501:app", "E1:app", "E2:app"));
  EXPECT_THAT(list(user("E1"), 2), UnorderedElementsAre("E1:app"));
  for (const auto& owner : {unspecific, user("P"), user("E1")}) {
    EXPECT_THAT(list(owner, 1), UnorderedElementsAre("501:app"));
  }
  EXPECT_EQ(device_.countInLog("Rebuilding container class cache: app\n"), 1U) << "shared by all";

  // One persona's directory cannot be listed: the others' are no answer.
  device_.write("/private/var/E2/Containers/Shared", "in the way");
  EXPECT_THAT(list(unspecific, 7), UnorderedElementsAre("43"));
  EXPECT_THAT(list(user("E1"), 7), IsEmpty());
  expectFailure(cache_.containerForContainerIdentity(containerOf(user("E2"), "x", 7), false, true),
                43, "Cache: [E2]-appGroup: Failed to rebuild");
  std::filesystem::remove(device_.path("/private/var/E2/Containers/Shared"));
  EXPECT_EQ(look(user("E2"), "x", 7), 21U) << "a failed scan leaves no entry";
}

TEST_F(ContainerCache, whichContainerTheSandboxShouldSee) {
  const struct {
    std::string identifier;
    TSYContainerClass class_;
    std::string registered;  // of personal, unspecific, E1, E2
  } cases[] = {{"com.nobody", 2, "PU"}, {"com.nobody", 4, "PU"}, {"com.work", 2, "1"},
               {"com.both", 11, "PU"},  {"com.corp", 9, "12"},   {"com.work", 7, "PU12"},
               {"com.corp", 12, "PU"},  {"com.corp", 13, "PU"},  {"com.work", 1, "PU"},
               {"com.corp", 0, "PU"},   {"com.corp", 6, "12"}};
  const std::pair<char, TSYUserIdentityRef> identities[] = {{'P', user("P")},
                                                            {'U', users_.unspecificUserIdentity()},
                                                            {'1', user("E1")},
                                                            {'2', user("E2")}};
  for (const auto& test : cases) {
    std::string registered;
    for (const auto& [name, identity] : identities) {
      if (cache_.shouldRegisterSandboxMappingWithUserIdentity(identity, test.identifier,
                                                              test.class_)) {
        registered += name;
      }
    }
    EXPECT_EQ(registered, test.registered) << test.identifier << " " << test.class_;
  }
}

TEST_F(ContainerCache, theSandboxIsToldWhatIsAddedAndRemoved) {
  const struct {
    const char* user;
    std::string identifier;
    TSYContainerClass class_;
    bool transient;
    bool updateSandbox;
    std::string mapping;  // none when empty
  } cases[] = {{"P", "com.a", 2, false, true, "501/100/1/com.a"},
               {"P", "com.a", 7, false, true, "501/100/2/com.a"},
               {"P", "com.a", 12, false, true, "0/100/4/com.a"},
               {"P", "com.a", 13, false, true, "0/100/8/com.a"},
               {"P", "com.a", 1, false, true, ""},
               {"P", "com.a", 2, true, true, ""},
               {"P", "com.a", 2, false, false, ""},
               {"P", "com.work", 2, false, true, ""},
               {"E1", "com.work", 10, false, true, "501/201/1/com.work"},
               {"E1", "com.both", 2, false, true, ""},
               {"E2", "a group", 7, false, true, "501/202/2/a group"}};
  for (const auto& test : cases) {
    const TSYMetadata metadata(concreteContainerOf(user(test.user), test.identifier, test.class_),
                               nullptr, TSYURL("/unused"), std::nullopt);
    ASSERT_TRUE(cache_
                    .addContainerMetadata(metadata, TSYURL(device_.path("/at")), test.transient,
                                          test.updateSandbox)
                    .has_value());
    Mappings expected;
    if (!test.mapping.empty()) expected[test.mapping] = "/at";
    EXPECT_EQ(device_.mappings(), expected) << test.identifier << " " << test.class_;
    ASSERT_TRUE(cache_
                    .removeContainerForUserIdentity(user(test.user), test.class_, test.identifier,
                                                    test.transient)
                    .has_value());
    EXPECT_THAT(device_.mappings(), IsEmpty());
    EXPECT_EQ(look(user(test.user), test.identifier, test.class_, test.transient), 21U);
  }
  const TSYMetadata metadata(concreteContainerOf(user("P"), "x", 2), nullptr, TSYURL("/unused"),
                             std::nullopt);
  expectFailure(cache_.addContainerMetadata(metadata, TSYURL(), false, true), 47, "Invalid input");
  expectFailure(cache_.removeContainerForUserIdentity(user("P"), 14, "x", false), 47,
                "Invalid Content Class: 14");
  EXPECT_FALSE(cache_.setSandboxContainerMappingForUserIdentity(user("P"), "x", 14, TSYURL("/at")));
}

TEST_F(ContainerCache, theVeryContainerIsFoundByItsUUID) {
  const auto add = [&](bool transient) {
    const auto identity = concreteContainerOf(user("P"), "app", 2);
    const TSYMetadata metadata(identity, nullptr, TSYURL("/unused"), std::nullopt);
    EXPECT_TRUE(cache_.addContainerMetadata(metadata, TSYURL("/at"), transient, true).has_value());
    return identity;
  };
  const auto live = add(/*transient=*/false);
  const auto transient = add(/*transient=*/true);
  ASSERT_NE(cache_.containerForContainerIdentity(live), nullptr);
  EXPECT_FALSE(cache_.containerForContainerIdentity(live)->transient());
  ASSERT_NE(cache_.containerForContainerIdentity(transient), nullptr);
  EXPECT_TRUE(cache_.containerForContainerIdentity(transient)->transient());
  EXPECT_EQ(cache_.containerForContainerIdentity(concreteContainerOf(user("P"), "app", 2)),
            nullptr);
  add(/*transient=*/false);
  EXPECT_EQ(cache_.containerForContainerIdentity(live), nullptr) << "another took its place";
}

TEST_F(ContainerCache, anIdentityThatGoesIsForgotten) {
  const std::string work = "/private/var/E1/Containers/Data/Application";
  put(work, "com.work", 2, user("E1"));
  put(kApplications, "app", 2, user("P"));
  EXPECT_EQ(look(user("E1"), "com.work", 2), 1U);
  EXPECT_EQ(look(user("P"), "app", 2), 1U);
  put(work, "com.corp", 2, user("E1"));
  put(kApplications, "late", 2, user("P"));
  EXPECT_EQ(look(user("E1"), "com.corp", 2), 21U) << "the entry is authoritative";
  EXPECT_EQ(device_.mappings().size(), 2U);
  users_.flush();
  EXPECT_EQ(device_.mappings().size(), 1U);
  EXPECT_EQ(device_.read("/run/tessary/notifications/com.veltra.tessary.user-invalidated")[0], '2');
  EXPECT_EQ(look(user("E1"), "com.corp", 2), 1U);
  EXPECT_EQ(look(user("P"), "late", 2), 21U) << "the personal identity stays";
  EXPECT_EQ(device_.mappings().size(), 3U);
}

TEST_F(ContainerCache, firstRequestsAtTheSameTimeScanOnce) {
  for (int i = 0; i < 40; ++i) put(kApplications, "app" + std::to_string(i), 2, user("P"));
  std::vector<std::thread> threads;
  for (int thread = 0; thread < 8; ++thread) {
    threads.emplace_back([this, thread] {
      const std::string name = "own" + std::to_string(thread);
      EXPECT_EQ(look(user("P"), "app7", 2), 1U);
      // Readers and writers of one entry, and an identity that goes.
      const TSYMetadata metadata(concreteContainerOf(user("P"), name, 2), nullptr,
                                 TSYURL(device_.path("/none")), std::nullopt);
      for (int round = 0; round < 5; ++round) {
        EXPECT_TRUE(cache_.addContainerMetadata(metadata, metadata.url(), false, true).has_value());
        if (thread == 0) users_.flush();
        if (thread % 2 == 0) list(user("P"), 2);
        EXPECT_TRUE(cache_.removeContainerForUserIdentity(user("P"), 2, name, false).has_value());
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(device_.countInLog("Rebuilding container class cache: [501]-appData\n"), 1U);
  EXPECT_EQ(list(user("P"), 2).size(), 40U);
  EXPECT_EQ(device_.mappings().size(), 40U);
}

}  // namespace
