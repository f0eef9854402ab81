// Repairs of owners, modes and access-control lists, over whole trees and item by item.
#include <sys/stat.h>

#include <chrono>
#include <thread>

#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYLog.h"
#include "Daemon/TSYMetadata.h"
#include "Platform/fs/AccessControl.h"
#include "Platform/os/Platform.h"
#include "Platform/os/Signpost.h"

namespace {

using platform::ACLFailure;
using platform::ACLShape;
using platform::Errno;
using platform::FileSystem;

constexpr mode_t kPermissionBits = 07777;
constexpr mode_t kDirectoryMode = 0755;
constexpr mode_t kExecutableMode = 0755;
constexpr mode_t kFileMode = 0644;
// Who keeps the bits of a system container's owner when nothing is owned by "nobody".
constexpr mode_t kUnprivilegedMode = 0770;

FileSystem& files() {
  return platform::Platform::current().files;
}

// Walks a tree for a repair. Each item is visited once, a directory before its contents, and items
// of the metadata file's name are left out.
TSYResult<void> traverseDirectory(const TSYURL& url,
                                  const std::function<void(const FileSystem::WalkEntry&)>& repair) {
  uint64_t entries = 0;
  TSY_SIGNPOST_BEGIN(TraversingDirectory, &entries, url.path().c_str());
  const auto walked = files().walk(url.path(), [&](const FileSystem::WalkEntry& entry) {
    ++entries;
    if (entry.visit != FileSystem::Visit::directoryAfter &&
        entry.path.find(kTSYMetadataFileName) == std::string::npos) {
      repair(entry);
    }
    return true;
  });
  TSY_SIGNPOST_END(TraversingDirectory, &entries, entries);
  if (walked) return {};
  return TSYFailure(TSYPosixErrorCreate(walked.error(), "Error for path {}: {}", url.path(),
                                        walked.error().message()));
}

void changeOwner(int parent, const std::string& name, const std::string& path, uid_t uid,
                 gid_t gid) {
  const auto changed = files().setOwnerAt(parent, name, uid, gid);
  if (changed) return;
  TSYLogWrite(TSYLogLevelError, "Could not chown {}: {}", path, changed.error().message());
}

void changeMode(int parent, const std::string& name, const std::string& path, mode_t mode) {
  const auto changed = files().setModeAt(parent, name, mode);
  if (changed) return;
  TSYLogWrite(TSYLogLevelError, "Could not chmod {}: {}", path, changed.error().message());
}

mode_t standardMode(mode_t mode) {
  if (S_ISDIR(mode)) return kDirectoryMode;
  return (mode & (S_IXUSR | S_IXGRP | S_IXOTH)) != 0 ? kExecutableMode : kFileMode;
}

// A symbolic link has an owner, but no mode of its own.
void standardizeOwnership(int parent, const std::string& name, const std::string& path,
                          const struct stat& status, uid_t uid, gid_t gid) {
  if (status.st_uid != uid || status.st_gid != gid) changeOwner(parent, name, path, uid, gid);
  if (S_ISLNK(status.st_mode)) return;
  const mode_t mode = standardMode(status.st_mode);
  if ((status.st_mode & kPermissionBits) != mode) changeMode(parent, name, path, mode);
}

// A list that could not even be built; none when it could not be set.
std::optional<TSYError> buildingError(const ACLFailure& failure) {
  if (failure.call.empty()) return std::nullopt;
  const std::string reason = failure.error.message();
  if (failure.call == "acl_add_perm") {
    return TSYErrorCreate(TSYErrorACLFailed, std::nullopt, TSYLogIt::yes,
                          "acl_add_perm() failed to set perms {:x}: {}", failure.permissions,
                          reason);
  }
  return TSYErrorCreate(TSYErrorACLFailed, std::nullopt, TSYLogIt::yes, "{}() failed: {}",
                        failure.call, reason);
}

// The group that all lists name.
TSYResult<gid_t> systemUsersGroup() {
  const auto group = platform::Platform::current().accounts.groupNamed(platform::kSystemUsersGroup);
  if (group) return *group;
  return TSYFailure(TSYErrorCreate(TSYErrorACLFailed, std::nullopt, TSYLogIt::yes,
                                   "mbr_identifier_to_uuid() failed: {}", Errno{ENOENT}.message()));
}

// Inside a system container access is granted by the list alone. The order is owner, mode, list:
// a change of mode would narrow what the list grants.
//
// Many may write into one, and change names while it is repaired. So each item is held, and all
// three are done to what is held. A file that has another name as well may be somebody else's that
// was linked here to be opened to all: it is left alone. What was moved here is taken for what is
// meant to be here.
class ACLRepair {
 public:
  ACLRepair(bool isSystemContainer, gid_t group)
      : isSystemContainer_(isSystemContainer), group_(group) {}

  void repair(const FileSystem::WalkEntry& entry) {
    if (entry.isRoot && isSystemContainer_ && S_ISDIR(entry.status.st_mode)) {
      report(platform::setACL(entry.parent, entry.name, ACLShape::topLevelDirectory, group_),
             "top level ACL", entry.path);
      return;
    }
    const auto item = hold(entry.parent, entry.name);
    struct stat status{};
    if (!item || ::fstat(item->get(), &status) != 0) {
      const Errno error = item ? Errno{errno} : item.error();
      TSYLogWrite(TSYLogLevelError, "Could not open {} to repair it: {}", entry.path,
                  error.message());
      return;
    }
    repair(item->get(), status.st_mode, entry.path);
  }

 private:
  void repair(int item, mode_t mode, const std::string& path) const {
    const auto owned = files().setOwner(item, platform::kNobodyAccount, platform::kNobodyAccount);
    if (!owned) {
      TSYLogWrite(TSYLogLevelError, "Could not chown {}: {}", path, owned.error().message());
    }
    if (S_ISLNK(mode)) return;
    setMode(item, 0, path);
    report(platform::setACL(item, S_ISDIR(mode) ? ACLShape::directory : ACLShape::file, group_),
           "ACL", path);
    if (files().privilege() == platform::Privilege::none) setMode(item, kUnprivilegedMode, path);
  }

  static void setMode(int item, mode_t mode, const std::string& path) {
    const auto changed = files().setMode(item, mode);
    if (changed) return;
    TSYLogWrite(TSYLogLevelError, "Could not chmod {}: {}", path, changed.error().message());
  }

  static void report(const platform::ACLResult<void>& applied, std::string_view list,
                     const std::string& path) {
    if (applied) return;
    // One that could not be built is logged there.
    if (buildingError(applied.error())) return;
    TSYLogWrite(TSYLogLevelError, "Failed to set {} on dir {}: {}", list, path,
                applied.error().error.message());
  }

  // What was changed just now has to rest for a tick of the clock. Somebody who goes on changing
  // things is not waited for without end.
  platform::Result<platform::FileDescriptor> hold(int parent, const std::string& name) {
    constexpr int kWaitsForOne = 8;
    constexpr int kWaitsForAll = 64;
    constexpr std::chrono::milliseconds kWait{2};
    for (int wait = 0;; ++wait) {
      auto item = files().holdOnlyName(parent, name);
      if (item || item.error() != Errno{EAGAIN}) return item;
      if (wait == kWaitsForOne || waits_ == kWaitsForAll) return item;
      ++waits_;
      std::this_thread::sleep_for(kWait);
    }
  }

  const bool isSystemContainer_;
  const gid_t group_;
  int waits_ = 0;
};

}  // namespace

TSYResult<void> TSYFileManager::standardizeOwnershipAtURL(const TSYURL& url, uid_t toUID,
                                                          gid_t toGID) {
  auto traversed = traverseDirectory(url, [&](const FileSystem::WalkEntry& entry) {
    standardizeOwnership(entry.parent, entry.name, entry.path, entry.status, toUID, toGID);
  });
  if (!traversed) return traversed;
  const auto place = files().locate(url.path());
  const auto status = files().status(url.path());
  if (!place || !status) {
    const Errno error = place ? status.error() : place.error();
    return TSYFailure(
        TSYPosixErrorCreate(error, "Could not stat {}: {}", url.path(), error.message()));
  }
  standardizeOwnership(place->parent.get(), place->name, url.path(), *status, toUID, toGID);
  return {};
}

TSYResult<void> TSYFileManager::setTopLevelSystemContainerACLAtURL(const TSYURL& url) {
  const auto group = systemUsersGroup();
  if (!group) return TSYFailure(group.error());
  ACLFailure failure;
  const auto place = files().locate(url.path());
  if (place) {
    const auto set =
        platform::setACL(place->parent.get(), place->name, ACLShape::topLevelDirectory, *group);
    if (set) return {};
    failure = set.error();
  } else {
    failure.error = place.error();
  }
  if (const auto error = buildingError(failure)) return TSYFailure(*error);
  return TSYFailure(TSYErrorCreate(TSYErrorACLFailed, std::nullopt, TSYLogIt::yes,
                                   "Failed to set ACL on {}: {}", url.path(),
                                   failure.error.message()));
}

TSYResult<void> TSYFileManager::standardizeACLsAtURL(const TSYURL& url, bool isSystemContainer) {
  const auto group = systemUsersGroup();
  if (!group) return TSYFailure(group.error());
  ACLRepair repair(isSystemContainer, *group);
  return traverseDirectory(url, [&](const FileSystem::WalkEntry& entry) { repair.repair(entry); });
}

TSYResult<void> TSYFileManager::standardizeACLsForSystemContainerAtURL(const TSYURL& url) {
  return standardizeACLsAtURL(url, /*isSystemContainer=*/true);
}

TSYResult<void> TSYFileManager::standardizeAllSystemContainerACLsAtURL(
    const TSYURL& classDirectory) {
  const auto items = urlsForItemsInDirectoryAtURL(classDirectory);
  if (!items) {
    if (items.error().isPosix(ENOENT)) return {};
    TSYLogWrite(TSYLogLevelError, "Failed to get items at URL{} : {}", classDirectory.path(),
                items.error());
    return TSYFailure(items.error());
  }
  if (items->empty()) return {};
  std::string list;
  for (const TSYURL& item : *items) {
    if (!list.empty()) list += ", ";
    list += item.path();
  }
  TSYLogWrite(TSYLogLevelNotice, "Potential containers requiring ACL migration: {}", list);
  TSYResult<void> result;
  for (const TSYURL& item : *items) {
    auto standardized = standardizeACLsForSystemContainerAtURL(item);
    if (standardized) continue;
    TSYLogWrite(TSYLogLevelError, "Failed to set system container ACL at {}: {}", item.path(),
                standardized.error());
    result = std::move(standardized);
  }
  return result;
}
