#include "Daemon/TSYPersonaMirror.h"

#include <algorithm>
#include <source_location>

#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYLog.h"
#include "Daemon/TSYUserIdentityCache.h"

namespace {

using platform::PersonaAttributes;
using platform::PersonaKind;

void logErrorAndFault(const std::string& text,
                      std::source_location where = std::source_location::current()) {
  const std::string function = TSYFunctionName(where);
  TSYLogWriteText(TSYLogLevelError, function, text);
  TSYSystemLogWriteText(TSYChannel::unspecified, platform::LogLevel::fault, function, text);
}

bool isShared(const PersonaAttributes& persona) {
  return persona.kind == PersonaKind::universal || persona.kind == PersonaKind::system;
}

// Personas belong to the one human user, whose account is "mobile".
TSYUserIdentityRef identityOfPersona(const PersonaAttributes& attributes, TSYPersonaType type) {
  const TSYGlobalConfiguration& configuration = TSYGlobalConfiguration::sharedInstance();
  const uid_t uid = configuration.currentMobileUserId();
  const bool hasOwnHome = attributes.kind == PersonaKind::enterprise && attributes.layoutPath;
  return TSYUserIdentity::initWithUID(uid, configuration.currentMobileGroupId(),
                                      hasOwnHome ? TSYURL(*attributes.layoutPath)
                                                 : TSYFileManager::homeDirectoryURLForPOSIXUID(uid),
                                      attributes.uniqueString, type,
                                      static_cast<int32_t>(attributes.personaID));
}

// A mirror in the making.
class Builder {
 public:
  bool addPersonal(const std::vector<PersonaAttributes>& personas) {
    const auto personal =
        std::ranges::find(personas, PersonaKind::personal, &PersonaAttributes::kind);
    if (personal != personas.end()) {
      if (!personal->uniqueString) {
        logErrorAndFault(fmt::format("Invalid persona unique string for personal {}", *personal));
        return false;
      }
      mirror_.personal = identityOfPersona(*personal, TSYPersonaType::personal);
      mirror_.unspecific = identityOfPersona(*personal, TSYPersonaType::unspecific);
    }
    if (mirror_.personal == nullptr || mirror_.unspecific == nullptr) {
      logErrorAndFault(
          fmt::format("Expected to find a personal persona in ({})", fmt::join(personas, ", ")));
      return false;
    }
    map(*personal, mirror_.personal);
    return true;
  }

  void addShared(const PersonaAttributes& persona) {
    sharedBundles_.insert(persona.bundleIdentifiers.begin(), persona.bundleIdentifiers.end());
    map(persona, mirror_.unspecific);
  }

  void addEnterprise(const PersonaAttributes& persona) {
    if (!persona.uniqueString) {
      logErrorAndFault(fmt::format("Invalid persona unique string for {}", persona));
      return;
    }
    const TSYUserIdentityRef identity = identityOfPersona(persona, TSYPersonaType::enterprise);
    map(persona, identity);
    giveBundles(identity, persona.bundleIdentifiers);
    giveBundles(identity, sharedBundles_);
  }

  TSYPersonaMirror finish() && {
    giveBundles(mirror_.personal, sharedBundles_);
    return std::move(mirror_);
  }

 private:
  void map(const PersonaAttributes& persona, const TSYUserIdentityRef& identity) {
    if (persona.uniqueString) {
      mirror_.personaUniqueStringToIdentity.insert_or_assign(*persona.uniqueString, identity);
    }
    mirror_.personaIDToIdentity.insert_or_assign(persona.personaID, identity);
  }

  template <typename Bundles>
  void giveBundles(const TSYUserIdentityRef& identity, const Bundles& bundles) {
    for (const std::string& bundle : bundles) mirror_.bundleToIdentities[bundle].insert(identity);
  }

  TSYPersonaMirror mirror_;
  std::set<std::string> sharedBundles_;
};

}  // namespace

TSYPersonaMirror TSYPersonaMirror::withoutPersonas() {
  TSYPersonaMirror mirror;
  mirror.personal = TSYUserIdentityCache::defaultUserIdentity();
  mirror.unspecific = mirror.personal;
  return mirror;
}

std::optional<TSYPersonaMirror> TSYPersonaMirror::ofPersonas(
    const std::vector<PersonaAttributes>& personas) {
  Builder builder;
  if (!builder.addPersonal(personas)) return std::nullopt;
  // The bundles of all shared personas must be known before the first enterprise one gets them.
  for (const PersonaAttributes& persona : personas) {
    if (isShared(persona)) builder.addShared(persona);
  }
  for (const PersonaAttributes& persona : personas) {
    if (persona.kind == PersonaKind::enterprise) builder.addEnterprise(persona);
  }
  return std::move(builder).finish();
}

TSYPersonaMirror TSYPersonaMirror::ofUserIdentities(
    const std::vector<TSYUserIdentityRef>& identities) {
  TSYPersonaMirror mirror = withoutPersonas();
  mirror.unspecific = nullptr;
  for (const TSYUserIdentityRef& identity : identities) {
    if (identity->isNoSpecificPersona()) {
      mirror.unspecific = identity;
    } else if (!identity->isEnterprise()) {
      mirror.personal = identity;
    }
    if (identity->personaUniqueString()) {
      mirror.personaUniqueStringToIdentity.insert_or_assign(*identity->personaUniqueString(),
                                                            identity);
    }
    mirror.personaIDToIdentity.insert_or_assign(static_cast<uint32_t>(identity->kernelPersonaID()),
                                                identity);
  }
  if (mirror.unspecific == nullptr && mirror.personal != nullptr) {
    const TSYUserIdentity& personal = *mirror.personal;
    mirror.unspecific = TSYUserIdentity::initWithUID(
        personal.posixUID(), personal.posixGID(), personal.homeDirectoryURL(),
        personal.personaUniqueString(), TSYPersonaType::unspecific, personal.kernelPersonaID());
  }
  return mirror;
}

TSYUserIdentityRef TSYPersonaMirror::identityForUniqueString(std::string_view uniqueString) const {
  const auto found = personaUniqueStringToIdentity.find(uniqueString);
  return found == personaUniqueStringToIdentity.end() ? nullptr : found->second;
}

TSYPersonaMirror::IdentitySet TSYPersonaMirror::identitiesForBundleIdentifier(
    const std::string& bundleIdentifier) const {
  const auto found = bundleToIdentities.find(bundleIdentifier);
  if (found != bundleToIdentities.end()) return found->second;
  return personal == nullptr ? IdentitySet() : IdentitySet{personal};
}

std::vector<TSYUserIdentityRef> TSYPersonaMirror::enterpriseIdentities() const {
  std::vector<TSYUserIdentityRef> identities;
  for (const auto& [uniqueString, identity] : personaUniqueStringToIdentity) {
    if (identity->isEnterprise()) identities.push_back(identity);
  }
  return identities;
}

TSYPersonaMirror::IdentitySet TSYPersonaMirror::accessibleIdentities() const {
  IdentitySet identities;
  for (const auto& [uniqueString, identity] : personaUniqueStringToIdentity) {
    identities.insert(identity);
  }
  // The unspecific identity is equal to it and may have come first.
  if (personal != nullptr && identities.erase(personal) > 0) identities.insert(personal);
  return identities;
}
