// The only source of directory paths: the daemon's own directories, the global tree, and per user
// identity the directories under its home.
//
// A getter answers the same URL for the life of the process and makes the directory on every call,
// so that one removed behind the daemon's back comes back with the next request. A directory that
// cannot be made is logged and its URL answered all the same: the operation that uses it fails with
// its own error.
//
// All operations may be called from any thread. URLs never change and making a directory that is
// there is success, so the getters need no lock; the one there is guards the per-user objects.
#pragma once

#include <sys/types.h>

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Daemon/TSYContainerClass.h"
#include "Daemon/TSYPerUserConfiguration.h"
#include "Daemon/TSYURL.h"
#include "Daemon/TSYUserIdentity.h"
#include "Platform/base/Mutex.h"

class TSYGlobalConfiguration {
 public:
  static TSYGlobalConfiguration& sharedInstance();

  TSYURL sharedContainersDirectory();
  TSYURL logDirectory();
  TSYURL cachesDirectory();
  TSYURL libraryDirectory();
  TSYURL transientDirectory();
  TSYURL transientBundleDirectory();
  TSYURL stagingDirectory();
  TSYURL deathrowDirectory();
  TSYURL replaceDirectory();
  TSYURL pendingUpdatesDirectory();
  TSYURL bundleDirectory();
  // None when nothing is there.
  std::optional<TSYURL> legacyTransientBundleDirectory();
  // "/tmp" below the root: where death row's leftovers go. Not made.
  TSYURL temporaryDirectory() const;

  // The class directory of a global class, not made; none for any other.
  std::optional<TSYURL> globalContainerBaseURLWithContentClass(TSYContainerClass contentClass,
                                                               bool transient);
  // The class directory of any valid class, made; none for what is no class and for a per-user
  // class of an identity without a home. `userIdentity` may be null for a global class.
  std::optional<TSYURL> containerDirectoryURLForUserIdentity(const TSYUserIdentityRef& userIdentity,
                                                             TSYContainerClass contentClass,
                                                             bool transient);
  // Per-user classes stage under the user's home, all others in the daemon's own caches.
  std::optional<TSYURL> stagingDirectoryURLForUserIdentity(const TSYUserIdentityRef& userIdentity,
                                                           TSYContainerClass contentClass);
  // The same object for equal identities, for the life of the process. The identity must be there.
  TSYPerUserConfiguration& getPerUserConfigurationForUserIdentity(
      const TSYUserIdentityRef& userIdentity);

  // The top-level items of an application's data container that are the application's user data.
  const std::vector<std::string>& appUserDataItemNames() const;
  // The one that is not.
  const std::vector<std::string>& excludedFromAppUserData() const;

  bool migrationFileExistsWithName(const std::string& name);
  bool isInternalImage() const { return isInternalImage_; }
  // The "mobile" account; 0 on a system without it.
  uid_t currentMobileUserId() const { return mobileUserId_; }
  gid_t currentMobileGroupId() const { return mobileGroupId_; }

 private:
  TSYGlobalConfiguration();

  const TSYURL home_;
  const TSYURL sharedContainers_;
  const TSYURL caches_;
  const TSYURL library_;
  const bool isInternalImage_;
  uid_t mobileUserId_ = 0;
  gid_t mobileGroupId_ = 0;
  platform::Mutex lock_;
  // By the identifier of the user identity. Nothing is ever taken out.
  std::map<std::string, std::unique_ptr<TSYPerUserConfiguration>> perUserConfigurations_
      GUARDED_BY(lock_);
};
