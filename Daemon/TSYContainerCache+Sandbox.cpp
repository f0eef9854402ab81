// What the kernel sandbox is told of the containers.
#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYContainerCache.h"
#include "Daemon/TSYException.h"
#include "Daemon/TSYLog.h"
#include "Platform/os/Accounts.h"
#include "Platform/os/Platform.h"

using platform::LogLevel;
using platform::MutexLock;
using platform::Platform;

namespace {

// The number that the sandbox has for a class of containers; none for bundles, which it is never
// told of, and for what is no class.
std::optional<uint32_t> sandboxItemType(TSYContainerClass containerClass) {
  switch (containerClass) {
    case 2:
    case 4:
    case 6:
    case 9:
    case 10:
    case 11:
      return 1;
    case kTSYContainerClassAppGroup:
      return 2;
    case kTSYContainerClassSystemData:
      return 4;
    case kTSYContainerClassSystemGroup:
      return 8;
    default:
      return std::nullopt;
  }
}

bool isDataClass(TSYContainerClass containerClass) {
  return sandboxItemType(containerClass) == 1;
}

}  // namespace

bool TSYContainerCache::shouldRegisterSandboxMappingWithUserIdentity(
    const TSYUserIdentityRef& userIdentity, const std::string& identifier,
    TSYContainerClass containerClass) {
  std::string bundleIdentifier = identifier;
  bool shouldRegister = true;
  bool isMulti = false;
  const bool isEnterprise = userIdentity && userIdentity->isEnterprise();
  if (isDataClass(containerClass)) {
    if (containerClass == kTSYContainerClassPluginData ||
        containerClass == kTSYContainerClassVPNPluginData) {
      if (auto parent = codeSigningMapping_.parentIdentifierForChildIdentifier(identifier)) {
        bundleIdentifier = std::move(*parent);
      }
    }
    const auto identities = userIdentityCache_.userIdentitiesForBundleIdentifier(bundleIdentifier);
    if (identities.size() >= 2) {
      const TSYUserIdentityRef personal = userIdentityCache_.userIdentityForPersonalPersona();
      isMulti = personal && identities.contains(personal);
    }
    shouldRegister = isMulti ? !isEnterprise : userIdentity && identities.contains(userIdentity);
  } else if (containerClass != kTSYContainerClassAppGroup) {
    shouldRegister = !isEnterprise;
  }
  if (TSYSystemLogIsEnabled(LogLevel::info)) {
    TSYSystemLogWrite(TSYChannel::sandbox, LogLevel::info,
                      "Deciding to register userIdentity: {}, identifier: {} ({}), containerClass: "
                      "{} with sandbox: {:d} because isMulti: {:d}",
                      userIdentity ? userIdentity->shortDescription() : "(null)", identifier,
                      bundleIdentifier, containerClass, shouldRegister, isMulti);
  }
  return shouldRegister;
}

bool TSYContainerCache::setSandboxContainerMappingForUserIdentity(
    const TSYUserIdentityRef& userIdentity, const std::string& identifier,
    TSYContainerClass containerClass, const std::optional<TSYURL>& url) {
  if (TSYIsBundleClass(containerClass)) return true;
  if (TSYIsPerUserClass(containerClass) && !userIdentity) return false;
  const std::optional<uint32_t> itemType = sandboxItemType(containerClass);
  if (!itemType) {
    TSYLogWrite(TSYLogLevelError, "Unsupported class for setting sandbox container mapping: {}",
                containerClass);
    return false;
  }
  const bool perUser = TSYIsPerUserClass(containerClass);
  const platform::SandboxMappingKey key{
      .uid = perUser ? userIdentity->posixUIDForContainerClass(containerClass)
                     : platform::kSystemAccount,
      .personaID = userIdentity ? userIdentity->kernelPersonaID() : 0,
      .itemType = *itemType,
      .identifier = identifier};
  const std::string path = url ? url->path() : "(null)";
  platform::Sandbox& sandbox = Platform::current().sandbox;
  if (const int status = sandbox.setContainerPath(key, std::nullopt); status != 0) {
    TSYLogWrite(TSYLogLevelError,
                "Failed to remove mapping for user: {}, itemType: {}, identifier: {}, class: {}, "
                "path: {} : {}",
                key.uid, key.itemType, identifier, containerClass, path, status);
    return false;
  }
  if (url) {
    if (const int status = sandbox.setContainerPath(key, url->path()); status != 0) {
      TSYLogWrite(TSYLogLevelError,
                  "Failed to set mapping for user: {}, itemType: {}, identifier {}, class: {}, "
                  "path: {} : {}",
                  key.uid, key.itemType, identifier, containerClass, path, status);
      return false;
    }
  }
  TSYSystemLogWrite(TSYChannel::sandbox, LogLevel::debug,
                    "Pushed user: {}, itemType: {}, identifier {}, class: {}, persona id: {}, "
                    "path: {}",
                    key.uid, key.itemType, identifier, containerClass, key.personaID, path);
  return true;
}

void TSYContainerCache::_lock_pushMappings(const ClassCache& cache) {
  const platform::Sandbox::Batch batch(Platform::current().sandbox);
  for (const TSYMetadataRef& container : cache.containers) {
    const TSYUserIdentityRef& owner = container->userIdentity();
    const std::string& identifier = container->identifier();
    const TSYContainerClass containerClass = container->containerClass();
    if (shouldRegisterSandboxMappingWithUserIdentity(owner, identifier, containerClass) &&
        !setSandboxContainerMappingForUserIdentity(owner, identifier, containerClass,
                                                   container->url())) {
      TSYLogWrite(TSYLogLevelError,
                  "Failed to set container mapping during create/lookup operation of {}, {}",
                  identifier, containerClass);
    }
  }
}

void TSYContainerCache::invalidateUserIdentity(const TSYUserIdentityRef& userIdentity) {
  // What fails has been logged.
  (void)TSYCatchingExceptions([&]() -> TSYResult<void> {
    forget(userIdentity);
    return {};
  });
}

void TSYContainerCache::forget(const TSYUserIdentityRef& userIdentity) {
  const MutexLock lock(cacheLock_);
  const platform::Sandbox::Batch batch(Platform::current().sandbox);
  for (TSYContainerClass containerClass = 1; containerClass < kTSYContainerClassMax;
       ++containerClass) {
    const Key key = _cacheKeyForUserIdentity(userIdentity, containerClass);
    auto& liveCaches = liveContainerCache_.at(containerClass);
    if (const auto live = liveCaches.find(key.user); live != liveCaches.end()) {
      for (const TSYMetadataRef& container : live->second.containers) {
        if (!setSandboxContainerMappingForUserIdentity(
                container->userIdentity(), container->identifier(), containerClass, std::nullopt)) {
          TSYLogWrite(TSYLogLevelError, "Failed to remove container mapping of [{}], class: {}",
                      container->identifier(), containerClass);
        }
      }
      liveCaches.erase(live);
    }
    auto& transientCaches = transientContainerCache_.at(containerClass);
    if (const auto found = transientCaches.find(key.user); found != transientCaches.end()) {
      transientCaches.erase(found);
    }
  }
  const uint32_t status =
      Platform::current().notifications.post(platform::notification::kUserInvalidated);
  if (status != platform::Notifications::kStatusOK) {
    TSYLogWrite(TSYLogLevelError, "Could not post user-invalidated notification: {}", status);
  }
}

void TSYContainerCache::userIdentityCacheDidInvalidateUserIdentity(
    TSYUserIdentityCache& /*cache*/, const TSYUserIdentityRef& identity) {
  invalidateUserIdentity(identity);
}
