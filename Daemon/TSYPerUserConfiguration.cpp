#include "Daemon/TSYPerUserConfiguration.h"

#include "Daemon/TSYConfigurationDirectory.h"
#include "Daemon/TSYLog.h"

namespace {

std::optional<TSYURL> below(const std::optional<TSYURL>& base, std::string_view relativePath) {
  if (!base) return std::nullopt;
  return base->appending(relativePath);
}

}  // namespace

TSYPerUserConfiguration::TSYPerUserConfiguration(TSYUserIdentityRef userIdentity)
    : userIdentity_(std::move(userIdentity)),
      home_(userIdentity_->homeDirectoryURL()),
      base_(below(home_, "Containers")),
      transient_(below(base_, "Temp")),
      staging_(below(base_, "Staging")),
      library_(below(home_, "Library/Tessary")),
      systemContainerBackupBase_(below(home_, "Library/Backup/SystemContainers")) {
  if (!home_) {
    TSYSystemLogWrite(TSYChannel::unspecified, platform::LogLevel::fault,
                      "Home directory cannot be nil: {}", userIdentity_);
  }
}

void TSYPerUserConfiguration::make(const std::optional<TSYURL>& url, std::string_view kind,
                                   std::source_location where) const {
  if (!url) return;
  TSYMakeConfigurationDirectory(*url, {.kind = kind, .owner = userIdentity_->posixUID()}, where);
}

bool TSYPerUserConfiguration::existsUserBaseDirectory() const {
  return home_ && TSYFileManager::defaultManager().itemExistsAtURL(*home_);
}

std::optional<TSYURL> TSYPerUserConfiguration::userBaseDirectory() {
  make(base_, "user base dir");
  return base_;
}

std::optional<TSYURL> TSYPerUserConfiguration::transientDirectory() {
  make(transient_, "transient dir");
  return transient_;
}

std::optional<TSYURL> TSYPerUserConfiguration::stagingDirectory() {
  make(staging_, "staging dir");
  return staging_;
}

std::optional<TSYURL> TSYPerUserConfiguration::libraryDirectory() {
  make(library_, "user library dir");
  return library_;
}

std::optional<TSYURL> TSYPerUserConfiguration::containerDirectoryURLForContentClass(
    TSYContainerClass contentClass, bool transient) {
  if (!TSYIsPerUserClass(contentClass)) {
    TSYLogWrite(TSYLogLevelError, "Invalid class for a per user container directory: {}",
                contentClass);
    return std::nullopt;
  }
  const std::optional<TSYURL> base = transient ? transientDirectory() : userBaseDirectory();
  const std::optional<TSYURL> url = below(base, TSYContainerClassDirectory(contentClass));
  make(url, "container dir");
  return url;
}

std::optional<TSYURL> TSYPerUserConfiguration::systemContainerBackupDirectory() const {
  return below(systemContainerBackupBase_, "Data");
}

std::optional<TSYURL> TSYPerUserConfiguration::systemGroupContainerBackupDirectory() const {
  return below(systemContainerBackupBase_, "Shared");
}

std::optional<TSYURL> TSYPerUserConfiguration::oldLoggingPath() const {
  return below(home_, "Library/Logs/Tessary");
}
