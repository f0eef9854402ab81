// The library's own, not for its users: the numbers of the commands, and how a reply is read.
#pragma once

#include <cstdint>
#include <expected>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "Client/Client.h"
#include "Platform/ipc/Message.h"

namespace tessary {

enum Command : uint64_t {
  kCreateOrLookup = 0,
  kContainersOfClass = 1,
  kReplaceContainer = 2,
  kStageForDelete = 3,
  kEmptyDeathRow = 4,
  kSetInfoValue = 5,
  kGetInfoValue = 6,
  kGetMetadata = 7,
  kRecreateStructure = 8,
  kRegenerateUUID = 9,
  kDeleteContainer = 10,
  kWipePluginData = 11,
  kDeleteDataContent = 12,
  kGroupContainersForOwner = 13,
  kGroupIdentifiersForOwner = 14,
  kSystemContainerPath = 15,
  kSystemGroupContainersForOwner = 16,
  kSystemGroupContainerPath = 17,
  kRegisterCodeSigningInfo = 18,
  kGetCodeSigningInfo = 19,
  kInvalidateCodeSigningInfo = 20,
  kDiskUsage = 23,
  kStageSharedContent = 26,
  kRetired = 27,
  kUserManagedAssetsPath = 28,
  kDeleteUserManagedAsset = 29,
  kPersonaList = 32,
};

// The reply lacks what the command promises.
std::unexpected<Error> missing(std::string_view key);

std::optional<std::string> optionalString(const platform::ipc::Message& reply,
                                          std::string_view key);
// The strings of an array; none when there is no array or something else is in it.
std::optional<std::vector<std::string>> strings(const platform::ipc::Message& reply,
                                                std::string_view key);

}  // namespace tessary
