// The deferred command that takes containers out of sight: each directory goes to death row, and
// its entry leaves the cache. Emptying death row is somebody else's business.
#pragma once

#include <functional>
#include <memory>
#include <vector>

#include "Daemon/TSYCommandQueue.h"
#include "Daemon/TSYContainerIdentity.h"
#include "Daemon/TSYMetadata.h"

class TSYCommandStageForDelete : public TSYCommand {
 public:
  using OnError = std::function<void(uint64_t code)>;
  using Condition = std::function<bool()>;

  // A concrete identity means that very container, a plain one the regular container of its name;
  // one that is not there is passed over. With useLocking false whoever makes the command holds the
  // all-identifiers write lock when it runs. `onError`, which may be null, is told the code of a
  // command that fails: 46, 40. `isStillWanted`, which may be null, is asked under the lock: what
  // was true when the command was made need not be when it runs.
  TSYCommandStageForDelete(std::vector<TSYContainerIdentityRef> containerIdentities,
                           bool useLocking, OnError onError, Condition isStillWanted = nullptr);
  static std::shared_ptr<TSYCommandStageForDelete> commandForStageForDeleteWithContainerIdentities(
      std::vector<TSYContainerIdentityRef> containerIdentities, bool useLocking, OnError onError,
      Condition isStillWanted = nullptr);

  const std::vector<TSYContainerIdentityRef>& containerIdentities() const {
    return containerIdentities_;
  }
  bool useLocking() const { return useLocking_; }
  const OnError& onError() const { return onError_; }

  uint64_t command() const override { return 3; }
  TSYResult<void> fromQueueExecute(TSYCommandQueue& queue) override;

 private:
  TSYResult<void> stageAll(TSYCommandQueue& queue) const;

  const std::vector<TSYContainerIdentityRef> containerIdentities_;
  const bool useLocking_;
  const OnError onError_;
  const Condition isStillWanted_;
};
