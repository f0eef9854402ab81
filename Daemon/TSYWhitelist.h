// The built-in tables of well-known containers: which system containers live under their own name
// instead of a UUID, and who may look up containers that are not his own.
//
// Immutable after construction: any thread may ask.
#pragma once

#include <array>
#include <cstdint>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "Daemon/TSYContainerClass.h"

class TSYWhitelist {
 public:
  using NameMap = std::map<std::string, std::string>;
  // No list stands for "any identifier", as no map stands for "any class".
  using Identifiers = std::optional<std::vector<std::string>>;
  using ClassRights = std::optional<std::map<TSYContainerClass, Identifiers>>;

  // The four tables of the running system. Built once.
  static const TSYWhitelist& sharedWhitelist();

  TSYWhitelist(NameMap systemContainers, NameMap systemGroupContainers,
               const std::map<TSYContainerClass, std::vector<std::string>>& lookupByContainer,
               const std::map<std::string, ClassRights>& lookupByCodeSignIdentifier);

  // The directory name of a well-known container; none for any other.
  std::optional<std::string> wellknownSystemContainerForId(const std::string& identifier) const;
  std::optional<std::string> wellknownSystemGroupContainerForId(
      const std::string& identifier) const;
  std::optional<std::string> wellknownContainerForId(const std::string& identifier,
                                                     TSYContainerClass containerClass) const;
  bool systemContainerIdIsWellknown(const std::string& identifier) const;
  bool systemGroupContainerIdIsWellknown(const std::string& identifier) const;
  // False for every class but 12 and 13.
  bool containerIdIsWellknown(const std::string& identifier,
                              TSYContainerClass containerClass) const;
  std::vector<std::string> wellknownSystemContainers() const;
  std::vector<std::string> wellknownSystemGroupContainers() const;

  // Whether a process signed as `codeSignIdentifier` may look up this container.
  bool isLookupWhitelistedFromCodeSignIdentifier(const std::string& codeSignIdentifier,
                                                 TSYContainerClass forContainerClass,
                                                 const std::string& containerIdentifier) const;

 private:
  using IdentifierSet = std::optional<std::set<std::string>>;

  const NameMap systemWhitelist_;
  const NameMap systemGroupWhitelist_;
  std::array<std::set<std::string>, kTSYContainerClassMax> lookupByContainer_;
  std::map<std::string, std::optional<std::map<TSYContainerClass, IdentifierSet>>>
      lookupByCodeSignIdentifier_;
};
