// Whose a per-user container is: a POSIX user, a home directory and a persona.
//
// Identities never change and are shared as TSYUserIdentityRef; a change of persona makes new
// objects. The identifier alone decides equality: the unique string of an enterprise persona, the
// uid in decimal for everything else, so that the personal and the unspecific identity of one user
// are the same and every enterprise persona is distinct.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "Daemon/TSYContainerClass.h"
#include "Daemon/TSYError.h"
#include "Daemon/TSYURL.h"
#include "Platform/values/Value.h"

class TSYUserIdentityCache;
class TSYUserIdentity;
using TSYUserIdentityRef = std::shared_ptr<const TSYUserIdentity>;

enum class TSYPersonaType : uint32_t { personal = 0, enterprise = 1, unspecific = 2 };

class TSYUserIdentity {
 public:
  // Uids below this are role accounts and never own per-user containers.
  static constexpr uid_t kFirstUserAccount = 501;

  // None (logged) for a role account. A missing home is a logged fault; the identity is made.
  static TSYUserIdentityRef initWithUID(uid_t uid, gid_t gid,
                                        std::optional<TSYURL> homeDirectoryURL,
                                        std::optional<std::string> personaUniqueString,
                                        TSYPersonaType personaType, int32_t kernelPersonaID);
  // The legacy mobile identity: uid, gid and kernel persona id 501. Built once.
  static TSYUserIdentityRef userIdentityForLegacyMobileUser();

  // The identity that a property list of version "1" or "2" stands for, resolved through `cache`.
  // Code 75 for missing or wrongly typed values, code 1 for an identity that cannot be resolved or
  // what is no identity at all.
  static TSYResult<TSYUserIdentityRef> userIdentityWithPlist(const platform::Value& plist,
                                                             TSYUserIdentityCache& cache);
  // The version-2 property list.
  platform::Value::Dictionary plist() const;

  uid_t posixUID() const { return uid_; }
  gid_t posixGID() const { return gid_; }
  const std::optional<TSYURL>& homeDirectoryURL() const { return home_; }
  const std::optional<std::string>& personaUniqueString() const { return personaUniqueString_; }
  TSYPersonaType personaType() const { return personaType_; }
  int32_t kernelPersonaID() const { return kernelPersonaID_; }
  const std::string& identifier() const { return identifier_; }

  bool isEnterprise() const { return personaType_ == TSYPersonaType::enterprise; }
  bool isNoSpecificPersona() const { return personaType_ == TSYPersonaType::unspecific; }
  // The home is the common user home, not an enterprise layout path.
  bool isHomeDirectoryInCommonSandbox() const { return !isEnterprise(); }

  // NO for bundle and system classes, YES for every other number.
  static bool isUserIdentityRequiredForContainerClass(TSYContainerClass containerClass);
  // Who owns a container of this identity: the installation account for bundles, the system account
  // for system classes, else the identity's own user.
  uid_t posixUIDForContainerClass(TSYContainerClass containerClass) const;
  gid_t posixGIDForContainerClass(TSYContainerClass containerClass) const;

  bool isEqualToUserIdentity(const TSYUserIdentity& other) const {
    return identifier_ == other.identifier_;
  }
  std::string description() const;
  std::string shortDescription() const;

 private:
  TSYUserIdentity() = default;

  uid_t uid_ = 0;
  gid_t gid_ = 0;
  TSYPersonaType personaType_ = TSYPersonaType::personal;
  int32_t kernelPersonaID_ = 0;
  std::optional<TSYURL> home_;
  std::optional<std::string> personaUniqueString_;
  std::string identifier_;
};

// For sets of identities: order by identifier, which is equality.
struct TSYUserIdentityOrder {
  bool operator()(const TSYUserIdentityRef& left, const TSYUserIdentityRef& right) const {
    return left->identifier() < right->identifier();
  }
};

template <>
struct fmt::formatter<TSYUserIdentity> : fmt::formatter<std::string> {
  auto format(const TSYUserIdentity& identity, format_context& context) const {
    return fmt::formatter<std::string>::format(identity.description(), context);
  }
};

// An identity that is none shows as "(null)".
template <>
struct fmt::formatter<TSYUserIdentityRef> : fmt::formatter<std::string> {
  auto format(const TSYUserIdentityRef& identity, format_context& context) const {
    return fmt::formatter<std::string>::format(identity ? identity->description() : "(null)",
                                               context);
  }
};
