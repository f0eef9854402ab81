// One container, as its metadata file describes it.
//
// Every container directory holds a hidden property list that says what the directory is. It is
// the single source of truth about the container: the cache rebuilds its picture of the disk from
// these files, and the reader is strict. A directory whose file does not validate is no container.
//
// TSYMetadata is a value and thousands of them stay in memory, so it keeps the class directory,
// which all containers of a class share, apart from the container's own name. The cache hands out
// TSYMetadataRef snapshots; a change is a copy that is added back.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "Daemon/TSYContainerIdentity.h"
#include "Daemon/TSYError.h"
#include "Daemon/TSYURL.h"
#include "Daemon/TSYUserIdentityCache.h"
#include "Platform/values/UUID.h"
#include "Platform/values/Value.h"

inline constexpr char kTSYMetadataFileName[] = ".com.veltra.tessary.metadata.plist";

class TSYMetadata;
using TSYMetadataRef = std::shared_ptr<const TSYMetadata>;

class TSYMetadata {
 public:
  using Info = std::shared_ptr<const platform::Value::Dictionary>;

  TSYMetadata(const TSYConcreteContainerIdentity& identity, Info info, const TSYURL& url,
              std::optional<std::string> userManagedAssetsDirName);

  // Reads the metadata file inside a container directory and checks it against the identity that
  // is expected to own it and, with checkClassPath, against the directory that it lies in. Code 12
  // when the file cannot be read, 29 when it does not validate. Never repairs a file.
  static TSYResult<TSYMetadata> readAndValidateMetadataAtUrl(
      const TSYURL& containerURL, const TSYUserIdentityRef& forUserIdentity, bool checkClassPath,
      TSYUserIdentityCache& cache = TSYUserIdentitySharedCache::sharedInstance());
  static TSYResult<TSYMetadata> readAndValidateMetadataAtFileUrl(
      const TSYURL& fileURL, const TSYUserIdentityRef& forUserIdentity, bool checkClassPath,
      TSYUserIdentityCache& cache = TSYUserIdentitySharedCache::sharedInstance());

  // Writes a temporary file in the container's staging directory and moves it into place, so that
  // a half-written file is never seen. Code 34.
  TSYResult<void> writeMetadataToDisk() const;
  TSYResult<void> writeMetadataToFileURL(const TSYURL& fileURL) const;

  TSYConcreteContainerIdentity containerIdentity() const;
  const TSYUserIdentityRef& userIdentity() const { return userIdentity_; }
  TSYContainerClass containerClass() const { return containerClass_; }
  const std::string& identifier() const { return identifier_; }
  const platform::UUID& uuid() const { return uuid_; }
  TSYURL url() const;
  TSYURL metadataFileURL() const;
  // May be null.
  const Info& info() const { return info_; }
  const std::optional<std::string>& userManagedAssetsDirName() const { return assetsName_; }
  // Whether the container lives in a transient tree. Not in the file.
  bool transient() const { return transient_; }
  // Whether the container was there before the request. Not in the file.
  bool existed() const { return existed_; }

  void setUUID(const platform::UUID& uuid) { uuid_ = uuid; }
  void setURL(const TSYURL& url);
  // The same for the many containers of one class directory, which share its text.
  void setURL(std::shared_ptr<const std::string> directory, std::string name);
  void setInfo(Info info) { info_ = std::move(info); }
  void setUserManagedAssetsDirName(std::optional<std::string> name) {
    assetsName_ = std::move(name);
  }
  void setTransient(bool transient) { transient_ = transient; }
  void setExisted(bool existed) { existed_ = existed; }

  std::string description() const;

 private:
  platform::Value::Dictionary dictionary() const;

  TSYUserIdentityRef userIdentity_;
  std::string identifier_;
  platform::UUID uuid_;
  std::shared_ptr<const std::string> directory_;
  std::string name_;
  Info info_;
  std::optional<std::string> assetsName_;
  uint8_t containerClass_;
  bool transient_ = false;
  bool existed_ = false;
};
