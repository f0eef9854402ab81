#include "Daemon/TSYContainerIdentity.h"

#include <functional>

#include "Daemon/TSYLog.h"
#include "Daemon/TSYUserIdentityCache.h"

namespace {

TSYError noUserIdentity() {
  return TSYErrorCreate(TSYErrorInvalidObject, std::nullopt, TSYLogIt::yes,
                        "Invalid object: no user identity");
}

size_t hashOf(const std::string& text) {
  return std::hash<std::string>{}(text);
}

}  // namespace

TSYContainerIdentity::TSYContainerIdentity(TSYUserIdentityRef userIdentity, std::string identifier,
                                           TSYContainerClass containerClass)
    : userIdentity_(std::move(userIdentity)),
      identifier_(std::move(identifier)),
      containerClass_(containerClass) {}

TSYResult<TSYContainerIdentity> TSYContainerIdentity::containerIdentityWithUserIdentity(
    TSYUserIdentityRef userIdentity, const platform::Value* identifier,
    TSYContainerClass containerClass) {
  // Which failure is reported depends on this order.
  if (userIdentity == nullptr) return TSYFailure(noUserIdentity());
  if (identifier == nullptr) {
    return TSYFailure(TSYErrorCreate(TSYErrorMissingIdentifier, std::nullopt, TSYLogIt::yes,
                                     "Invalid object: missing identifier"));
  }
  const std::string* text = identifier->asString();
  if (text == nullptr) {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidObject, std::nullopt, TSYLogIt::yes,
                                     "Invalid object: identifier = [{}]",
                                     identifier->description()));
  }
  return containerIdentityWithUserIdentity(std::move(userIdentity), *text, containerClass);
}

TSYResult<TSYContainerIdentity> TSYContainerIdentity::containerIdentityWithUserIdentity(
    TSYUserIdentityRef userIdentity, std::string identifier, TSYContainerClass containerClass) {
  if (userIdentity == nullptr) return TSYFailure(noUserIdentity());
  if (!TSYIsContainerClass(containerClass)) {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidObject, std::nullopt, TSYLogIt::yes,
                                     "Invalid object: container class = {}", containerClass));
  }
  return TSYContainerIdentity(std::move(userIdentity), std::move(identifier), containerClass);
}

TSYResult<TSYContainerIdentity> TSYContainerIdentity::containerIdentityWithIdentifier(
    std::string identifier, TSYContainerClass containerClass) {
  if (TSYUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)) {
    const TSYError error = TSYErrorCreate(
        TSYErrorInvalidObject, std::nullopt, TSYLogIt::no,
        "Attempt to create a container identity without a user identity when one is required; "
        "identifier = [{}], class = {}",
        identifier, containerClass);
    TSYSystemLogWrite(TSYChannel::unspecified, platform::LogLevel::fault, "{}",
                      *error.localizedDescription());
    return TSYFailure(error);
  }
  return containerIdentityWithUserIdentity(TSYUserIdentityCache::defaultUserIdentity(),
                                           std::move(identifier), containerClass);
}

bool TSYContainerIdentity::isEqualToContainerIdentity(const TSYContainerIdentity& other) const {
  return containerClass_ == other.containerClass_ && identifier_ == other.identifier_ &&
         userIdentity_->isEqualToUserIdentity(*other.userIdentity_);
}

bool TSYContainerIdentity::isEqual(const TSYContainerIdentity& other) const {
  return isEqualToContainerIdentity(other);
}

size_t TSYContainerIdentity::hash() const {
  return hashOf(identifier_) ^ hashOf(userIdentity_->identifier()) ^
         static_cast<size_t>(containerClass_);
}

std::string TSYContainerIdentity::description() const {
  return fmt::format("<TSYContainerIdentity: {}; userIdentity = {}, identifier = {}, class = {}>",
                     fmt::ptr(this), userIdentity_->shortDescription(), identifier_,
                     containerClass_);
}

TSYConcreteContainerIdentity::TSYConcreteContainerIdentity(TSYContainerIdentity plain,
                                                           const platform::UUID& uuid)
    : TSYContainerIdentity(std::move(plain)), uuid_(uuid) {}

TSYResult<TSYConcreteContainerIdentity> TSYConcreteContainerIdentity::containerIdentityWithUUID(
    const std::optional<platform::UUID>& uuid, TSYUserIdentityRef userIdentity,
    std::string identifier, TSYContainerClass containerClass) {
  TSYResult<TSYContainerIdentity> plain = containerIdentityWithUserIdentity(
      std::move(userIdentity), std::move(identifier), containerClass);
  if (!plain) return TSYFailure(plain.error());
  if (!uuid) {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidObject, std::nullopt, TSYLogIt::yes,
                                     "Invalid object: uuid = [{}]", "(null)"));
  }
  return TSYConcreteContainerIdentity(std::move(*plain), *uuid);
}

bool TSYConcreteContainerIdentity::isEqualToConcreteContainerIdentity(
    const TSYConcreteContainerIdentity& other) const {
  return uuid_ == other.uuid_ && isEqualToContainerIdentity(other);
}

bool TSYConcreteContainerIdentity::isEqual(const TSYContainerIdentity& other) const {
  const TSYConcreteContainerIdentity* concrete = orNull(other);
  return concrete != nullptr && isEqualToConcreteContainerIdentity(*concrete);
}

size_t TSYConcreteContainerIdentity::hash() const {
  return TSYContainerIdentity::hash() ^ std::hash<platform::UUID>{}(uuid_);
}

std::string TSYConcreteContainerIdentity::description() const {
  return fmt::format(
      "<TSYConcreteContainerIdentity: {}; userIdentity = {}, identifier = {}, class = {}, "
      "uuid = {}>",
      fmt::ptr(this), userIdentity()->shortDescription(), identifier(), containerClass(),
      uuid_.string());
}
