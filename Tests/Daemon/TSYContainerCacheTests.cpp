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

const std::string kApplications = "/private/var/mobile/Containers/Data/Application";
const std::string kSystem = "/private/var/containers/Data/System";

class ContainerCache : public testing::Test {
 protected:
  TSYUserIdentityRef user(const char* uniqueString) {
    return users_.userIdentityForCurrentUserWithPersonaUniqueString(uniqueString);
  }
  // Puts a container on the disk, behind the cache's back. Returns its path.
  std::string put(const std::string& directory, const std::string& identifier,
                  TSYContainerClass class_, const TSYUserIdentityRef& owner,
                  const std::string& name = UUID::random().string()) {
    std::string container = device_.path(directory + "/" + name);
    std::filesystem::create_directories(container);
    const TSYMetadata metadata(concreteContainerOf(owner, identifier, class_), nullptr,
                               TSYURL(container), std::nullopt);
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
  put(kApplications, "good", 2, personal);
  put(kApplications, "lower", 2, personal, "0f8fad5b-d9cb-469f-a165-70867728950e");
  put(kApplications, "not-a-uuid", 2, personal, "com.example.app");
  put(kApplications, "known", 2, personal, "com.veltra.exampled");
  put(kApplications, "class-4", 4, personal);
  put(kApplications, "works", 2, user("E1"));
  put(kApplications, "twice", 2, personal);
  put(kApplications, "twice", 2, personal);
  std::filesystem::create_symlink(put("/elsewhere/Data/Application", "linked", 2, personal),
                                  device_.path(kApplications + "/" + UUID::random().string()));
  device_.write(kApplications + "/" + UUID::random().string(), "a file");
  put(kSystem, "com.veltra.exampled", 12, global, "com.veltra.exampled");
  put(kSystem, "palette", 12, global, "systemgroup.com.veltra.palette");

  EXPECT_THAT(list(personal, 2), UnorderedElementsAre("501:good", "501:lower", "501:twice"));
  EXPECT_THAT(list(personal, 12), UnorderedElementsAre("501:com.veltra.exampled"));
  EXPECT_THAT(list(personal, 14), UnorderedElementsAre("47"));
  // Of the two with one identifier, the sandbox is told of the one that was kept.
  const auto kept = cache_.containerForContainerIdentity(containerOf(personal, "twice", 2),
                                                         /*transient=*/false,
                                                         /*updateSandbox=*/true);
  ASSERT_TRUE(kept.has_value());
  EXPECT_EQ(device_.path(device_.mappings().at("501/100/1/twice")), (*kept)->url().path());
}

TEST_F(ContainerCache, theUnspecificIdentityListsEveryPersonaOnceOrFails) {
  const TSYUserIdentityRef unspecific = users_.unspecificUserIdentity();
  put(kApplications, "app", 2, user("P"));
  put("/private/var/E1/Containers/Data/Application", "app", 2, user("E1"));
  put("/private/var/containers/Bundle/Application", "app", 1,
      TSYUserIdentityCache::defaultUserIdentity());
  EXPECT_THAT(list(unspecific, 2), UnorderedElementsAre("501:app", "E1:app"));
  EXPECT_THAT(list(user("E1"), 2), UnorderedElementsAre("E1:app"));
  for (const auto& owner : {unspecific, user("P"), user("E1")}) {
    EXPECT_THAT(list(owner, 1), UnorderedElementsAre("501:app"));
  }
  // One persona's directory cannot be listed: the others' are no answer.
  device_.write("/private/var/E2/Containers/Shared", "in the way");
  EXPECT_THAT(list(unspecific, 7), UnorderedElementsAre("43"));
  EXPECT_THAT(list(user("E1"), 7), IsEmpty());
  std::filesystem::remove(device_.path("/private/var/E2/Containers/Shared"));
  EXPECT_EQ(look(user("E2"), "x", 7), 21U) << "a failed scan leaves no entry";
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
               {"E1", "com.work", 10, false, true, "501/201/1/com.work"}};
  for (const auto& test : cases) {
    SCOPED_TRACE(fmt::format("{} {} {}", test.user, test.identifier, test.class_));
    const TSYMetadata metadata(concreteContainerOf(user(test.user), test.identifier, test.class_),
                               nullptr, TSYURL("/unused"), std::nullopt);
    EXPECT_TRUE(cache_
                    .addContainerMetadata(metadata, TSYURL(device_.path("/at")), test.transient,
                                          test.updateSandbox)
                    .has_value());
    std::map<std::string, std::string> expected;
    if (!test.mapping.empty()) expected[test.mapping] = "/at";
    EXPECT_EQ(device_.mappings(), expected);
    EXPECT_TRUE(cache_
                    .removeContainerForUserIdentity(user(test.user), test.class_, test.identifier,
                                                    test.transient)
                    .has_value());
    EXPECT_THAT(device_.mappings(), IsEmpty());
    EXPECT_EQ(look(user(test.user), test.identifier, test.class_, test.transient), 21U);
  }
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
  add(/*transient=*/false);
  EXPECT_EQ(cache_.containerForContainerIdentity(live), nullptr) << "another took its place";
}

TEST_F(ContainerCache, threadsMayReadAndChangeOneEntryWhileAnIdentityGoes) {
  for (int i = 0; i < 40; ++i) put(kApplications, "app" + std::to_string(i), 2, user("P"));
  std::vector<std::thread> threads;
  for (int thread = 0; thread < 8; ++thread) {
    threads.emplace_back([this, thread] {
      const std::string name = "own" + std::to_string(thread);
      EXPECT_EQ(look(user("P"), "app7", 2), 1U);
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
  EXPECT_EQ(list(user("P"), 2).size(), 40U);
  EXPECT_EQ(device_.mappings().size(), 40U);
}

}  // namespace
