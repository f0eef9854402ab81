// From the keys of a request to what an operation takes: identifiers, user identities, container
// identities and sandbox tokens. Shared by the command handlers.
#pragma once

#include <cstdint>
#include <expected>
#include <optional>
#include <string>
#include <string_view>

#include "Daemon/TSYClientConnection.h"
#include "Daemon/TSYContainerIdentity.h"
#include "Platform/ipc/Message.h"

// A resolver fails with the bare code of the request.
template <typename T>
using TSYResolved = std::expected<T, uint64_t>;

inline constexpr char kTSYRequestIdentifier[] = "Identifier";
inline constexpr char kTSYRequestContainerClass[] = "ContainerClass";
inline constexpr char kTSYRequestUUID[] = "UUID";
inline constexpr char kTSYRequestPersonaUniqueString[] = "PersonaUniqueString";

// The string under a key; none for what is no string.
std::optional<std::string> TSYStringUnder(const platform::ipc::Message& request,
                                          std::string_view key);

// Whether the client's own identifier stands in for one that the request does not carry.
enum class TSYIdentifierFallback { none, client };

// The string under "Identifier"; none when there is none to be had.
std::optional<std::string> TSYResolveIdentifier(const platform::ipc::Message& request,
                                                const TSYClientConnection& connection,
                                                TSYIdentifierFallback fallback);

// Whose container of this class and identifier is meant: the client's own user, or the one persona
// that the application belongs to. Code 76 for a client without a user.
TSYResolved<TSYUserIdentityRef> TSYResolveUserIdentityForIdentifier(
    const TSYClientConnection& connection, const std::string& identifier,
    TSYContainerClass containerClass);

// Whose groups of an owner are meant: as above, for the application that the owner belongs to. But
// code 76 too when nobody may own them, or several and not the client: a guess would hand out
// another's data.
TSYResolved<TSYUserIdentityRef> TSYResolveUserIdentityForGroupOwner(
    const TSYClientConnection& connection, const std::string& owner);

// Codes 18, 20, 76, and those of TSYContainerIdentity.
TSYResolved<TSYContainerIdentity> TSYResolveContainerIdentity(const platform::ipc::Message& request,
                                                              const TSYClientConnection& connection,
                                                              TSYIdentifierFallback fallback);
// The same for a class and an identifier that are known. Codes 76 and those of
// TSYContainerIdentity.
TSYResolved<TSYContainerIdentity> TSYResolveContainerIdentityOfClass(
    const TSYClientConnection& connection, const std::string& identifier,
    TSYContainerClass containerClass);

// The identity of a persona. Code 76 for an unknown one, and for one that is not the client's own
// when the client has a specific persona.
TSYResolved<TSYUserIdentityRef> TSYResolvePersona(const TSYClientConnection& connection,
                                                  const std::optional<std::string>& uniqueString);

// The keys of a request that names one very container.
struct TSYConcreteKeys {
  std::string_view identifier = kTSYRequestIdentifier;
  std::string_view containerClass = kTSYRequestContainerClass;
  std::string_view uuid = kTSYRequestUUID;
  std::string_view persona = kTSYRequestPersonaUniqueString;
};

// Codes 18, 20, 76, and those of TSYConcreteContainerIdentity (11 without a UUID).
TSYResolved<TSYConcreteContainerIdentity> TSYResolveConcreteContainerIdentity(
    const platform::ipc::Message& request, const TSYClientConnection& connection,
    const TSYConcreteKeys& keys = {});

// The plain identity under the keys when the request carries no UUID, else the concrete one.
TSYResolved<TSYContainerIdentityRef> TSYResolveNamedContainerIdentity(
    const platform::ipc::Message& request, const TSYClientConnection& connection,
    const TSYConcreteKeys& keys);

// What a reply says of a container's persona; none without one.
std::optional<std::string> TSYPersonaUniqueStringOf(const TSYMetadata& container);

// A file extension token for a sandboxed client's enterprise container; none for any other, and
// when the sandbox issues none (logged).
std::optional<std::string> TSYIssueSandboxExtension(const TSYMetadata& container,
                                                    const TSYClientIdentity& client);
