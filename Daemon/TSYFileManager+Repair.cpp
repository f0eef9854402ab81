// Repairs of owners, modes and access-control lists, over whole trees and item by item.
#include <sys/stat.h>

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
class ACLRepair {
 public:
  ACLRepair(bool isSystemContainer, gid_t group)
      : isSystemContainer_(isSystemContainer), group_(group) {}

  void repair(const FileSystem::WalkEntry& entry) const {
    if (entry.isRoot && isSystemContainer_ && S_ISDIR(entry.status.st_mode)) {
      set(entry, ACLShape::topLevelDirectory);
      return;
    }
    changeOwner(entry.parent, entry.name, entry.path, platform::kNobodyAccount,
                platform::kNobodyAccount);
    if (S_ISLNK(entry.status.st_mode)) return;
    changeMode(entry.parent, entry.name, entry.path, 0);
    set(entry, S_ISDIR(entry.status.st_mode) ? ACLShape::directory : ACLShape::file);
    if (files().privilege() == platform::Privilege::none) {
      changeMode(entry.parent, entry.name, entry.path, kUnprivilegedMode);
    }
  }

 private:
  void set(const FileSystem::WalkEntry& entry, ACLShape shape) const {
    const auto applied = platform::setACL(entry.parent, entry.name, shape, group_);
    if (applied) return;
    if (buildingError(applied.error())) return;  // logged
    const std::string reason = applied.error().error.message();
    if (shape == ACLShape::topLevelDirectory) {
      TSYLogWrite(TSYLogLevelError, "Failed to set top level ACL on dir {}: {}", entry.path,
                  reason);
    } else {
      TSYLogWrite(TSYLogLevelError, "Failed to set ACL on dir {}: {}", entry.path, reason);
    }
  }

  const bool isSystemContainer_;
  const gid_t group_;
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
  const ACLRepair repair(isSystemContainer, *group);
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
