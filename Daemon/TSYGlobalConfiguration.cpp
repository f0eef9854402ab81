#include "Daemon/TSYGlobalConfiguration.h"

#include "Daemon/TSYConfigurationDirectory.h"
#include "Daemon/TSYInvariant.h"
#include "Daemon/TSYLog.h"
#include "Platform/os/Platform.h"

namespace {

// The class of the daemon's own directories: readable whatever the lock state, since the daemon
// works before the first unlock.
constexpr int kAlwaysReadable = 4;

// The one place where the root comes in front: everything else is derived from these paths.
TSYURL fixedPath(std::string_view path) {
  return TSYURL(platform::Platform::current().files.root()).appending(path.substr(1));
}

}  // namespace

TSYGlobalConfiguration& TSYGlobalConfiguration::sharedInstance() {
  // Never destroyed: threads may still ask while the process ends.
  static auto& instance = *new TSYGlobalConfiguration;
  return instance;
}

TSYGlobalConfiguration::TSYGlobalConfiguration()
    : home_(fixedPath("/private/var/root")),
      sharedContainers_(fixedPath("/private/var/containers")),
      caches_(home_.appending("Library/Caches/com.veltra.tessaryd")),
      library_(home_.appending("Library/Tessary")),
      isInternalImage_(platform::Platform::current().systemVersion.isInternalBuild()) {
  const std::optional<platform::Account> mobile =
      platform::Platform::current().accounts.accountNamed("mobile");
  if (!mobile) {
    TSYLogWrite(TSYLogLevelError, "Failed to get mobile uid. This is bad");
    return;
  }
  mobileUserId_ = mobile->uid;
  mobileGroupId_ = mobile->gid;
  TSYLogWrite(TSYLogLevelError, "Current mobile user ID is {}, group ID is {}", mobileUserId_,
              mobileGroupId_);
}

TSYURL TSYGlobalConfiguration::sharedContainersDirectory() {
  TSYMakeConfigurationDirectory(sharedContainers_, {.kind = "shared container dir"});
  return sharedContainers_;
}

TSYURL TSYGlobalConfiguration::logDirectory() {
  TSYURL url = home_.appending("Library/Logs/Tessary");
  TSYMakeConfigurationDirectory(url, {.kind = "log directory", .protectionClass = kAlwaysReadable});
  return url;
}

TSYURL TSYGlobalConfiguration::cachesDirectory() {
  TSYMakeConfigurationDirectory(caches_, {.kind = "cache dir", .protectionClass = kAlwaysReadable});
  return caches_;
}

TSYURL TSYGlobalConfiguration::libraryDirectory() {
  TSYMakeConfigurationDirectory(library_,
                                {.kind = "library dir", .protectionClass = kAlwaysReadable});
  return library_;
}

TSYURL TSYGlobalConfiguration::transientDirectory() {
  TSYURL url = cachesDirectory().appending("Temp");
  TSYMakeConfigurationDirectory(url, {.kind = "transient dir"});
  return url;
}

TSYURL TSYGlobalConfiguration::transientBundleDirectory() {
  TSYURL url = sharedContainersDirectory().appending("Temp");
  TSYMakeConfigurationDirectory(
      url, {.kind = "transient bundle dir", .owner = platform::kInstallationAccount});
  return url;
}

TSYURL TSYGlobalConfiguration::stagingDirectory() {
  TSYURL url = cachesDirectory().appending("Staging");
  TSYMakeConfigurationDirectory(url, {.kind = "staging dir"});
  return url;
}

TSYURL TSYGlobalConfiguration::deathrowDirectory() {
  TSYURL url = cachesDirectory().appending("Dead");
  TSYMakeConfigurationDirectory(url, {.kind = "deathrow dir"});
  return url;
}

TSYURL TSYGlobalConfiguration::replaceDirectory() {
  TSYURL url = libraryDirectory().appending("Replace");
  TSYMakeConfigurationDirectory(url, {.kind = "replace dir"});
  return url;
}

TSYURL TSYGlobalConfiguration::pendingUpdatesDirectory() {
  TSYURL url = libraryDirectory().appending("PendingUpdates");
  TSYMakeConfigurationDirectory(url, {.kind = "updates dir"});
  return url;
}

TSYURL TSYGlobalConfiguration::bundleDirectory() {
  TSYURL url = sharedContainersDirectory().appending("Bundle");
  TSYMakeConfigurationDirectory(url, {.kind = "bundle dir"});
  return url;
}

std::optional<TSYURL> TSYGlobalConfiguration::legacyTransientBundleDirectory() {
  TSYURL url = fixedPath("/private/var/hatcheryd/Library/Caches/com.veltra.tessaryd");
  if (!TSYFileManager::defaultManager().itemExistsAtURL(url)) return std::nullopt;
  return url;
}

TSYURL TSYGlobalConfiguration::temporaryDirectory() const {
  return fixedPath("/tmp");
}

std::optional<TSYURL> TSYGlobalConfiguration::globalContainerBaseURLWithContentClass(
    TSYContainerClass contentClass, bool transient) {
  if (!TSYIsGlobalClass(contentClass)) return std::nullopt;
  const TSYURL base = !transient                       ? sharedContainersDirectory()
                      : TSYIsBundleClass(contentClass) ? transientBundleDirectory()
                                                       : transientDirectory();
  return base.appending(TSYContainerClassDirectory(contentClass));
}

std::optional<TSYURL> TSYGlobalConfiguration::containerDirectoryURLForUserIdentity(
    const TSYUserIdentityRef& userIdentity, TSYContainerClass contentClass, bool transient) {
  std::optional<TSYURL> url = globalContainerBaseURLWithContentClass(contentClass, transient);
  if (!url) {
    if (userIdentity == nullptr) return std::nullopt;
    return getPerUserConfigurationForUserIdentity(userIdentity)
        .containerDirectoryURLForContentClass(contentClass, transient);
  }
  const uid_t owner = TSYIsBundleClass(contentClass) ? platform::kInstallationAccount
                                                     : TSYFileManager::kUnchangedOwner;
  TSYMakeConfigurationDirectory(*url, {.kind = "container dir", .owner = owner});
  return url;
}

std::optional<TSYURL> TSYGlobalConfiguration::stagingDirectoryURLForUserIdentity(
    const TSYUserIdentityRef& userIdentity, TSYContainerClass contentClass) {
  if (!TSYIsPerUserClass(contentClass)) return stagingDirectory();
  if (userIdentity == nullptr) return std::nullopt;
  return getPerUserConfigurationForUserIdentity(userIdentity).stagingDirectory();
}

TSYPerUserConfiguration& TSYGlobalConfiguration::getPerUserConfigurationForUserIdentity(
    const TSYUserIdentityRef& userIdentity) {
  TSY_INVARIANT(userIdentity != nullptr);
  const platform::MutexLock lock(lock_);
  std::unique_ptr<TSYPerUserConfiguration>& configuration =
      perUserConfigurations_[userIdentity->identifier()];
  if (configuration == nullptr) {
    configuration = std::make_unique<TSYPerUserConfiguration>(userIdentity);
  }
  return *configuration;
}

const std::vector<std::string>& TSYGlobalConfiguration::appUserDataItemNames() const {
  static const std::vector<std::string> names = {"Documents", "Library", "tmp", "StoreKit"};
  return names;
}

const std::vector<std::string>& TSYGlobalConfiguration::excludedFromAppUserData() const {
  static const std::vector<std::string> names = {"SystemData"};
  return names;
}

bool TSYGlobalConfiguration::migrationFileExistsWithName(const std::string& name) {
  return TSYFileManager::defaultManager().itemExistsAtURL(libraryDirectory().appending(name));
}
