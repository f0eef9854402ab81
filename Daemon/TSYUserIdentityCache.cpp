// Which identity a request means. How the mirror is kept: TSYUserIdentityCache+Resync.cpp.
//
// Every answer is looked up under the lock and re-targeted to the wanted user after it has been
// released, because that reads the password database. When the user matches already, as for nearly
// every request, nothing is allocated.
#include "Daemon/TSYUserIdentityCache.h"

#include <algorithm>

#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYLog.h"
#include "Platform/os/Platform.h"

namespace {

thread_local const TSYUserIdentityCache::CallerContext* currentContext = nullptr;

struct Owner {
  uid_t uid;
  gid_t gid;
};

// Role accounts act for the user of the device.
Owner ownerFor(uid_t uid, gid_t gid) {
  if (uid >= TSYUserIdentity::kFirstUserAccount) return {uid, gid};
  const TSYGlobalConfiguration& configuration = TSYGlobalConfiguration::sharedInstance();
  return {configuration.currentMobileUserId(), configuration.currentMobileGroupId()};
}

TSYUserIdentityRef makeDefaultUserIdentity() {
  const TSYGlobalConfiguration& configuration = TSYGlobalConfiguration::sharedInstance();
  const uid_t uid = configuration.currentMobileUserId();
  if (uid == 0) return nullptr;  // no such account, as the configuration has logged
  return TSYUserIdentity::initWithUID(
      uid, configuration.currentMobileGroupId(), TSYFileManager::homeDirectoryURLForPOSIXUID(uid),
      /*personaUniqueString=*/std::nullopt, TSYPersonaType::personal, static_cast<int32_t>(uid));
}

bool computePersonasAreSupported() {
  const platform::Platform& platform = platform::Platform::current();
  if (platform.device.isMultiUser() || platform.device.personasRuledOut()) return false;
  if (platform.device.usesEphemeralStorage() || !platform.personas.present()) return false;
  // Personas are those of the default user; without one the list could never be used.
  return TSYUserIdentityCache::defaultUserIdentity() != nullptr;
}

}  // namespace

TSYUserIdentitySharedCache& TSYUserIdentitySharedCache::sharedInstance() {
  // Never destroyed: threads may still ask while the process ends.
  static auto& instance = *new TSYUserIdentitySharedCache;
  return instance;
}

TSYUserIdentityRef TSYUserIdentityCache::defaultUserIdentity() {
  static const TSYUserIdentityRef& identity = *new TSYUserIdentityRef(makeDefaultUserIdentity());
  return identity;
}

bool TSYUserIdentityCache::personasAreSupported() {
  static const bool supported = computePersonasAreSupported();
  return supported;
}

TSYUserIdentityCache::CallerContext::CallerContext(std::optional<std::string> personaUniqueString)
    : personaUniqueString_(std::move(personaUniqueString)), outer_(currentContext) {
  currentContext = this;
}

TSYUserIdentityCache::CallerContext::~CallerContext() {
  currentContext = outer_;
}

TSYUserIdentityRef TSYUserIdentityCache::_updateUserIdentity(const TSYUserIdentityRef& identity,
                                                             uid_t uid, gid_t gid) {
  if (identity != nullptr && identity->posixUID() == uid && identity->posixGID() == gid) {
    return identity;
  }
  if (uid < TSYUserIdentity::kFirstUserAccount) return nullptr;  // no "mobile" to stand in
  if (identity == nullptr) {
    return TSYUserIdentity::initWithUID(uid, gid, TSYFileManager::homeDirectoryURLForPOSIXUID(uid),
                                        /*personaUniqueString=*/std::nullopt,
                                        TSYPersonaType::personal, static_cast<int32_t>(uid));
  }
  return TSYUserIdentity::initWithUID(
      uid, gid,
      identity->isEnterprise() ? identity->homeDirectoryURL()
                               : TSYFileManager::homeDirectoryURLForPOSIXUID(uid),
      identity->personaUniqueString(), identity->personaType(), identity->kernelPersonaID());
}

TSYUserIdentityRef TSYUserIdentityCache::identityKnownForUniqueString(
    std::string_view uniqueString) {
  const platform::MutexLock lock(lock_);
  return _lock_mirror().identityForUniqueString(uniqueString);
}

TSYUserIdentityRef TSYUserIdentityCache::userIdentityForCurrentContext() {
  const TSYGlobalConfiguration& configuration = TSYGlobalConfiguration::sharedInstance();
  return userIdentityForCurrentContextWithUID(configuration.currentMobileUserId(),
                                              configuration.currentMobileGroupId());
}

TSYUserIdentityRef TSYUserIdentityCache::userIdentityForCurrentContextWithUID(uid_t uid,
                                                                              gid_t gid) {
  constexpr auto kInfo = platform::LogLevel::info;
  if (!personasAreSupported()) {
    TSYUserIdentityRef identity = userIdentityForPersonalPersonaWithUID(uid, gid);
    TSYSystemLogWrite(TSYChannel::unspecified, kInfo, "({}/{}) Personas not supported, using: {}",
                      uid, gid, identity);
    return identity;
  }
  std::optional<std::string_view> uniqueString;
  if (currentContext != nullptr) uniqueString = currentContext->personaUniqueString();
  const TSYUserIdentityRef known =
      uniqueString ? identityKnownForUniqueString(*uniqueString) : nullptr;
  if (known != nullptr && known->personaType() == TSYPersonaType::personal) {
    TSYUserIdentityRef identity = userIdentityForPersonalPersonaWithUID(uid, gid);
    TSYSystemLogWrite(TSYChannel::unspecified, kInfo,
                      "({}/{}) Explicit personal persona, using: {}", uid, gid, identity);
    return identity;
  }
  // A string that nobody has is a persona that has gone, and stands for no identity at all.
  if (uniqueString && (known == nullptr || known->isEnterprise())) {
    TSYUserIdentityRef identity = userIdentityForPersonaUniqueString(uniqueString, uid, gid);
    TSYSystemLogWrite(TSYChannel::unspecified, kInfo,
                      "({}/{}) Looked up user identity for [{}]: {}", uid, gid, *uniqueString,
                      identity);
    return identity;
  }
  TSYUserIdentityRef identity = userIdentityForPersonaUniqueString(std::nullopt, uid, gid);
  TSYSystemLogWrite(TSYChannel::unspecified, kInfo,
                    "({}/{}) No persona (<{}>) or no unique string [{}], using: {}", uid, gid,
                    fmt::ptr(currentContext), uniqueString.value_or("(null)"), identity);
  return identity;
}

TSYUserIdentityRef TSYUserIdentityCache::userIdentityForPersonaUniqueString(
    std::optional<std::string_view> uniqueString, uid_t uid, gid_t gid) {
  if (!personasAreSupported()) return userIdentityForPersonalPersonaWithUID(uid, gid);
  const Owner owner = ownerFor(uid, gid);
  const TSYUserIdentityRef known =
      uniqueString ? identityKnownForUniqueString(*uniqueString) : unspecificUserIdentity();
  if (known == nullptr) return nullptr;
  return _updateUserIdentity(known, owner.uid, owner.gid);
}

TSYUserIdentityRef TSYUserIdentityCache::userIdentityForCurrentUserWithPersonaUniqueString(
    std::optional<std::string_view> uniqueString) {
  if (!personasAreSupported()) {
    const TSYGlobalConfiguration& configuration = TSYGlobalConfiguration::sharedInstance();
    return userIdentityForPersonalPersonaWithUID(configuration.currentMobileUserId(),
                                                 configuration.currentMobileGroupId());
  }
  if (!uniqueString) return unspecificUserIdentity();
  TSYUserIdentityRef identity = identityKnownForUniqueString(*uniqueString);
  TSYLogWrite(TSYLogLevelDebug, "Found {} for {}", identity, *uniqueString);
  return identity;
}

TSYUserIdentityRef TSYUserIdentityCache::userIdentityForPersonalPersona() {
  const platform::MutexLock lock(lock_);
  return _lock_mirror().personal;
}

TSYUserIdentityRef TSYUserIdentityCache::userIdentityForPersonalPersonaWithUID(uid_t uid,
                                                                               gid_t gid) {
  const Owner owner = ownerFor(uid, gid);
  return _updateUserIdentity(userIdentityForPersonalPersona(), owner.uid, owner.gid);
}

TSYUserIdentityRef TSYUserIdentityCache::unspecificUserIdentity() {
  const platform::MutexLock lock(lock_);
  return _lock_mirror().unspecific;
}

TSYUserIdentityRef TSYUserIdentityCache::userIdentityWithPersonaID(uint32_t kernelPersonaID) {
  const platform::MutexLock lock(lock_);
  const auto& identities = _lock_mirror().personaIDToIdentity;
  const auto found = identities.find(kernelPersonaID);
  return found == identities.end() ? nullptr : found->second;
}

TSYUserIdentityCache::IdentitySet TSYUserIdentityCache::userIdentitiesForBundleIdentifier(
    const std::string& bundleIdentifier) {
  const platform::MutexLock lock(lock_);
  return _lock_mirror().identitiesForBundleIdentifier(bundleIdentifier);
}

bool TSYUserIdentityCache::isBundleIdentifierAssociatedWithUserIdentity(
    const std::string& bundleIdentifier, const TSYUserIdentity& identity) {
  if (!personasAreSupported()) return true;
  return std::ranges::any_of(userIdentitiesForBundleIdentifier(bundleIdentifier),
                             [&](const TSYUserIdentityRef& candidate) {
                               return candidate->isEqualToUserIdentity(identity);
                             });
}

std::optional<uint64_t> TSYUserIdentityCache::generationOfListKnowing(
    const TSYUserIdentity& identity) {
  const platform::MutexLock lock(lock_);
  const TSYPersonaMirror& mirror = _lock_mirror();
  if (identity.isEnterprise()) {
    const TSYUserIdentityRef known = mirror.identityForUniqueString(identity.identifier());
    if (known == nullptr || !known->isEqualToUserIdentity(identity)) return std::nullopt;
  }
  return generation_;
}

void TSYUserIdentityCache::forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
    const std::function<void(const TSYUserIdentityRef&)>& block) {
  IdentitySet identities;
  if (personasAreSupported()) {
    {
      const platform::MutexLock lock(lock_);
      identities = _lock_mirror().accessibleIdentities();
    }
    if (identities.empty()) {
      const auto personas = platform::Platform::current().personas.list();
      TSYLogWrite(TSYLogLevelError,
                  "Expected to find at least one persona; self = <TSYUserIdentityCache: {}>, "
                  "personaAttributeList = ({})",
                  fmt::ptr(this), fmt::join(personas, ", "));
    }
  }
  if (identities.empty()) {
    if (const TSYUserIdentityRef identity = defaultUserIdentity()) identities.insert(identity);
  }
  for (const TSYUserIdentityRef& identity : identities) block(identity);
}
