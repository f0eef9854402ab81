// The daemon's one layer over the file system: every directory that it creates, every container
// that it moves or removes, every repair of owners and access-control lists.
//
// It turns what platform::FileSystem does into the system's own operations, with their messages.
// It also holds the two checks that security rests on: the access-control lists of system
// containers, and whether a path that a client gave really lies inside a container.
//
// Failures are POSIX errors (TSYPosixErrorDomain). The object holds no state: any thread may call
// any operation, and putting work on one container in order is the caller's business.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "Daemon/TSYError.h"
#include "Daemon/TSYURL.h"
#include "Platform/base/FileDescriptor.h"

class TSYFileManager {
 public:
  static constexpr int kUnchangedProtectionClass = -1;
  static constexpr uid_t kUnchangedOwner = 0;

  static TSYFileManager& defaultManager();

  // Creates a directory; one that is there already is success. `owner` is used as uid and gid, 0
  // leaves them; class -1 leaves the protection class. Owner and class are set on a directory that
  // was there too, the mode is not.
  TSYResult<void> createDirectoryAtURL(const TSYURL& url, bool withIntermediateDirectories,
                                       mode_t mode, uid_t owner, int protectionClass);
  TSYResult<void> createDirectoryAtURL(const TSYURL& url, bool withIntermediateDirectories,
                                       mode_t mode);

  // A missing source is an error in the first two, success in the other two.
  TSYResult<void> copyItemAtURL(const TSYURL& source, const TSYURL& destination);
  TSYResult<void> moveItemAtURL(const TSYURL& source, const TSYURL& destination);
  TSYResult<void> copyItemIfExistsAtURL(const TSYURL& source, const TSYURL& destination);
  TSYResult<void> moveItemIfExistsAtURL(const TSYURL& source, const TSYURL& destination);
  // A move that never copies: what is only being got rid of stays where it is rather than be copied
  // to another file system (EXDEV).
  TSYResult<void> renameItemAtURL(const TSYURL& source, const TSYURL& destination);

  // Removes a whole tree, past every item that resists; the first error is the result. A missing
  // item is success.
  TSYResult<void> removeItemAtURL(const TSYURL& url);

  // What has been renamed into the item's directory stays there after a power cut.
  TSYResult<void> syncDirectoryOfItemAtURL(const TSYURL& url);
  // Removes what writes that were cut short have left in a directory that nobody is writing into.
  // Failures are logged.
  void removeTemporaryFilesInDirectoryAtURL(const TSYURL& url);

  // A new, uniquely named directory in `parent`.
  TSYResult<TSYURL> createTemporaryDirectoryInDirectoryURL(const TSYURL& parent,
                                                           const std::string& prefix = "temp.");
  // The same where others may write too, held open: what is done through the descriptor is done to
  // the new directory and to nothing else.
  struct OpenDirectory {
    TSYURL url;
    platform::FileDescriptor descriptor;
  };
  TSYResult<OpenDirectory> createOpenTemporaryDirectoryInDirectoryURL(const TSYURL& parent,
                                                                      const std::string& prefix);

  // The items of a directory without those whose names begin with a dot. A missing directory fails
  // with ENOENT and without a log line.
  TSYResult<std::vector<TSYURL>> urlsForItemsInDirectoryAtURL(const TSYURL& directory);

  bool itemExistsAtURL(const TSYURL& url);
  bool itemDoesNotExistAtURL(const TSYURL& url);
  // Whether a directory is there, with no link on the way. Fails (logged) when it cannot be told.
  TSYResult<bool> directoryExistsAtURL(const TSYURL& url);

  TSYResult<int> dataProtectionClassOfItemAtURL(const TSYURL& url);
  // With a predicate the class changes only when it agrees to the current one.
  using ClassPredicate = std::function<bool(int currentClass)>;
  TSYResult<void> setDataProtectionClassOfItemAtURL(const TSYURL& url, int toClass,
                                                    const ClassPredicate& ifPredicate = nullptr);

  // Gives every item but the metadata file this owner, directories mode 0755, other items 0755 when
  // any execute bit was set, else 0644. Single failures are logged.
  TSYResult<void> standardizeOwnershipAtURL(const TSYURL& url, uid_t toUID, gid_t toGID);

  TSYResult<void> setTopLevelSystemContainerACLAtURL(const TSYURL& url);
  TSYResult<void> standardizeACLsAtURL(const TSYURL& url, bool isSystemContainer);
  TSYResult<void> standardizeACLsForSystemContainerAtURL(const TSYURL& url);
  TSYResult<void> standardizeAllSystemContainerACLsAtURL(const TSYURL& classDirectory);

  // Allocated bytes of a tree; 0 when unknown.
  uint64_t fastDiskUsageForURL(const TSYURL& url);
  uint64_t diskUsageForURL(const TSYURL& url);

  // The resolved form of `suspicious` when it stays inside `base`, which both may not exist in
  // full; none otherwise, with a log line that says why.
  std::optional<TSYURL> realPathForURL(const TSYURL& suspicious, const TSYURL& ifChildOfURL);

  // realpath(3): every link followed, wherever it leads. Good for comparing only.
  TSYResult<TSYURL> realPathOfItemAtURL(const TSYURL& url);

  // The home of an account, resolved; "/private/var/mobile" (below the root) when it has none.
  static TSYURL homeDirectoryURLForPOSIXUID(uid_t uid);

  // Logs the tree, for diagnosis.
  void printDirectoryStructureAtURL(const TSYURL& url);

 private:
  TSYFileManager() = default;
};
