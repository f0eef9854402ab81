// The name of a container: whose it is, its identifier and its class; a concrete identity also
// carries the container's UUID. Plain values, shared between threads without locking.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "Daemon/TSYContainerClass.h"
#include "Daemon/TSYError.h"
#include "Daemon/TSYUserIdentity.h"
#include "Platform/values/UUID.h"
#include "Platform/values/Value.h"

class TSYContainerIdentity {
 public:
  // `identifier` must hold a string and may be null for "none was given". Code 11 without a user
  // identity, for an identifier that is no string and for a class outside 1 to 13; code 18 without
  // an identifier.
  static TSYResult<TSYContainerIdentity> containerIdentityWithUserIdentity(
      TSYUserIdentityRef userIdentity, const platform::Value* identifier,
      TSYContainerClass containerClass);
  static TSYResult<TSYContainerIdentity> containerIdentityWithUserIdentity(
      TSYUserIdentityRef userIdentity, std::string identifier, TSYContainerClass containerClass);
  // For classes that need no user identity: takes the default one. Code 11 for any other class.
  static TSYResult<TSYContainerIdentity> containerIdentityWithIdentifier(
      std::string identifier, TSYContainerClass containerClass);
  TSYContainerIdentity(const TSYContainerIdentity&) = default;
  TSYContainerIdentity& operator=(const TSYContainerIdentity&) = default;
  TSYContainerIdentity(TSYContainerIdentity&&) = default;
  TSYContainerIdentity& operator=(TSYContainerIdentity&&) = default;
  virtual ~TSYContainerIdentity() = default;

  const TSYUserIdentityRef& userIdentity() const { return userIdentity_; }
  const std::string& identifier() const { return identifier_; }
  TSYContainerClass containerClass() const { return containerClass_; }

  // Compares the three fields; accepts a concrete identity too.
  bool isEqualToContainerIdentity(const TSYContainerIdentity& other) const;
  // A plain identity may equal a concrete one, a concrete one equals only concrete ones.
  virtual bool isEqual(const TSYContainerIdentity& other) const;
  virtual size_t hash() const;
  virtual std::string description() const;

 protected:
  TSYContainerIdentity(TSYUserIdentityRef userIdentity, std::string identifier,
                       TSYContainerClass containerClass);

 private:
  TSYUserIdentityRef userIdentity_;
  std::string identifier_;
  TSYContainerClass containerClass_;
};

// A plain or a concrete one; never null.
using TSYContainerIdentityRef = std::shared_ptr<const TSYContainerIdentity>;

class TSYConcreteContainerIdentity : public TSYContainerIdentity {
 public:
  // `identity` itself when it is a concrete one, else null.
  static const TSYConcreteContainerIdentity* orNull(const TSYContainerIdentity& identity) {
    return dynamic_cast<const TSYConcreteContainerIdentity*>(&identity);
  }
  // As the plain one; code 11 also without a UUID.
  static TSYResult<TSYConcreteContainerIdentity> containerIdentityWithUUID(
      const std::optional<platform::UUID>& uuid, TSYUserIdentityRef userIdentity,
      std::string identifier, TSYContainerClass containerClass);

  const platform::UUID& uuid() const { return uuid_; }

  // Compares all four fields.
  bool isEqualToConcreteContainerIdentity(const TSYConcreteContainerIdentity& other) const;
  bool isEqual(const TSYContainerIdentity& other) const override;
  size_t hash() const override;
  std::string description() const override;

 private:
  TSYConcreteContainerIdentity(TSYContainerIdentity plain, const platform::UUID& uuid);

  platform::UUID uuid_;
};

template <>
struct fmt::formatter<TSYContainerIdentity> : fmt::formatter<std::string> {
  auto format(const TSYContainerIdentity& identity, format_context& context) const {
    return fmt::formatter<std::string>::format(identity.description(), context);
  }
};
