#include "Daemon/TSYRequestResolvers.h"

#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYContainerCache.h"
#include "Daemon/TSYLog.h"
#include "Platform/os/Platform.h"

using platform::LogLevel;
using platform::Platform;
using platform::ipc::Message;

namespace {

std::optional<platform::UUID> uuidUnder(const Message& request, std::string_view key) {
  const platform::UUID* value = request.uuid(key);
  return value == nullptr ? std::nullopt : std::optional(*value);
}

std::string descriptionOf(const TSYUserIdentityCache::IdentitySet& identities) {
  std::string text = "{(";
  for (const TSYUserIdentityRef& identity : identities) {
    if (text.size() > 2) text += ", ";
    text += identity->shortDescription();
  }
  return text + ")}";
}

// The application that a plug-in belongs to, or the bundle itself.
std::string applicationOf(const std::string& identifier) {
  return TSYCodeSigningMapping::sharedInstance()
      .parentIdentifierForChildIdentifier(identifier)
      .value_or(identifier);
}

// The bundle whose personas decide: plug-ins follow the application that they belong to.
std::string bundleIdentifierFor(const std::string& identifier, TSYContainerClass containerClass) {
  const bool isPluginData = containerClass == kTSYContainerClassPluginData ||
                            containerClass == kTSYContainerClassVPNPluginData;
  return isPluginData ? applicationOf(identifier) : identifier;
}

TSYUserIdentityCache::IdentitySet ownersOf(const std::string& bundleIdentifier) {
  return TSYContainerCache::sharedInstance().userIdentityCache().userIdentitiesForBundleIdentifier(
      bundleIdentifier);
}

void logAmbiguity(const std::string& bundleIdentifier,
                  const TSYUserIdentityCache::IdentitySet& identities, const TSYUserIdentity& own) {
  TSYSystemLogWrite(TSYChannel::unspecified, LogLevel::fault,
                    "Ambiguous user identity from [{}]. Expected one of [{}], got {}",
                    bundleIdentifier, descriptionOf(identities), own.shortDescription());
}

// The class under a key. Code 20 (logged) outside 1 to 13.
TSYResolved<TSYContainerClass> resolveClass(const Message& request, std::string_view key) {
  const TSYContainerClass containerClass = request.uint64(key).value_or(0);
  if (TSYIsContainerClass(containerClass)) return containerClass;
  return std::unexpected(TSYErrorCreate(TSYErrorUnexpectedContainerType, std::nullopt,
                                        TSYLogIt::yes, "Passed an unexpected container type: {}",
                                        containerClass)
                             .code());
}

// What the keys of a container name, without its UUID.
struct NamedContainer {
  std::string identifier;
  TSYContainerClass containerClass;
  TSYUserIdentityRef userIdentity;
};

TSYResolved<NamedContainer> resolveNamed(const Message& request,
                                         const TSYClientConnection& connection,
                                         const TSYConcreteKeys& keys) {
  auto identifier = TSYStringUnder(request, keys.identifier);
  if (!identifier) return std::unexpected(uint64_t{TSYErrorMissingIdentifier});
  const auto containerClass = resolveClass(request, keys.containerClass);
  if (!containerClass) return std::unexpected(containerClass.error());
  NamedContainer named{std::move(*identifier), *containerClass, connection.clientUserIdentity()};
  if (TSYUserIdentity::isUserIdentityRequiredForContainerClass(*containerClass)) {
    auto persona = TSYResolvePersona(connection, TSYStringUnder(request, keys.persona));
    if (!persona) return std::unexpected(persona.error());
    named.userIdentity = std::move(*persona);
  }
  return named;
}

// The sandbox extension class of a container class; null when there is none.
const char* extensionClassFor(TSYContainerClass containerClass) {
  switch (containerClass) {
    case kTSYContainerClassAppData:
    case kTSYContainerClassPluginData:
    case kTSYContainerClassVPNPluginData:
    case kTSYContainerClassInternalDaemon:
      return "com.veltra.sandbox.container";
    case kTSYContainerClassAppGroup:
      return "com.veltra.sandbox.application-group";
    default:
      return nullptr;
  }
}

}  // namespace

std::optional<std::string> TSYStringUnder(const Message& request, std::string_view key) {
  const std::string* value = request.string(key);
  return value == nullptr ? std::nullopt : std::optional(*value);
}

std::optional<std::string> TSYResolveIdentifier(const Message& request,
                                                const TSYClientConnection& connection,
                                                TSYIdentifierFallback fallback) {
  if (auto identifier = TSYStringUnder(request, kTSYRequestIdentifier)) return identifier;
  if (fallback == TSYIdentifierFallback::none || !connection.clientIdentity()) return std::nullopt;
  return connection.clientBundleIdentifier();
}

TSYResolved<TSYUserIdentityRef> TSYResolveUserIdentityForIdentifier(
    const TSYClientConnection& connection, const std::string& identifier,
    TSYContainerClass containerClass) {
  TSYUserIdentityRef own = connection.clientUserIdentity();
  if (!own) return std::unexpected(uint64_t{TSYErrorPersonaMismatch});
  if (!TSYIsPerUserClass(containerClass) || !own->isNoSpecificPersona()) return own;

  const std::string bundleIdentifier = bundleIdentifierFor(identifier, containerClass);
  const auto identities = ownersOf(bundleIdentifier);
  if (TSYLogIsEnabled(TSYLogLevelDebug)) {
    TSYLogWrite(TSYLogLevelDebug,
                "Chose bundleIdentifier: {}, userIdentities: {} for identifier: {}, class: {}",
                bundleIdentifier, descriptionOf(identities), identifier, containerClass);
  }
  if (identities.size() == 1) return *identities.begin();
  if (identities.empty()) {
    TSYLogWrite(TSYLogLevelError, "{} trying to look up persona for {}:{}",
                connection.clientBundleIdentifier(), containerClass, identifier);
  } else if (!identities.contains(own)) {
    logAmbiguity(bundleIdentifier, identities, *own);
  }
  return own;
}

TSYResolved<TSYUserIdentityRef> TSYResolveUserIdentityForGroupOwner(
    const TSYClientConnection& connection, const std::string& owner) {
  TSYUserIdentityRef own = connection.clientUserIdentity();
  if (!own) return std::unexpected(uint64_t{TSYErrorPersonaMismatch});
  if (!own->isNoSpecificPersona()) return own;

  const std::string bundleIdentifier = applicationOf(owner);
  const auto identities = ownersOf(bundleIdentifier);
  if (TSYLogIsEnabled(TSYLogLevelDebug)) {
    TSYLogWrite(TSYLogLevelDebug,
                "Chose bundleIdentifier: {} for group container lookup, userIdentities: {} for "
                "identifier: {}",
                bundleIdentifier, descriptionOf(identities), owner);
  }
  if (identities.size() == 1) return *identities.begin();
  if (identities.contains(own)) return own;
  if (identities.empty()) {
    TSYLogWrite(TSYLogLevelError, "{} trying to look up persona for group owner {}",
                connection.clientBundleIdentifier(), owner);
  } else {
    logAmbiguity(bundleIdentifier, identities, *own);
  }
  return std::unexpected(uint64_t{TSYErrorPersonaMismatch});
}

TSYResolved<TSYContainerIdentity> TSYResolveContainerIdentity(const Message& request,
                                                              const TSYClientConnection& connection,
                                                              TSYIdentifierFallback fallback) {
  const auto identifier = TSYResolveIdentifier(request, connection, fallback);
  if (!identifier) return std::unexpected(uint64_t{TSYErrorMissingIdentifier});
  const auto containerClass = resolveClass(request, kTSYRequestContainerClass);
  if (!containerClass) return std::unexpected(containerClass.error());
  return TSYResolveContainerIdentityOfClass(connection, *identifier, *containerClass);
}

TSYResolved<TSYContainerIdentity> TSYResolveContainerIdentityOfClass(
    const TSYClientConnection& connection, const std::string& identifier,
    TSYContainerClass containerClass) {
  auto userIdentity = TSYResolveUserIdentityForIdentifier(connection, identifier, containerClass);
  if (!userIdentity) return std::unexpected(userIdentity.error());
  auto identity = TSYContainerIdentity::containerIdentityWithUserIdentity(
      std::move(*userIdentity), identifier, containerClass);
  if (!identity) return std::unexpected(identity.error().clientCode());
  return std::move(*identity);
}

TSYResolved<TSYUserIdentityRef> TSYResolvePersona(const TSYClientConnection& connection,
                                                  const std::optional<std::string>& uniqueString) {
  TSYUserIdentityRef own = connection.clientUserIdentity();
  if (!own) return std::unexpected(uint64_t{TSYErrorPersonaMismatch});
  if (Platform::current().device.isMultiUser()) return own;
  auto identity = TSYUserIdentitySharedCache::sharedInstance()
                      .userIdentityForCurrentUserWithPersonaUniqueString(uniqueString);
  if (!identity) {
    TSYLogWrite(TSYLogLevelError,
                "Cannot reconstitute a user identity from provided persona unique string; client = "
                "[{}], personaUniqueString = [{}]",
                connection.clientIdentity()->description(), uniqueString.value_or("(null)"));
    return std::unexpected(uint64_t{TSYErrorPersonaMismatch});
  }
  if (!own->isNoSpecificPersona() && !identity->isEqualToUserIdentity(*own)) {
    TSYLogWrite(TSYLogLevelError,
                "Persona unique string is not valid for this client; client = [{}], "
                "personaUniqueString = [{}]",
                connection.clientIdentity()->description(), uniqueString.value_or("(null)"));
    return std::unexpected(uint64_t{TSYErrorPersonaMismatch});
  }
  return identity;
}

TSYResolved<TSYConcreteContainerIdentity> TSYResolveConcreteContainerIdentity(
    const Message& request, const TSYClientConnection& connection, const TSYConcreteKeys& keys) {
  auto named = resolveNamed(request, connection, keys);
  if (!named) return std::unexpected(named.error());
  auto identity = TSYConcreteContainerIdentity::containerIdentityWithUUID(
      uuidUnder(request, keys.uuid), std::move(named->userIdentity), std::move(named->identifier),
      named->containerClass);
  if (!identity) return std::unexpected(identity.error().clientCode());
  return std::move(*identity);
}

TSYResolved<TSYContainerIdentityRef> TSYResolveNamedContainerIdentity(
    const Message& request, const TSYClientConnection& connection, const TSYConcreteKeys& keys) {
  if (uuidUnder(request, keys.uuid)) {
    auto concrete = TSYResolveConcreteContainerIdentity(request, connection, keys);
    if (!concrete) return std::unexpected(concrete.error());
    return std::make_shared<const TSYConcreteContainerIdentity>(std::move(*concrete));
  }
  auto named = resolveNamed(request, connection, keys);
  if (!named) return std::unexpected(named.error());
  auto plain = TSYContainerIdentity::containerIdentityWithUserIdentity(
      std::move(named->userIdentity), std::move(named->identifier), named->containerClass);
  if (!plain) return std::unexpected(plain.error().clientCode());
  return std::make_shared<const TSYContainerIdentity>(std::move(*plain));
}

std::optional<std::string> TSYPersonaUniqueStringOf(const TSYMetadata& container) {
  return container.userIdentity() ? container.userIdentity()->personaUniqueString() : std::nullopt;
}

std::optional<std::string> TSYIssueSandboxExtension(const TSYMetadata& container,
                                                    const TSYClientIdentity& client) {
  if (!client.sandboxed()) return std::nullopt;
  const std::string path = container.url().path();
  const bool isEnterprise = container.userIdentity() && container.userIdentity()->isEnterprise();
  const char* extensionClass = extensionClassFor(container.containerClass());
  if (!isEnterprise || extensionClass == nullptr) {
    TSYSystemLogWrite(TSYChannel::sandbox, LogLevel::info,
                      "{} is sandboxed and container (type: {}) is enterprise: {:d}. NOT issuing "
                      "token for path: {}",
                      client.bundleIdentifier(), container.containerClass(), isEnterprise, path);
    return std::nullopt;
  }
  TSYSystemLogWrite(TSYChannel::sandbox, LogLevel::standard,
                    "{} is sandboxed and container (type: {}) is enterprise: {:d}. Issuing token "
                    "for path: {}",
                    client.bundleIdentifier(), container.containerClass(), isEnterprise, path);
  auto token =
      Platform::current().sandbox.issueFileExtension(extensionClass, path, client.auditToken());
  if (!token) {
    TSYLogWrite(TSYLogLevelError, "sandbox_extension_issue_file failed for {} at path {}: {}",
                client.bundleIdentifier(), path, token.error().value);
    return std::nullopt;
  }
  return std::move(*token);
}
