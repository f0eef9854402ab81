// Where the directories of one user identity are. See TSYGlobalConfiguration. Any thread.
#pragma once

#include <optional>
#include <source_location>
#include <string_view>

#include "Daemon/TSYContainerClass.h"
#include "Daemon/TSYURL.h"
#include "Daemon/TSYUserIdentity.h"

class TSYPerUserConfiguration {
 public:
  explicit TSYPerUserConfiguration(TSYUserIdentityRef userIdentity);

  const TSYUserIdentityRef& userIdentity() const { return userIdentity_; }
  // Whether the home exists. Creates nothing.
  bool existsUserBaseDirectory() const;

  // None of these exists for an identity without a home. Those of the first group are made, 0755
  // and the user's own, by every call; the others are not.
  std::optional<TSYURL> userBaseDirectory();
  std::optional<TSYURL> transientDirectory();
  std::optional<TSYURL> stagingDirectory();
  std::optional<TSYURL> libraryDirectory();
  std::optional<TSYURL> containerDirectoryURLForContentClass(TSYContainerClass contentClass,
                                                             bool transient);

  std::optional<TSYURL> userHomeDirectory() const { return home_; }
  std::optional<TSYURL> systemContainerBackupBaseDirectory() const {
    return systemContainerBackupBase_;
  }
  std::optional<TSYURL> systemContainerBackupDirectory() const;
  std::optional<TSYURL> systemGroupContainerBackupDirectory() const;
  std::optional<TSYURL> oldLoggingPath() const;

 private:
  // Makes the directory as the user's own; nothing without a home.
  void make(const std::optional<TSYURL>& url, std::string_view kind,
            std::source_location where = std::source_location::current()) const;

  const TSYUserIdentityRef userIdentity_;
  const std::optional<TSYURL> home_;
  const std::optional<TSYURL> base_;
  const std::optional<TSYURL> transient_;
  const std::optional<TSYURL> staging_;
  const std::optional<TSYURL> library_;
  const std::optional<TSYURL> systemContainerBackupBase_;
};
