// Replacing one container by another, so that a crash at any point leaves the old or the new one.
//
// A journal with the four paths is on disk before anything moves. Then the old container goes into
// a staging directory that the journal names, and the new one to the destination, each with one
// rename. So at every point one of three holds: the old path is occupied (nothing has moved, or all
// is done), the destination is occupied (done), or both are empty and the old container is in
// staging, from where the next start puts it back. What fails in between is undone at once.
#include "Daemon/TSYCacheSteps.h"
#include "Daemon/TSYClientConnection.h"
#include "Daemon/TSYContainerCache.h"
#include "Daemon/TSYContainerExchange.h"
#include "Daemon/TSYException.h"
#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYLocks.h"
#include "Daemon/TSYLog.h"
#include "Daemon/TSYMetadataKeys.h"
#include "Daemon/TSYPropertyList.h"
#include "Platform/os/Platform.h"

using platform::UUID;
using platform::Value;

namespace {

constexpr char kOldURLKey[] = "TSYReplaceOperationOldURL";
constexpr char kNewURLKey[] = "TSYReplaceOperationNewURL";
constexpr char kStagingURLKey[] = "TSYReplaceOperationStagingURL";
constexpr char kDestinationURLKey[] = "TSYReplaceOperationDestURL";

TSYResult<void> checkReplace(const TSYConcreteContainerIdentity* old,
                             const TSYConcreteContainerIdentity& replacement,
                             bool preserveOldUUID) {
  if (old == nullptr) {
    if (!preserveOldUUID) return {};
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidObject, std::nullopt, TSYLogIt::yes,
                                     "Can't have a nil oldContainerUUID when preserving the UUID"));
  }
  if (old->containerClass() != replacement.containerClass()) {
    return TSYFailure(TSYErrorCreate(TSYErrorClassMismatch, std::nullopt, TSYLogIt::yes,
                                     "Can't replace containers of different class types: {} and {}",
                                     old->containerClass(), replacement.containerClass()));
  }
  if (!old->userIdentity()->isEqualToUserIdentity(*replacement.userIdentity())) {
    return TSYFailure(TSYErrorCreate(TSYErrorPersonaMismatch, std::nullopt, TSYLogIt::yes,
                                     "Can't replace containers of different personas: {} and {}",
                                     old->userIdentity(), replacement.userIdentity()));
  }
  return {};
}

TSYResult<void> checkDirectories(const TSYMetadata* old, const TSYMetadata& replacement) {
  const TSYURL url = replacement.url();
  if (old != nullptr && old->url() == url) {
    return TSYFailure(TSYErrorCreate(TSYErrorSameContainer, std::nullopt, TSYLogIt::yes,
                                     "Can't replace the same container at {}", url.path()));
  }
  if (!UUID::parse(std::string(url.lastPathComponent()))) {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidPath, std::nullopt, TSYLogIt::yes,
                                     "Invalid URL (last path component not UUID): {}", url.path()));
  }
  return {};
}

// Where a container goes that keeps its directory's name.
TSYResult<TSYURL> freeDestination(const TSYMetadata* old, const TSYMetadata& replacement) {
  const auto directory =
      TSYGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
          replacement.userIdentity(), replacement.containerClass(),
          old != nullptr && old->transient());
  if (!directory) {
    return TSYFailure(TSYErrorCreate(
        TSYErrorReplaceFailed, std::nullopt, TSYLogIt::yes, "Failed to replace: {} with: {} at: {}",
        old == nullptr ? "(null)" : old->url().path(), replacement.url().path(), "(null)"));
  }
  TSYURL destination = directory->appending(replacement.url().lastPathComponent());
  if (!TSYFileManager::defaultManager().itemExistsAtURL(destination)) return destination;
  return TSYFailure(TSYErrorCreate(TSYErrorAlreadyExists, std::nullopt, TSYLogIt::yes,
                                   "Container already exists at {}", destination.path()));
}

// A container that becomes a regular one, or takes another name's place, must be the only one of
// its name.
TSYResult<void> checkNoOtherRegular(const TSYConcreteContainerIdentity& identity) {
  const auto found = TSYContainerCache::sharedInstance().containerForContainerIdentity(
      static_cast<const TSYContainerIdentity&>(identity), /*transient=*/false,
      /*updateSandbox=*/true);
  if (found && (*found)->uuid() == identity.uuid()) return {};
  if (found) {
    return TSYFailure(
        TSYErrorCreate(TSYErrorAlreadyExists, std::nullopt, TSYLogIt::yes,
                       "Container with identifier: {}, class: {}, transient: {:d} already exists",
                       identity.identifier(), identity.containerClass(), false));
  }
  if (!found.error().is(TSYErrorNotFound)) return TSYFailure(found.error());
  return {};
}

// Runs it; what fails is undone.
TSYResult<void> promote(TSYMetadataRef replacement, TSYURL destination) {
  TSYContainerExchange exchange(nullptr, std::move(replacement), std::nullopt, TSYURL(),
                                std::move(destination));
  auto result = exchange.run();
  if (!result) exchange.undo();
  return result;
}

// The UUID in a container's metadata file; null when it cannot be read.
const std::string* uuidIn(const TSYResult<Value::Dictionary>& metadata) {
  if (!metadata) return nullptr;
  const auto found = metadata->find(kTSYMetadataUUID);
  return found == metadata->end() ? nullptr : found->second.asString();
}

// A crash after the new container was given the UUID of the old one, which is back, leaves two of
// that UUID. The new one's own is forgotten: it gets another.
void tellApart(const TSYURL& old, const TSYURL& replacement) {
  const TSYURL file = replacement.appending(kTSYMetadataFileName);
  if (!TSYFileManager::defaultManager().itemExistsAtURL(file)) return;
  auto metadata = TSY_dictionaryWithContentsOfURL(file);
  const auto metadataOfOld = TSY_dictionaryWithContentsOfURL(old.appending(kTSYMetadataFileName));
  const std::string* uuid = uuidIn(metadata);
  const std::string* uuidOfOld = uuidIn(metadataOfOld);
  if (uuid == nullptr || uuidOfOld == nullptr || *uuid != *uuidOfOld) return;
  metadata->insert_or_assign(kTSYMetadataUUID, UUID::random().string());
  const auto written = TSY_writeToURL(*metadata, file, kTSYWriteAtomic | kTSYWriteProtectionNone);
  if (written) return;
  TSYLogWrite(TSYLogLevelError, "Failed to give {} another UUID: {}", file.path(), written.error());
}

// Out of sight, or removed where it is when death row cannot take it.
TSYResult<void> getRidOf(const TSYURL& url, bool startDeletionThread) {
  auto moved = TSYClientConnection::_moveItemAtURLToDeathRow(url, startDeletionThread);
  if (moved) return moved;
  return TSYFileManager::defaultManager().removeItemAtURL(url);
}

// After a replace and one that was undone: what is left in staging is garbage. The journal goes
// whatever becomes of it; with the journal the next start might take it for a lost container.
TSYResult<void> discard(const TSYURL& staging, const TSYURL& journal, bool startDeletionThread) {
  const auto stagingGone = getRidOf(staging, /*startDeletionThread=*/false);
  const auto journalGone = getRidOf(journal, startDeletionThread);
  if (!stagingGone) {
    return TSYFailure(TSYErrorCreate(TSYErrorRemoveFileFailed, stagingGone.error(), TSYLogIt::yes,
                                     "Failed to remove staging dir: {}", staging.path()));
  }
  if (journalGone) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorRemoveFileFailed, journalGone.error(), TSYLogIt::yes,
                                   "Failed to remove replace file: {}", journal.path()));
}

// Whether a file could not be read for reasons that say nothing about what is in it.
bool maySucceedLater(const TSYError& error) {
  const auto& underlying = error.underlying();
  return underlying && (underlying->isPosix(EIO) || underlying->isPosix(EMFILE) ||
                        underlying->isPosix(ENFILE) || underlying->isPosix(ENOMEM));
}

// What a message says of a path.
const std::string& textOf(const TSYURL& url) {
  static const std::string none = "(null)";
  return url.path().empty() ? none : url.path();
}

}  // namespace

uint64_t TSYClientConnection::replaceContainerIdentity(
    const TSYContainerIdentity& old, const TSYConcreteContainerIdentity& replacement,
    bool preserveOldUUID, bool startDeletionThread) {
  const auto replaced = TSYCatchingExceptionsUnlessInternal(
      TSYGlobalConfiguration::sharedInstance().isInternalImage(),
      [&] { return replace(old, replacement, preserveOldUUID, startDeletionThread); });
  return replaced ? uint64_t{TSYErrorSuccess} : replaced.error().clientCode();
}

TSYResult<void> TSYClientConnection::replace(const TSYContainerIdentity& old,
                                             const TSYConcreteContainerIdentity& replacement,
                                             bool preserveOldUUID, bool startDeletionThread) {
  const auto* concreteOld = TSYConcreteContainerIdentity::orNull(old);
  if (auto valid = checkReplace(concreteOld, replacement, preserveOldUUID); !valid) return valid;
  const TSYAllIdentifiersLock lock(TSYLockMode::writing, /*useLocking=*/true);
  TSYMetadataRef oldContainer;
  if (concreteOld != nullptr) {
    auto found = TSYFindContainer(*concreteOld);
    if (!found) return TSYFailure(std::move(found.error()));
    oldContainer = std::move(*found);
  }
  const auto newContainer = TSYFindContainer(replacement);
  if (!newContainer) return TSYFailure(newContainer.error());
  if (auto valid = checkDirectories(oldContainer.get(), **newContainer); !valid) return valid;
  const auto destination = preserveOldUUID ? TSYResult<TSYURL>(oldContainer->url())
                                           : freeDestination(oldContainer.get(), **newContainer);
  if (!destination) return TSYFailure(destination.error());
  const bool takesNewName =
      !oldContainer ||
      (!oldContainer->transient() && oldContainer->identifier() != replacement.identifier());
  if (takesNewName) {
    if (auto valid = checkNoOtherRegular(replacement); !valid) return valid;
  }
  if (!oldContainer) return promote(*newContainer, *destination);
  return replaceJournalled(oldContainer, *newContainer, *destination, preserveOldUUID,
                           startDeletionThread);
}

TSYResult<void> TSYClientConnection::replaceJournalled(const TSYMetadataRef& old,
                                                       const TSYMetadataRef& replacement,
                                                       const TSYURL& destination,
                                                       bool preserveOldUUID,
                                                       bool startDeletionThread) {
  TSYGlobalConfiguration& configuration = TSYGlobalConfiguration::sharedInstance();
  const std::string operation = UUID::random().string();
  const TSYURL journal = configuration.replaceDirectory().appending(operation + ".plist");
  const auto stagingDirectory = configuration.stagingDirectoryURLForUserIdentity(
      replacement->userIdentity(), replacement->containerClass());
  const TSYURL staging = stagingDirectory ? stagingDirectory->appending(operation) : TSYURL();

  auto result =
      _writeToDiskReplaceAt(journal, {old->url(), replacement->url(), staging, destination});
  if (result) {
    TSYContainerExchange exchange(old, replacement,
                                  preserveOldUUID ? std::optional(old->uuid()) : std::nullopt,
                                  staging, destination);
    result = exchange.run();
    // The journal stays: the next start does what could not be done now.
    if (!result && !exchange.undo()) return result;
  } else {
    TSYLogWrite(TSYLogLevelError, "Failed to write replace file: {}", journal.path());
  }
  auto discarded = discard(staging, journal, startDeletionThread);
  return result ? std::move(discarded) : std::move(result);
}

Value::Dictionary TSYClientConnection::dictionaryOf(const ReplaceURLs& urls) {
  return {{kOldURLKey, urls.old.path()},
          {kNewURLKey, urls.replacement.path()},
          {kStagingURLKey, urls.staging.path()},
          {kDestinationURLKey, urls.destination.path()}};
}

TSYResult<void> TSYClientConnection::_writeToDiskReplaceAt(const TSYURL& journal,
                                                           const ReplaceURLs& urls) {
  const auto& [old, replacement, staging, destination] = urls;
  for (const TSYURL& url : {old, replacement, staging, destination}) {
    if (!url.path().empty()) continue;
    return TSYFailure(
        TSYErrorCreate(TSYErrorInvalidReplaceInfo, std::nullopt, TSYLogIt::yes,
                       "Invalid Replace File Info: old: {}, new: {}, staging: {}, dest: {}",
                       textOf(old), textOf(replacement), textOf(staging), textOf(destination)));
  }
  auto written =
      TSY_writeToURL(dictionaryOf(urls), journal, kTSYWriteAtomic | kTSYWriteProtectionNone);
  if (written) written = TSYFileManager::defaultManager().syncDirectoryOfItemAtURL(journal);
  if (written) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorWriteFailed, written.error(), TSYLogIt::yes,
                                   "Failed to write replace dictionary to URL {}", journal.path()));
}

TSYResult<TSYClientConnection::ReplaceURLs> TSYClientConnection::_readAndValidateReplaceFileAtUrl(
    const TSYURL& journal) {
  const auto dictionary = TSY_dictionaryWithContentsOfURL(journal);
  if (!dictionary) {
    return TSYFailure(TSYErrorCreate(TSYErrorReplaceFileInvalid, dictionary.error(), TSYLogIt::yes,
                                     "Failed to read replace file at URL {}", journal.path()));
  }
  std::vector<const Value*> found;
  std::vector<std::string> shown;
  for (const char* key : {kOldURLKey, kNewURLKey, kStagingURLKey, kDestinationURLKey}) {
    const auto place = dictionary->find(key);
    found.push_back(place == dictionary->end() ? nullptr : &place->second);
    shown.push_back(found.back() == nullptr ? "(null)" : found.back()->description());
  }
  std::vector<TSYURL> urls;
  for (const Value* value : found) {
    if (value != nullptr && value->asString() != nullptr) urls.emplace_back(*value->asString());
  }
  if (urls.size() != found.size()) {
    return TSYFailure(
        TSYErrorCreate(TSYErrorReplaceFileInvalid, std::nullopt, TSYLogIt::yes,
                       "Invalid replace data: Old: {}, New: {}, Staging: {}, Dest: {}", shown[0],
                       shown[1], shown[2], shown[3]));
  }
  return ReplaceURLs{urls[0], urls[1], urls[2], urls[3]};
}

// One that cannot be repaired does not keep the others from it.
TSYResult<void> TSYClientConnection::_recoverFromReplaceOperations() {
  const TSYURL directory = TSYGlobalConfiguration::sharedInstance().replaceDirectory();
  TSYFileManager::defaultManager().removeTemporaryFilesInDirectoryAtURL(directory);
  const auto journals = TSYFileManager::defaultManager().urlsForItemsInDirectoryAtURL(directory);
  if (!journals) {
    if (!journals.error().isPosix(ENOENT)) {
      TSYLogWrite(TSYLogLevelError, "Failed to get items at replace URL {} : {}", directory.path(),
                  journals.error());
    }
    return {};
  }
  TSYResult<void> result;
  for (const TSYURL& journal : *journals) {
    auto recovered = recoverFromReplaceOperation(journal);
    if (!recovered && result) result = std::move(recovered);
  }
  return result;
}

TSYResult<void> TSYClientConnection::recoverFromReplaceOperation(const TSYURL& journal) {
  const auto urls = _readAndValidateReplaceFileAtUrl(journal);
  if (!urls && maySucceedLater(urls.error())) return TSYFailure(urls.error());
  if (urls) {
    TSYLogWrite(TSYLogLevelDebug, "Doing a replace of {} with info: {}", journal.path(),
                Value(dictionaryOf(*urls)).description());
    if (auto repaired = repairReplace(*urls); !repaired) return repaired;
  }
  const auto discarded = _moveItemAtURLToDeathRow(journal, /*startDeletionThread=*/false);
  if (discarded) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorRemoveFileFailed, discarded.error(), TSYLogIt::yes,
                                   "Failed to remove replace file at {}", journal.path()));
}

TSYResult<void> TSYClientConnection::repairReplace(const ReplaceURLs& urls) {
  TSYFileManager& files = TSYFileManager::defaultManager();
  // What cannot be told is a reason to try: the rename fails where anything but an empty directory
  // stands, and a failure leaves the journal for the next start.
  const bool mayBeAside = !files.itemExistsAtURL(urls.old) &&
                          !files.itemExistsAtURL(urls.destination) &&
                          !files.itemDoesNotExistAtURL(urls.staging);
  if (mayBeAside) {
    TSYLogWrite(TSYLogLevelDebug, "Recovering from failed replace by moving: {} to {}",
                urls.staging.path(), urls.old.path());
    auto moved = files.renameItemAtURL(urls.staging, urls.old);
    if (moved) moved = files.syncDirectoryOfItemAtURL(urls.old);
    if (!moved) {
      return TSYFailure(TSYErrorCreate(TSYErrorReplaceFileInvalid, moved.error(), TSYLogIt::yes,
                                       "Failed to recover replace move: {} to {}",
                                       urls.staging.path(), urls.old.path()));
    }
  }
  if (urls.destination == urls.old) tellApart(urls.old, urls.replacement);
  return {};
}
