// Who a client is: its process, user, code-signing identifier and entitlements.
//
// Immutable and shared as TSYClientIdentityRef between the requests of a process.
#pragma once

#include <sys/types.h>

#include <memory>
#include <string>
#include <string_view>

#include "Daemon/TSYContainerClass.h"
#include "Daemon/TSYUserIdentity.h"
#include "Platform/ipc/server/Peer.h"
#include "Platform/os/AuditToken.h"
#include "Platform/values/Value.h"

class TSYClientIdentity;
using TSYClientIdentityRef = std::shared_ptr<const TSYClientIdentity>;

class TSYClientIdentity {
 public:
  using Entitlements = std::shared_ptr<const platform::Value::Dictionary>;

  TSYClientIdentity(std::string bundleIdentifier, uid_t uid, gid_t gid, pid_t pid,
                    TSYUserIdentityRef userIdentity, Entitlements entitlements, bool sandboxed,
                    const platform::AuditToken& auditToken);

  // The identity of a connected client; null for a process without a code-signing identifier or
  // without a user. The installer's, which asks most, is remembered by its audit token. Called
  // while the caller context of the request is set.
  static TSYClientIdentityRef clientIdentityWithRelayConnection(const platform::ipc::Peer& peer);
  // The code-signing identifier of the process; a POSIX error when it has no record (ENOENT) or one
  // without an identifier, or with a NUL in it (EINVAL).
  static TSYResult<std::string> _bundleIdentifierFromPeer(const platform::ipc::Peer& peer);
  // For the daemon's own work on behalf of a user.
  static TSYClientIdentityRef privilegedClientIdentityWithUserIdentity(
      TSYUserIdentityRef userIdentity);
  // The same for the default user, which is none on a system without the account "mobile".
  static TSYClientIdentityRef anonymousPrivilegedClientIdentity();

  bool sandboxed() const { return sandboxed_; }
  pid_t posixPID() const { return pid_; }
  uid_t posixUID() const { return uid_; }
  gid_t posixGID() const { return gid_; }
  const std::string& bundleIdentifier() const { return bundleIdentifier_; }
  const platform::Value::Dictionary& entitlements() const { return *entitlements_; }
  const TSYUserIdentityRef& userIdentity() const { return userIdentity_; }
  const platform::AuditToken& auditToken() const { return auditToken_; }

  // True only for a number that is true under this key.
  bool boolValueOfEntitlement(std::string_view entitlement) const;
  // Null when there is no value.
  const platform::Value* valueOfEntitlement(std::string_view entitlement) const;
  uid_t posixUIDForContainerClass(TSYContainerClass containerClass) const;
  gid_t posixGIDForContainerClass(TSYContainerClass containerClass) const;

  std::string description() const;

 private:
  const std::string bundleIdentifier_;
  const uid_t uid_;
  const gid_t gid_;
  const pid_t pid_;
  const TSYUserIdentityRef userIdentity_;
  const Entitlements entitlements_;
  const bool sandboxed_;
  const platform::AuditToken auditToken_;
};
