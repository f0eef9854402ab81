#include "Daemon/TSYWhitelist.h"

#include "Daemon/TSYGlobalConfiguration.h"

namespace {

TSYWhitelist::NameMap mappedToThemselves(const std::vector<std::string>& identifiers) {
  TSYWhitelist::NameMap map;
  for (const std::string& identifier : identifiers) map.emplace(identifier, identifier);
  return map;
}

std::optional<std::string> valueIn(const TSYWhitelist::NameMap& map, const std::string& key) {
  const auto found = map.find(key);
  if (found == map.end()) return std::nullopt;
  return found->second;
}

std::vector<std::string> keysOf(const TSYWhitelist::NameMap& map) {
  std::vector<std::string> keys;
  keys.reserve(map.size());
  for (const auto& [key, value] : map) keys.push_back(key);
  return keys;
}

const std::vector<std::string> kSystemContainers = {"com.veltra.exampled", "com.veltra.ledgerd"};

const std::vector<std::string> kSystemGroupContainers = {
    "systemgroup.com.veltra.examplecache", "systemgroup.com.veltra.examplelogging",
    "systemgroup.com.veltra.analytics",    "systemgroup.com.veltra.palette",
    "systemgroup.com.veltra.glossary",     "systemgroup.com.veltra.catalog",
    "systemgroup.com.veltra.tiles",        "systemgroup.com.veltra.almanac"};

// Where tests of an internal build leave their coverage data.
const std::string kCoverageGroupContainer = "systemgroup.com.veltra.coverage";

const std::map<TSYContainerClass, std::vector<std::string>> kLookupByContainer = {
    {kTSYContainerClassInternalDaemon, {"com.veltra.beacond"}}};

TSYWhitelist::ClassRights only(TSYContainerClass containerClass, std::string identifier) {
  return std::map<TSYContainerClass, TSYWhitelist::Identifiers>{
      {containerClass, std::vector<std::string>{std::move(identifier)}}};
}

const TSYWhitelist::ClassRights kAnyContainer = std::nullopt;

const std::map<std::string, TSYWhitelist::ClassRights> kLookupByCodeSignIdentifier = {
    {"com.veltra.hatcheryd", kAnyContainer},
    {"com.veltra.vaultd", kAnyContainer},
    {"com.veltra.porterd", kAnyContainer},
    {"com.veltra.herald", kAnyContainer},
    {"com.veltra.stewardd", kAnyContainer},
    {"com.veltra.mendd", kAnyContainer},
    {"com.veltra.examplewidget", only(kTSYContainerClassAppData, "com.veltra.exampleapp")},
    {"com.veltra.seekerd", only(kTSYContainerClassAppData, "com.veltra.notebook")},
    {"com.veltra.shelfd", only(kTSYContainerClassAppGroup, "group.com.veltra.shelf")}};

TSYWhitelist builtIn() {
  std::vector<std::string> groups = kSystemGroupContainers;
  if (TSYGlobalConfiguration::sharedInstance().isInternalImage()) {
    groups.push_back(kCoverageGroupContainer);
  }
  return {mappedToThemselves(kSystemContainers), mappedToThemselves(groups), kLookupByContainer,
          kLookupByCodeSignIdentifier};
}

}  // namespace

const TSYWhitelist& TSYWhitelist::sharedWhitelist() {
  // Never destroyed: threads may still ask while the process ends.
  static const TSYWhitelist& whitelist = *new TSYWhitelist(builtIn());
  return whitelist;
}

TSYWhitelist::TSYWhitelist(
    NameMap systemContainers, NameMap systemGroupContainers,
    const std::map<TSYContainerClass, std::vector<std::string>>& lookupByContainer,
    const std::map<std::string, ClassRights>& lookupByCodeSignIdentifier)
    : systemWhitelist_(std::move(systemContainers)),
      systemGroupWhitelist_(std::move(systemGroupContainers)) {
  for (const auto& [containerClass, identifiers] : lookupByContainer) {
    lookupByContainer_.at(containerClass) = {identifiers.begin(), identifiers.end()};
  }
  for (const auto& [codeSignIdentifier, rights] : lookupByCodeSignIdentifier) {
    auto& entry = lookupByCodeSignIdentifier_[codeSignIdentifier];
    if (!rights) continue;
    entry.emplace();
    for (const auto& [containerClass, identifiers] : *rights) {
      IdentifierSet& set = (*entry)[containerClass];
      if (identifiers) set.emplace(identifiers->begin(), identifiers->end());
    }
  }
}

std::optional<std::string> TSYWhitelist::wellknownSystemContainerForId(
    const std::string& identifier) const {
  return valueIn(systemWhitelist_, identifier);
}

std::optional<std::string> TSYWhitelist::wellknownSystemGroupContainerForId(
    const std::string& identifier) const {
  return valueIn(systemGroupWhitelist_, identifier);
}

std::optional<std::string> TSYWhitelist::wellknownContainerForId(
    const std::string& identifier, TSYContainerClass containerClass) const {
  if (containerClass == kTSYContainerClassSystemData) {
    return wellknownSystemContainerForId(identifier);
  }
  if (containerClass == kTSYContainerClassSystemGroup) {
    return wellknownSystemGroupContainerForId(identifier);
  }
  return std::nullopt;
}

bool TSYWhitelist::systemContainerIdIsWellknown(const std::string& identifier) const {
  return systemWhitelist_.contains(identifier);
}

bool TSYWhitelist::systemGroupContainerIdIsWellknown(const std::string& identifier) const {
  return systemGroupWhitelist_.contains(identifier);
}

bool TSYWhitelist::containerIdIsWellknown(const std::string& identifier,
                                          TSYContainerClass containerClass) const {
  return wellknownContainerForId(identifier, containerClass).has_value();
}

std::vector<std::string> TSYWhitelist::wellknownSystemContainers() const {
  return keysOf(systemWhitelist_);
}

std::vector<std::string> TSYWhitelist::wellknownSystemGroupContainers() const {
  return keysOf(systemGroupWhitelist_);
}

bool TSYWhitelist::isLookupWhitelistedFromCodeSignIdentifier(
    const std::string& codeSignIdentifier, TSYContainerClass forContainerClass,
    const std::string& containerIdentifier) const {
  if (forContainerClass >= kTSYContainerClassMax) return false;
  if (lookupByContainer_[forContainerClass].contains(containerIdentifier)) return true;
  const auto entry = lookupByCodeSignIdentifier_.find(codeSignIdentifier);
  if (entry == lookupByCodeSignIdentifier_.end()) return false;
  if (!entry->second) return true;
  const auto identifiers = entry->second->find(forContainerClass);
  if (identifiers == entry->second->end()) return false;
  return !identifiers->second || identifiers->second->contains(containerIdentifier);
}
