#include "Daemon/TSYCodeSigningMapping.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <random>
#include <set>

#include "Daemon/TSYCodeSigningKeys.h"
#include "Daemon/TSYContainerCache.h"
#include "Daemon/TSYDataProtectionManager.h"
#include "Daemon/TSYGroupManager.h"
#include "Tests/Daemon/ContainerDevice.h"

namespace {

using platform::Value;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::UnorderedElementsAre;
using Dictionary = Value::Dictionary;
using Groups = std::vector<std::string>;
using Info = TSYCodeSigningMapping::Info;

constexpr TSYContainerClass kGroup = kTSYContainerClassAppGroup;
constexpr TSYContainerClass kSystemGroup = kTSYContainerClassSystemGroup;
constexpr TSYContainerClass kSystem = kTSYContainerClassSystemData;

Info infoWith(Dictionary entitlements) {
  return std::make_shared<const Dictionary>(
      Dictionary{{kTSYCodeSigningEntitlements, std::move(entitlements)}});
}

Info naming(const Groups& groups) {
  return infoWith({{kTSYEntitlementApplicationGroups, Value::Array(groups.begin(), groups.end())}});
}

Dictionary childOf(const std::string& parent) {
  return {{kTSYOptionParentBundleID, parent}};
}

class TSYCodeSigningMappingTest : public ::testing::Test {
 protected:
  uint64_t put(const Info& info, const std::string& identifier, const Dictionary& options = {}) {
    return mapping_.processCodeSigningInfo(info, identifier, options, queue_);
  }
  uint64_t registerCaller(const Dictionary& entitlements, const std::string& identifier) {
    return mapping_.processCallerRegisteredEntitlements(entitlements, identifier, queue_);
  }
  void drain() { EXPECT_TRUE(queue_.executeAllUntilExhausted().has_value()); }
  TSYUserIdentityRef user(const char* persona) {
    return TSYUserIdentitySharedCache::sharedInstance()
        .userIdentityForCurrentUserWithPersonaUniqueString(persona);
  }
  TSYResult<TSYMetadataRef> make(const TSYUserIdentityRef& owner, const std::string& identifier,
                                 TSYContainerClass containerClass) {
    return TSYClientConnection::sharedClientConnection()
        .createOrLookupContainerWithContainerIdentity(
            containerOf(owner, identifier, containerClass), /*createIfNecessary=*/true,
            /*transient=*/false, /*useLocking=*/true);
  }
  std::set<std::string> containers(const TSYUserIdentityRef& owner,
                                   TSYContainerClass containerClass) {
    std::set<std::string> identifiers;
    const auto all = TSYContainerCache::sharedInstance().allContainersForUserIdentity(
        owner, containerClass, /*transient=*/false);
    for (const TSYMetadataRef& each : all.value()) identifiers.insert(each->identifier());
    return identifiers;
  }
  size_t entriesIn() { return mapping_.identifiers().value().size(); }

  ContainerDevice device_{workPersonas()};
  TSYCodeSigningMapping& mapping_ = TSYCodeSigningMapping::sharedInstance();
  TSYCommandQueue queue_;
  const TSYUserIdentityRef personal_ = user("P");
  const TSYUserIdentityRef enterprise_ = user("E1");
};

TEST_F(TSYCodeSigningMappingTest, aCallerSpeaksForHimselfUntilTheInstallerDoes) {
  const Dictionary first{{"a", 1}};
  const Dictionary second{{"a", 2}};
  EXPECT_EQ(registerCaller(first, "caller"), 1U);
  EXPECT_EQ(registerCaller(first, "caller"), 1U);
  EXPECT_EQ(device_.countInLog("caller has changed entitlements. Re-registering."), 0U);
  EXPECT_EQ(registerCaller(second, "caller"), 1U);
  EXPECT_EQ(device_.countInLog("caller has changed entitlements. Re-registering."), 1U);
  EXPECT_EQ(*mapping_.entitlementsForIdentifier("caller"), second);
  EXPECT_TRUE(mapping_.identifierHasCallerRegisteredEntitlements("caller"));

  EXPECT_EQ(put(infoWith(first), "caller", {{kTSYOptionDataContainerClass, 2}}), 1U);
  EXPECT_EQ(registerCaller(second, "caller"), 1U);
  EXPECT_EQ(*mapping_.entitlementsForIdentifier("caller"), first);
  EXPECT_FALSE(mapping_.identifierHasCallerRegisteredEntitlements("caller"));
  EXPECT_EQ(mapping_.dataContainerTypeForIdentifier("caller"), 2U);
  EXPECT_EQ(mapping_.processCodeSigningInfo(infoWith(first), std::nullopt, {}, queue_), 18U);
}

TEST_F(TSYCodeSigningMappingTest, groupsAreStringsAndSystemGroupsHaveTheirPrefix) {
  const struct {
    Value value;
    std::optional<Groups> applicationGroups;
    std::optional<Groups> systemGroups;
  } kCases[] = {
      {Value::Array{"systemgroup.b", "a", "a", "../x"}, Groups{"../x", "a", "systemgroup.b"},
       Groups{"systemgroup.b"}},
      {"systemgroup.one", Groups{"systemgroup.one"}, Groups{"systemgroup.one"}},
      {Value::Array{"systemgroup.a", 5}, std::nullopt, std::nullopt},
      {Value::Array{}, Groups{}, std::nullopt},
      {5, std::nullopt, std::nullopt},
      {Dictionary{{"a", "b"}}, std::nullopt, std::nullopt},
  };
  for (const auto& each : kCases) {
    SCOPED_TRACE(each.value.description());
    put(infoWith({{kTSYEntitlementApplicationGroups, each.value},
                  {kTSYEntitlementSystemGroups, each.value}}),
        "app");
    EXPECT_EQ(mapping_.appGroupIdentifiersForIdentifier("app"), each.applicationGroups);
    EXPECT_EQ(mapping_.systemGroupIdentifiersForIdentifier("app"), each.systemGroups);
  }
  put(infoWith({{kTSYEntitlementSystemGroups, Value::Array{}},
                {kTSYEntitlementSystemGroupContainers, "systemgroup.other"}}),
      "app");
  EXPECT_EQ(mapping_.systemGroupIdentifiersForIdentifier("app"), Groups{"systemgroup.other"});
  EXPECT_EQ(mapping_.copyReferenceCountSetOfType(TSYGroupType::system).value(),
            (TSYCodeSigningMapping::ReferenceCounts{{"systemgroup.other", 1}}));
  EXPECT_EQ(mapping_.appGroupIdentifiersForIdentifier("nobody"), std::nullopt);
}

TEST_F(TSYCodeSigningMappingTest, aGroupContainerGoesWithItsLastReference) {
  put(naming({"shared", "own", "contested"}), "app");
  put(naming({"shared"}), "other", {{kTSYOptionPlaceholder, true}});
  for (const auto& owner : {personal_, enterprise_}) {
    for (const char* group : {"shared", "own", "contested"})
      ASSERT_TRUE(make(owner, group, kGroup));
  }
  put(naming({}), "app");
  // Somebody names it after the decision, and before the deletion.
  put(naming({"contested"}), "latecomer");
  drain();
  for (const auto& owner : {personal_, enterprise_}) {
    EXPECT_THAT(containers(owner, kGroup), UnorderedElementsAre("shared", "contested"));
  }
  mapping_.removeCodeSigningDictionariesForIdentifierAndItsChildren("other", queue_);
  drain();
  EXPECT_THAT(containers(personal_, kGroup), ElementsAre("contested"));

  put(infoWith(
          {{kTSYEntitlementSystemGroups, "systemgroup.a"}, {kTSYEntitlementSystemContainer, true}}),
      "service");
  ASSERT_TRUE(make(personal_, "systemgroup.a", kSystemGroup));
  ASSERT_TRUE(make(personal_, "service", kSystem));
  EXPECT_TRUE(mapping_.identifierHasSystemContainer("service"));
  put(infoWith({}), "service");
  put(infoWith({{kTSYEntitlementSystemContainer, true}}), "service");
  drain();
  EXPECT_THAT(containers(personal_, kSystem), ElementsAre("service")) << "entitled again";
  put(infoWith({}), "service");
  drain();
  EXPECT_THAT(containers(personal_, kSystem), IsEmpty());
  EXPECT_THAT(containers(personal_, kSystemGroup), ElementsAre("systemgroup.a"));
  EXPECT_EQ(device_.countInLog("Would have removed system group container references for "
                               "(systemgroup.a)"),
            1U);
}

TEST_F(TSYCodeSigningMappingTest, plugInsBelongToTheParentThatClaimsThemLast) {
  put(naming({"g"}), "plugin", childOf("app"));
  EXPECT_EQ(mapping_.parentIdentifierForChildIdentifier("plugin"), std::nullopt)
      << "the parent is not registered";
  put(naming({}), "app");
  put(naming({}), "new app");
  for (const char* parent : {"app", "new app"}) {
    put(naming({"g"}), "plugin", childOf(parent));
    EXPECT_EQ(mapping_.parentIdentifierForChildIdentifier("plugin"), parent);
  }
  EXPECT_EQ(mapping_.childBundleIdentifiersForParentIdentifier("app"), std::nullopt);

  // Parents in a circle, and one that is its own.
  put(naming({"x"}), "new app", childOf("plugin"));
  put(naming({"y"}), "narcissus");
  put(naming({"y"}), "narcissus", childOf("narcissus"));
  ASSERT_EQ(entriesIn(), 4U);
  EXPECT_TRUE(mapping_.invalidateCodeSigningInfoForIdentifierAndItsChildren("new app").has_value());
  EXPECT_EQ(mapping_.getCodeSigningInfoForIdentifier("plugin"), nullptr);
  EXPECT_NE(mapping_.getCodeSigningInfoForIdentifier("app"), nullptr);
  for (const char* identifier : {"new app", "narcissus"}) {
    mapping_.removeCodeSigningDictionariesForIdentifierAndItsChildren(identifier, queue_);
  }
  drain();
  EXPECT_THAT(mapping_.identifiers().value(), ElementsAre("app"));
}

TEST_F(TSYCodeSigningMappingTest, whatAnOlderInstallerLeftWithTheBundleIsTakenOver) {
  TSYMetadata bundle = **make(personal_, "app", kTSYContainerClassAppBundle);
  bundle.setInfo(std::make_shared<const Dictionary>(
      Dictionary{{"com.veltra.Hatchery.CachedCodeSigningInfo",
                  Dictionary{{"Entitlements", Dictionary{{"old", true}}}}}}));
  ASSERT_TRUE(TSYContainerCache::sharedInstance().addContainerMetadata(
      bundle, bundle.url(), /*transient=*/false, /*updateSandbox=*/false));
  EXPECT_EQ(*mapping_.entitlementsForIdentifier("app"), (Dictionary{{"old", true}}));
  EXPECT_EQ(mapping_.dataContainerTypeForIdentifier("app"), 2U);
  EXPECT_TRUE(mapping_.getCodeSigningInfoForIdentifier("app")->contains("Entitlements"));
}

TEST_F(TSYCodeSigningMappingTest, withoutItsBundleAnInstalledApplicationIsInvalid) {
  ASSERT_TRUE(make(personal_, "installed", kTSYContainerClassAppBundle));
  ASSERT_TRUE(make(personal_, "installed plugin", kTSYContainerClassPluginBundle));
  const Dictionary plugIn{{kTSYOptionDataContainerClass, 4}};
  Dictionary owned = plugIn;
  owned.merge(childOf("gone"));
  put(naming({}), "installed");
  put(naming({}), "installed plugin", plugIn);
  put(naming({}), "gone", {{kTSYOptionDataContainerClass, 2}});
  put(naming({}), "gone.plugin", owned);
  put(naming({}), "stray plugin", plugIn);
  registerCaller({}, "caller");
  EXPECT_EQ(mapping_.invalidateCodeSigningInfoForAppsWithoutBundleContainer(), 1U);
  std::set<std::string> valid;
  const auto identifiers = mapping_.identifiers();
  for (const std::string& identifier : identifiers.value()) {
    if (!(*mapping_.codeSigningEntryForIdentifier(identifier))->invalid) valid.insert(identifier);
  }
  EXPECT_THAT(valid, UnorderedElementsAre("installed", "installed plugin", "caller"));
}

TEST_F(TSYCodeSigningMappingTest, theSweepRemovesWhatNobodyNames) {
  put(naming({"named"}), "app", {{kTSYOptionAdvanceCopy, true}});
  put(infoWith({{kTSYEntitlementSystemGroups, "systemgroup.named"}}), "service");
  for (const auto& owner : {personal_, enterprise_}) {
    for (const char* group : {"named", "orphan"}) ASSERT_TRUE(make(owner, group, kGroup));
  }
  for (const char* group : {"systemgroup.named", "systemgroup.orphan"}) {
    ASSERT_TRUE(make(personal_, group, kSystemGroup));
  }
  mapping_.performAllCodeSigningMigrationAndReconciliation();
  for (const auto& owner : {personal_, enterprise_}) {
    EXPECT_THAT(containers(owner, kGroup), ElementsAre("named"));
  }
  EXPECT_EQ(containers(personal_, kSystemGroup).size(), 2U);
  TSYGroupManager::defaultManager().reconcileGroupContainersOfType(TSYGroupType::system, queue_);
  drain();
  EXPECT_THAT(containers(personal_, kSystemGroup), ElementsAre("systemgroup.named"));

  EXPECT_TRUE(mapping_.removeAllAdvanceCopies().has_value());
  mapping_.performAllCodeSigningMigrationAndReconciliation();
  EXPECT_THAT(containers(enterprise_, kGroup), IsEmpty());
}

TEST_F(TSYCodeSigningMappingTest, entitlementsAskForAProtectionClass) {
  const auto classFor = [&](const Dictionary& entitlements) {
    put(infoWith(entitlements), "app");
    return TSYDataProtectionManager::defaultManager()
        .intendedDataProtectionClassBasedOnEntitlementsForIdentifier("app");
  };
  EXPECT_EQ(classFor({{"DataProtectionClass", "complete"}}), 1);
  EXPECT_EQ(classFor({{"data-protection-class", "write-only"}, {"DataProtectionClass", "none"}}),
            2);
  EXPECT_EQ(classFor({{"com.veltra.developer.default-data-protection", 4},
                      {"data-protection-class", "complete-until-user-authentication"}}),
            3);
  EXPECT_EQ(classFor({{"DataProtectionClass", "none"}}), 4);
  EXPECT_EQ(classFor({{"DataProtectionClass", "Complete"}}), 0);
  EXPECT_EQ(device_.countInLog("Unknown value for DataProtectionClass entitlement: Complete; "
                               "defaulting to class 0"),
            1U);
}

// What a random life of registrations should have led to, worked out without the mapping.
struct Model {
  struct Entry {
    Groups groups;
    std::set<std::string> children;
    bool advanceCopy = false;
  };
  std::map<std::string, Entry> entries;

  TSYCodeSigningMapping::ReferenceCounts counts() const {
    TSYCodeSigningMapping::ReferenceCounts counts;
    for (const auto& [identifier, entry] : entries) {
      for (const std::string& group : std::set(entry.groups.begin(), entry.groups.end())) {
        ++counts[group];
      }
    }
    return counts;
  }
  void remove(const std::string& identifier) {
    if (!entries.contains(identifier)) return;
    for (const std::string& child : std::set(entries[identifier].children)) entries.erase(child);
    entries.erase(identifier);
  }
  void put(const std::string& identifier, Groups groups, const std::string& parent,
           bool advanceCopy) {
    if (entries.contains(parent)) {
      for (auto& [other, entry] : entries) entry.children.erase(identifier);
      entries[parent].children.insert(identifier);
    }
    Entry& entry = entries[identifier];
    entry.groups = std::move(groups);
    entry.advanceCopy = advanceCopy;
  }
};

// Counted afresh from the file, as any other tool reads it: from a copy, since the daemon keeps the
// file for itself.
TSYCodeSigningMapping::ReferenceCounts countsInFile(const ContainerDevice& device) {
  const std::string library = device.path("/private/var/root/Library/Tessary");
  const std::string copy = device.path("/copy");
  std::filesystem::remove_all(copy);
  std::filesystem::copy(library, copy);
  sqlite3* db = nullptr;
  EXPECT_EQ(sqlite3_open((copy + "/containers.sqlite3").c_str(), &db), SQLITE_OK);
  sqlite3_stmt* rows = nullptr;
  EXPECT_EQ(sqlite3_prepare_v2(db, "SELECT data FROM code_signing_data", -1, &rows, nullptr),
            SQLITE_OK);
  TSYCodeSigningMapping::ReferenceCounts counts;
  while (sqlite3_step(rows) == SQLITE_ROW) {
    const auto* bytes = static_cast<const uint8_t*>(sqlite3_column_blob(rows, 0));
    const auto size = static_cast<size_t>(sqlite3_column_bytes(rows, 0));
    const auto info = platform::readPropertyList({bytes, size}).value();
    const Value* groups =
        info.find(kTSYCodeSigningEntitlements)->find(kTSYEntitlementApplicationGroups);
    std::set<std::string> distinct;
    for (const Value& group : *groups->asArray()) distinct.insert(*group.asString());
    for (const std::string& group : distinct) ++counts[group];
  }
  sqlite3_finalize(rows);
  sqlite3_close(db);
  return counts;
}

TEST(TSYCodeSigningMappingProperty, groupContainersAreThoseThatSomeEntryNames) {
  const ContainerDevice device(std::nullopt, {}, TSYLogLevelError);
  TSYCodeSigningMapping& mapping = TSYCodeSigningMapping::sharedInstance();
  const TSYUserIdentityRef user = TSYUserIdentityCache::defaultUserIdentity();
  TSYClientConnection& connection = TSYClientConnection::sharedClientConnection();
  TSYCommandQueue queue;
  Model model;
  std::mt19937 random(20'260'704);
  const auto pick = [&](size_t count) { return random() % count; };
  const auto name = [&] { return fmt::format("app{}", pick(12)); };
  constexpr int kSteps = 3000;
  for (int step = 0; step < kSteps; ++step) {
    const std::string identifier = name();
    switch (pick(8)) {
      case 0:
        mapping.removeCodeSigningDictionariesForIdentifierAndItsChildren(identifier, queue);
        model.remove(identifier);
        break;
      case 1:
        ASSERT_TRUE(mapping.invalidateCodeSigningInfoForIdentifierAndItsChildren(identifier));
        break;
      case 2:
        ASSERT_TRUE(mapping.removeAllAdvanceCopies());
        mapping.performAllCodeSigningMigrationAndReconciliation();
        std::erase_if(model.entries, [](const auto& each) { return each.second.advanceCopy; });
        break;
      default: {
        Groups groups(pick(4));
        for (std::string& group : groups) group = fmt::format("group{}", pick(6));
        const std::string parent = pick(2) == 0 ? name() : "";
        const bool advanceCopy = pick(6) == 0;
        Dictionary options{{kTSYOptionAdvanceCopy, advanceCopy}};
        if (!parent.empty()) options.merge(childOf(parent));
        ASSERT_EQ(mapping.processCodeSigningInfo(naming(groups), identifier, options, queue), 1U);
        model.put(identifier, groups, parent, advanceCopy);
        ASSERT_TRUE(connection.groupContainersForOwnerIdentifier(identifier, user, kGroup));
      }
    }
    ASSERT_TRUE(queue.executeAllUntilExhausted());
    const auto counts = model.counts();
    ASSERT_EQ(mapping.copyReferenceCountSetOfType(TSYGroupType::application).value(), counts)
        << "step " << step;
    if (step % 100 == 99) {
      ASSERT_EQ(countsInFile(device), counts) << "step " << step;
    }
    std::set<std::string> named;
    for (const auto& [group, count] : counts) named.insert(group);
    std::set<std::string> onDisk;
    const auto listed = TSYContainerCache::sharedInstance().allContainersForUserIdentity(
        user, kGroup, /*transient=*/false);
    for (const TSYMetadataRef& container : listed.value()) {
      onDisk.insert(container->identifier());
    }
    ASSERT_EQ(onDisk, named) << "step " << step;
    ASSERT_EQ(device.namesIn("/private/var/mobile/Containers/Shared/AppGroup").size(),
              named.size());
  }
}

}  // namespace
