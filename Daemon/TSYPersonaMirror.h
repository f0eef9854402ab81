// What the user identity cache knows of the persona list: which identities there are, by unique
// string, by kernel persona id and by bundle.
//
// A mirror is made whole, from one list, and replaces the one before it. An application that an
// enterprise persona lists may have containers for that persona; one that a universal or a system
// persona lists may have them for the personal and for every enterprise persona; one that nobody
// lists has the personal persona only, and no entry here.
#pragma once

#include <fmt/format.h>

#include <cstdint>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "Daemon/TSYUserIdentity.h"
#include "Platform/os/Personas.h"

struct TSYPersonaMirror {
  using IdentitySet = std::set<TSYUserIdentityRef, TSYUserIdentityOrder>;

  std::map<std::string, IdentitySet, std::less<>> bundleToIdentities;
  std::map<std::string, TSYUserIdentityRef, std::less<>> personaUniqueStringToIdentity;
  std::map<uint32_t, TSYUserIdentityRef> personaIDToIdentity;
  // Both may be none, on a system without the account "mobile".
  TSYUserIdentityRef personal;
  TSYUserIdentityRef unspecific;

  // Knows nobody but the default identity, as both personal and unspecific.
  static TSYPersonaMirror withoutPersonas();
  // None (logged) for a list without a usable personal persona.
  static std::optional<TSYPersonaMirror> ofPersonas(
      const std::vector<platform::PersonaAttributes>& personas);
  static TSYPersonaMirror ofUserIdentities(const std::vector<TSYUserIdentityRef>& identities);

  // None for a string that nobody has.
  TSYUserIdentityRef identityForUniqueString(std::string_view uniqueString) const;
  // The identities that a list gives a bundle, else the personal one alone.
  IdentitySet identitiesForBundleIdentifier(const std::string& bundleIdentifier) const;
  std::vector<TSYUserIdentityRef> enterpriseIdentities() const;
  // One of each that has a unique string.
  IdentitySet accessibleIdentities() const;
};

template <>
struct fmt::formatter<platform::PersonaAttributes> : fmt::formatter<std::string> {
  auto format(const platform::PersonaAttributes& attributes, format_context& context) const {
    return fmt::formatter<std::string>::format(attributes.description(), context);
  }
};
