// A user identity as a property list, as it is kept inside the metadata of containers.
//
// Two versions are read, the second is written. What was stored is only a name: the identity itself
// always comes from the cache, so that a container belongs to the persona as it is today. The bytes
// lie in a user's reach: numbers that are no ids are refused, never cut to 32 bits.
#include <limits>

#include "Daemon/TSYLog.h"
#include "Daemon/TSYUserIdentity.h"
#include "Daemon/TSYUserIdentityCache.h"

namespace {

using platform::Value;

constexpr std::string_view kVersionKey = "version";
constexpr std::string_view kUIDKey = "posixUID";
constexpr std::string_view kGIDKey = "posixGID";
constexpr std::string_view kTypeKey = "type";
constexpr std::string_view kUniqueStringKey = "personaUniqueString";
// The unique string in version 1.
constexpr std::string_view kPersonaIdentifierKey = "personaIdentifier";

// The all-ones id means "leave it" to chown(2) and is nobody's.
constexpr uint64_t kLargestID = std::numeric_limits<uint32_t>::max() - 1;

struct Owner {
  uid_t uid;
  gid_t gid;
};

TSYResult<uint64_t> numberUnderKey(const Value& plist, std::string_view key, uint64_t largest) {
  const Value* value = plist.find(key);
  const std::optional<uint64_t> number =
      value != nullptr ? value->unsignedOfNumber() : std::nullopt;
  if (number && *number <= largest) return *number;
  const std::string_view found = value == nullptr ? "(null)"
                                 : number         ? "number out of range"
                                                  : value->typeName();
  return TSYFailure(
      TSYErrorCreate(TSYErrorInvalidUserIdentityData, std::nullopt, TSYLogIt::yes,
                     "Invalid user identity plist data. Expected number for {}, got {}. Data: {}",
                     key, found, plist.description()));
}

TSYResult<Owner> ownerIn(const Value& plist) {
  const TSYResult<uint64_t> uid = numberUnderKey(plist, kUIDKey, kLargestID);
  if (!uid) return TSYFailure(uid.error());
  const TSYResult<uint64_t> gid = numberUnderKey(plist, kGIDKey, kLargestID);
  if (!gid) return TSYFailure(gid.error());
  return Owner{static_cast<uid_t>(*uid), static_cast<gid_t>(*gid)};
}

TSYResult<TSYPersonaType> personaTypeIn(const Value& plist) {
  const TSYResult<uint64_t> type =
      numberUnderKey(plist, kTypeKey, std::numeric_limits<uint64_t>::max());
  if (!type) return TSYFailure(type.error());
  if (*type > static_cast<uint64_t>(TSYPersonaType::unspecific)) {
    return TSYFailure(TSYErrorCreate(
        TSYErrorInvalidUserIdentityData, std::nullopt, TSYLogIt::yes,
        "Invalid user identity plist data. Expected persona type for {}, got {}. Data: {}",
        kTypeKey, *type, plist.description()));
  }
  return static_cast<TSYPersonaType>(*type);
}

const std::string* stringUnderKey(const Value& plist, std::string_view key) {
  const Value* value = plist.find(key);
  return value != nullptr ? value->asString() : nullptr;
}

TSYResult<TSYUserIdentityRef> identityOrFailure(TSYUserIdentityRef identity) {
  if (identity == nullptr) return TSYFailure(TSYError::withoutDetail());
  return identity;
}

TSYResult<TSYUserIdentityRef> fromVersion1(const Value& plist, TSYUserIdentityCache& cache) {
  const TSYResult<Owner> owner = ownerIn(plist);
  if (!owner) return TSYFailure(owner.error());
  TSYUserIdentityRef identity;
  if (const std::string* uniqueString = stringUnderKey(plist, kPersonaIdentifierKey)) {
    identity = cache.userIdentityForPersonaUniqueString(*uniqueString, owner->uid, owner->gid);
  }
  if (identity == nullptr) {
    identity = cache.userIdentityForPersonalPersonaWithUID(owner->uid, owner->gid);
  }
  return identityOrFailure(std::move(identity));
}

TSYResult<TSYUserIdentityRef> fromVersion2(const Value& plist, TSYUserIdentityCache& cache) {
  const TSYResult<Owner> owner = ownerIn(plist);
  if (!owner) return TSYFailure(owner.error());
  const TSYResult<TSYPersonaType> type = personaTypeIn(plist);
  if (!type) return TSYFailure(type.error());
  const std::string* uniqueString = stringUnderKey(plist, kUniqueStringKey);
  if (*type != TSYPersonaType::enterprise || uniqueString == nullptr) {
    return identityOrFailure(cache.userIdentityForPersonalPersonaWithUID(owner->uid, owner->gid));
  }
  TSYUserIdentityRef identity =
      cache.userIdentityForPersonaUniqueString(*uniqueString, owner->uid, owner->gid);
  if (identity != nullptr && !identity->isEnterprise()) {
    TSYLogWrite(TSYLogLevelError,
                "Invalid user identity plist data. Expected {} to be enterprise, but it was not. "
                "Data: {}",
                *uniqueString, plist.description());
  }
  return identityOrFailure(std::move(identity));
}

}  // namespace

TSYResult<TSYUserIdentityRef> TSYUserIdentity::userIdentityWithPlist(const platform::Value& plist,
                                                                     TSYUserIdentityCache& cache) {
  // Only the text is a version: the number 2 is not.
  const std::string* version = stringUnderKey(plist, kVersionKey);
  if (version != nullptr && *version == "2") return fromVersion2(plist, cache);
  if (version != nullptr && *version == "1") return fromVersion1(plist, cache);
  return TSYFailure(TSYError::withoutDetail());
}

platform::Value::Dictionary TSYUserIdentity::plist() const {
  Value::Dictionary plist;
  plist.emplace(kVersionKey, "2");
  plist.emplace(kUIDKey, uid_);
  plist.emplace(kGIDKey, gid_);
  plist.emplace(kTypeKey, static_cast<uint32_t>(personaType_));
  if (personaUniqueString_) plist.emplace(kUniqueStringKey, *personaUniqueString_);
  return plist;
}
