// The object itself, and what its caller may look up.
#include "Daemon/TSYClientConnection.h"

#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYContainerCache.h"
#include "Daemon/TSYLocks.h"
#include "Daemon/TSYWhitelist.h"

using platform::MutexLock;
using platform::SerialQueue;
using platform::Value;

TSYClientConnection::TSYClientConnection()
    : TSYClientConnection(TSYClientIdentity::anonymousPrivilegedClientIdentity(),
                          /*entitled=*/true, /*allowOtherIdLookup=*/false, /*unrestricted=*/true,
                          std::nullopt, std::nullopt, std::make_shared<TSYCommandQueue>()) {}

TSYClientConnection::TSYClientConnection(TSYClientIdentityRef clientIdentity, bool entitled,
                                         bool allowOtherIdLookup, bool unrestricted, Lookup lookup,
                                         WipeIdentifiers entitledWipeIdentifiers,
                                         std::shared_ptr<TSYCommandQueue> commandQueue)
    : clientIdentity_(std::move(clientIdentity)),
      entitled_(entitled),
      allowOtherIdLookup_(allowOtherIdLookup),
      unrestricted_(unrestricted),
      lookup_(std::move(lookup)),
      entitledWipeIdentifiers_(std::move(entitledWipeIdentifiers)),
      commandQueue_(std::move(commandQueue)),
      userIdentityCache_(TSYUserIdentitySharedCache::sharedInstance()) {}

TSYClientConnection& TSYClientConnection::sharedClientConnection() {
  static TSYClientConnection& connection = *new TSYClientConnection();
  return connection;
}

std::unique_ptr<TSYClientConnection>
TSYClientConnection::privilegedClientConnectionWithUserIdentity(TSYUserIdentityRef userIdentity) {
  return std::make_unique<TSYClientConnection>(
      TSYClientIdentity::privilegedClientIdentityWithUserIdentity(std::move(userIdentity)),
      /*entitled=*/true, /*allowOtherIdLookup=*/true, /*unrestricted=*/true, std::nullopt,
      std::nullopt, std::make_shared<TSYCommandQueue>());
}

SerialQueue& TSYClientConnection::backgroundQueue() {
  static SerialQueue& queue =
      *new SerialQueue("com.veltra.tessaryd.background", platform::QueuePriority::background);
  return queue;
}

const std::string& TSYClientConnection::clientBundleIdentifier() const {
  static const std::string none;
  return clientIdentity_ ? clientIdentity_->bundleIdentifier() : none;
}

TSYUserIdentityRef TSYClientConnection::clientUserIdentity() const {
  return clientIdentity_ ? clientIdentity_->userIdentity() : nullptr;
}

TSYResult<void> TSYClientConnection::complete() {
  return commandQueue_->executeAllUntilExhausted();
}

const TSYClientConnection::IdentifierSet* TSYClientConnection::_lookupForContainerClass(
    TSYContainerClass containerClass) {
  if (!lookup_ || containerClass >= kTSYContainerClassMax) return nullptr;
  const std::string_view key = TSYContainerClassKey(containerClass);
  const MutexLock lock(lookupLock_);
  if (const auto found = sanitizedLookup_.find(key); found != sanitizedLookup_.end()) {
    return &found->second;
  }
  IdentifierSet identifiers;
  const auto list = lookup_->find(key);
  if (list != lookup_->end() && list->second.asArray() != nullptr) {
    for (const Value& element : *list->second.asArray()) {
      if (element.asString() != nullptr) identifiers.insert(*element.asString());
    }
  }
  return &sanitizedLookup_.emplace(key, std::move(identifiers)).first->second;
}

bool TSYClientConnection::isEntitledForLookupWithClass(TSYContainerClass containerClass,
                                                       const std::string& identifier) {
  const IdentifierSet* identifiers = _lookupForContainerClass(containerClass);
  return identifiers != nullptr && identifiers->contains(identifier);
}

bool TSYClientConnection::mayLookUpOf(TSYContainerClass containerClass,
                                      const std::string& identifier) {
  // A process without an identity owns nothing, not even the empty identifier.
  const bool isOwn = clientIdentity_ && identifier == clientBundleIdentifier();
  return isOwn || allowOtherIdLookup_ || unrestricted_ ||
         isEntitledForLookupWithClass(containerClass, identifier) ||
         TSYWhitelist::sharedWhitelist().isLookupWhitelistedFromCodeSignIdentifier(
             clientBundleIdentifier(), containerClass, identifier);
}

bool TSYClientConnection::mayLookUp(const TSYContainerIdentity& identity) {
  const TSYContainerClass containerClass = identity.containerClass();
  const bool isGroup = containerClass == kTSYContainerClassAppGroup ||
                       containerClass == kTSYContainerClassSystemGroup;
  return (isGroup && allowGroupIdLookup_) || mayLookUpOf(containerClass, identity.identifier());
}

bool TSYClientConnection::mayLookUpSystemContainer(const TSYContainerIdentity& identity) {
  if (allowOtherIdLookup_ || unrestricted_) return true;
  const std::string& identifier = identity.identifier();
  return isEntitledForLookupWithClass(kTSYContainerClassSystemData, identifier) ||
         TSYWhitelist::sharedWhitelist().isLookupWhitelistedFromCodeSignIdentifier(
             clientBundleIdentifier(), kTSYContainerClassSystemData, identifier) ||
         (identifier == clientBundleIdentifier() &&
          TSYCodeSigningMapping::sharedInstance().identifierHasSystemContainer(identifier));
}

TSYResult<void> TSYClientConnection::checkAccess(const TSYContainerIdentity& identity) {
  if (!mayLookUp(identity)) {
    return TSYFailure(
        TSYErrorCreate(TSYErrorNotEntitled, std::nullopt, TSYLogIt::yes,
                       "{} not entitled to retrieve container class {} with identifier {}",
                       clientBundleIdentifier(), static_cast<int64_t>(identity.containerClass()),
                       identity.identifier()));
  }
  if (identity.containerClass() == kTSYContainerClassSystemData &&
      !mayLookUpSystemContainer(identity)) {
    return TSYFailure(TSYErrorCreate(TSYErrorNotEntitled, std::nullopt, TSYLogIt::yes,
                                     "{} not entitled for system container with identifier {}",
                                     clientBundleIdentifier(), identity.identifier()));
  }
  return {};
}

TSYResult<std::vector<TSYMetadataRef>> TSYClientConnection::containersWithClass(
    TSYContainerClass containerClass, bool transient) {
  if (!TSYIsContainerClass(containerClass)) {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidObject, std::nullopt, TSYLogIt::yes,
                                     "Can't act on an invalid container class: {}",
                                     static_cast<int64_t>(containerClass)));
  }
  const TSYAllIdentifiersLock lock(TSYLockMode::reading, /*useLocking=*/true);
  return TSYContainerCache::sharedInstance().allContainersForUserIdentity(
      clientUserIdentity(), containerClass, transient);
}
