#include "Daemon/TSYClientIdentity.h"

#include "Daemon/TSYLog.h"
#include "Daemon/TSYUserIdentityCache.h"
#include "Platform/base/Mutex.h"

using platform::AuditToken;
using platform::LogLevel;
using platform::Value;

namespace {

constexpr char kInstallerIdentifier[] = "com.veltra.hatcheryd";
constexpr char kInternalIdentifier[] = "com.veltra.tessaryd.internal";

const TSYClientIdentity::Entitlements& noEntitlements() {
  static const auto empty = std::make_shared<const Value::Dictionary>();
  return empty;
}

// The one installer process that the daemon remembers.
struct InstallerIdentity {
  platform::Mutex mutex;
  TSYClientIdentityRef identity GUARDED_BY(mutex);
};

InstallerIdentity& installer() {
  static InstallerIdentity& instance = *new InstallerIdentity();
  return instance;
}

TSYClientIdentityRef rememberedInstaller(const AuditToken& token) {
  InstallerIdentity& known = installer();
  const platform::MutexLock lock(known.mutex);
  return known.identity && known.identity->auditToken() == token ? known.identity : nullptr;
}

void rememberInstaller(const TSYClientIdentityRef& identity) {
  InstallerIdentity& known = installer();
  const platform::MutexLock lock(known.mutex);
  known.identity = identity;
}

TSYClientIdentity::Entitlements entitlementsOf(const platform::ipc::Peer& peer) {
  if (peer.task && peer.task->entitlements) return peer.task->entitlements;
  TSYLogWrite(TSYLogLevelError, "Missing or malformed entitlements for pid {}", peer.pid());
  return noEntitlements();
}

}  // namespace

TSYClientIdentity::TSYClientIdentity(std::string bundleIdentifier, uid_t uid, gid_t gid, pid_t pid,
                                     TSYUserIdentityRef userIdentity, Entitlements entitlements,
                                     bool sandboxed, const AuditToken& auditToken)
    : bundleIdentifier_(std::move(bundleIdentifier)),
      uid_(uid),
      gid_(gid),
      pid_(pid),
      userIdentity_(std::move(userIdentity)),
      entitlements_(std::move(entitlements)),
      sandboxed_(sandboxed),
      auditToken_(auditToken) {}

TSYClientIdentityRef TSYClientIdentity::clientIdentityWithRelayConnection(
    const platform::ipc::Peer& peer) {
  const auto userIdentity =
      TSYUserIdentitySharedCache::sharedInstance().userIdentityForCurrentContextWithUID(peer.uid(),
                                                                                        peer.gid());
  const auto identifier = _bundleIdentifierFromPeer(peer);
  const bool isInstaller = identifier && *identifier == kInstallerIdentifier;
  if (isInstaller) {
    if (auto remembered = rememberedInstaller(peer.token)) return remembered;
  }
  Entitlements entitlements = entitlementsOf(peer);
  TSYClientIdentityRef identity;
  if (!identifier) {
    TSYLogWrite(TSYLogLevelError, "Failed to copy signing ID for pid {} : {}", peer.pid(),
                identifier.error());
  } else if (userIdentity) {
    identity = std::make_shared<const TSYClientIdentity>(
        *identifier, peer.uid(), peer.gid(), peer.pid(), userIdentity, std::move(entitlements),
        peer.task->sandboxed, peer.token);
  }
  if (isInstaller) rememberInstaller(identity);
  if (TSYSystemLogIsEnabled(LogLevel::info)) {
    TSYSystemLogWrite(
        TSYChannel::relay, LogLevel::info, "[{}] Relay client identity: {}",
        "clientIdentityWithRelayConnection:", identity ? identity->description() : "(null)");
  }
  return identity;
}

TSYResult<std::string> TSYClientIdentity::_bundleIdentifierFromPeer(
    const platform::ipc::Peer& peer) {
  if (!peer.task) {
    return TSYFailure(TSYPosixErrorCreate(platform::Errno{ENOENT}, "no record of the process"));
  }
  if (!peer.task->signingIdentifier) {
    return TSYFailure(
        TSYPosixErrorCreate(platform::Errno{EINVAL}, "its record has no code-signing identifier"));
  }
  // The code-signing database would take it for the identifier before the NUL.
  if (peer.task->signingIdentifier->contains('\0')) {
    return TSYFailure(
        TSYPosixErrorCreate(platform::Errno{EINVAL}, "its code-signing identifier holds a NUL"));
  }
  return *peer.task->signingIdentifier;
}

TSYClientIdentityRef TSYClientIdentity::privilegedClientIdentityWithUserIdentity(
    TSYUserIdentityRef userIdentity) {
  return std::make_shared<const TSYClientIdentity>(kInternalIdentifier, 0, 0, 0,
                                                   std::move(userIdentity), noEntitlements(),
                                                   /*sandboxed=*/false, AuditToken{});
}

TSYClientIdentityRef TSYClientIdentity::anonymousPrivilegedClientIdentity() {
  return privilegedClientIdentityWithUserIdentity(TSYUserIdentityCache::defaultUserIdentity());
}

const Value* TSYClientIdentity::valueOfEntitlement(std::string_view entitlement) const {
  const auto found = entitlements_->find(entitlement);
  return found == entitlements_->end() ? nullptr : &found->second;
}

bool TSYClientIdentity::boolValueOfEntitlement(std::string_view entitlement) const {
  const Value* value = valueOfEntitlement(entitlement);
  return value != nullptr && value->booleanOfNumber().value_or(false);
}

uid_t TSYClientIdentity::posixUIDForContainerClass(TSYContainerClass containerClass) const {
  return userIdentity_->posixUIDForContainerClass(containerClass);
}

gid_t TSYClientIdentity::posixGIDForContainerClass(TSYContainerClass containerClass) const {
  return userIdentity_->posixGIDForContainerClass(containerClass);
}

std::string TSYClientIdentity::description() const {
  return fmt::format(
      "<{}: {}; bundleIdentifier = {}, userIdentity = {}, posixUID = {}, posixGID = {}, posixPID = "
      "{}, isSandboxed = {:d}, entitlements = {}>",
      "TSYClientIdentity", fmt::ptr(this), bundleIdentifier_,
      userIdentity_ ? userIdentity_->description() : "(null)", uid_, gid_, pid_, sandboxed_,
      Value(*entitlements_).description());
}
