#include "Daemon/TSYUserIdentity.h"

#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYLog.h"
#include "Platform/os/Accounts.h"

namespace {

std::string_view descriptionForPersonaType(TSYPersonaType type) {
  switch (type) {
    case TSYPersonaType::personal:
      return "personal";
    case TSYPersonaType::enterprise:
      return "enterprise";
    case TSYPersonaType::unspecific:
      return "unspecific";
  }
  return "unknown";
}

std::string identifierFor(uid_t uid, const std::optional<std::string>& personaUniqueString,
                          TSYPersonaType personaType) {
  if (personaType == TSYPersonaType::enterprise && personaUniqueString) return *personaUniqueString;
  return fmt::format("{}", uid);
}

}  // namespace

TSYUserIdentityRef TSYUserIdentity::initWithUID(uid_t uid, gid_t gid,
                                                std::optional<TSYURL> homeDirectoryURL,
                                                std::optional<std::string> personaUniqueString,
                                                TSYPersonaType personaType,
                                                int32_t kernelPersonaID) {
  if (!homeDirectoryURL) {
    TSYSystemLogWrite(TSYChannel::unspecified, platform::LogLevel::fault,
                      "Home directory cannot be nil");
  }
  if (uid < kFirstUserAccount) {
    TSYLogWrite(TSYLogLevelError,
                "Attempt to create a TSYUserIdentity object with a role user uid is not allowed: "
                "uid = {}, gid = {}",
                uid, gid);
    return nullptr;
  }
  TSYUserIdentity identity;
  identity.uid_ = uid;
  identity.gid_ = gid;
  identity.personaType_ = personaType;
  identity.kernelPersonaID_ = kernelPersonaID;
  identity.identifier_ = identifierFor(uid, personaUniqueString, personaType);
  identity.home_ = std::move(homeDirectoryURL);
  identity.personaUniqueString_ = std::move(personaUniqueString);
  return std::make_shared<const TSYUserIdentity>(std::move(identity));
}

TSYUserIdentityRef TSYUserIdentity::userIdentityForLegacyMobileUser() {
  static const TSYUserIdentityRef identity = initWithUID(
      kFirstUserAccount, kFirstUserAccount,
      TSYFileManager::homeDirectoryURLForPOSIXUID(kFirstUserAccount),
      /*personaUniqueString=*/std::nullopt, TSYPersonaType::personal, kFirstUserAccount);
  return identity;
}

bool TSYUserIdentity::isUserIdentityRequiredForContainerClass(TSYContainerClass containerClass) {
  return !TSYIsGlobalClass(containerClass);
}

uid_t TSYUserIdentity::posixUIDForContainerClass(TSYContainerClass containerClass) const {
  if (TSYIsBundleClass(containerClass)) return platform::kInstallationAccount;
  if (TSYIsSystemClass(containerClass)) return platform::kSystemAccount;
  return uid_;
}

gid_t TSYUserIdentity::posixGIDForContainerClass(TSYContainerClass containerClass) const {
  // Both accounts have a group of the same number.
  if (TSYIsBundleClass(containerClass)) return platform::kInstallationAccount;
  if (TSYIsSystemClass(containerClass)) return platform::kSystemAccount;
  return gid_;
}

std::string TSYUserIdentity::description() const {
  return fmt::format(
      "<TSYUserIdentity: {}; posixUID = {}, posixGID = {}, identifier = {}, homeDirectoryURL = {}, "
      "personaType = {}, personaUniqueString = {}, kernelPersonaID = {}>",
      fmt::ptr(this), uid_, gid_, identifier_, home_ ? home_->path() : "(null)",
      descriptionForPersonaType(personaType_), personaUniqueString_.value_or("(null)"),
      kernelPersonaID_);
}

std::string TSYUserIdentity::shortDescription() const {
  return fmt::format("<TSYUserIdentity: {}; {}/{}/{}/{}/{}>", fmt::ptr(this), uid_, gid_,
                     identifier_, static_cast<uint32_t>(personaType_), kernelPersonaID_);
}
