// The two containers of a replace while they change places.
//
// run() takes the old one aside, into staging, and puts the new one at the destination, on disk and
// in the cache; undo() puts both back. The object is used by one thread, which holds the
// all-identifiers write lock.
#pragma once

#include <optional>

#include "Daemon/TSYError.h"
#include "Daemon/TSYMetadata.h"

class TSYContainerExchange {
 public:
  // `old` is null when the new container only becomes a regular one. With `uuidToKeep` the new one
  // gets that UUID before it is seen at the destination.
  TSYContainerExchange(TSYMetadataRef old, TSYMetadataRef replacement,
                       std::optional<platform::UUID> uuidToKeep, TSYURL staging,
                       TSYURL destination);
  // When an exception passes it undoes what was done, and ends the process when it cannot: the
  // journal of the replace is there then.
  ~TSYContainerExchange();
  TSYContainerExchange(const TSYContainerExchange&) = delete;
  TSYContainerExchange& operator=(const TSYContainerExchange&) = delete;

  // Codes 14, 15, 34, 45, 46, and those of the code-signing mapping. After a failure undo() is due.
  TSYResult<void> run();
  // Returns whether all is on the disk as it was. If not, the journal of the replace is still
  // needed: the old container may be in staging.
  bool undo();

 private:
  TSYResult<void> takeOldAside();
  TSYResult<void> putReplacementInPlace();
  TSYResult<void> moveReplacement();
  void takeReplacementBack();
  void reenterReplacement(const TSYURL& url);
  bool restoreUUID();
  bool putOldBack();
  static bool isOnDisk(const TSYURL& url);

  const TSYMetadataRef old_;
  const TSYMetadataRef replacement_;
  const std::optional<platform::UUID> uuidToKeep_;
  const TSYURL staging_;
  const TSYURL destination_;

  // How far it has come.
  bool isOldStaged_ = false;
  bool isOldDropped_ = false;
  bool isUUIDWritten_ = false;
  bool isReplacementMoved_ = false;
  bool isReplacementDropped_ = false;
  bool over_ = false;
};
