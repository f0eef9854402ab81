// The short names of the daemon's codes, and what they mean.
#include <algorithm>
#include <array>
#include <string_view>

#include "Client/Client.h"

namespace tessary {
namespace {

struct Meaning {
  uint64_t code;
  std::string_view name;
  std::string_view message;
};

constexpr auto kMeanings = std::to_array<Meaning>({
    {1, "TSYErrorSuccess", "success"},
    {4, "TSYErrorMoveToTempFailed", "a directory could not be moved aside"},
    {5, "TSYErrorTransientRemoveFailed", "the transient container could not be removed"},
    {6, "TSYErrorCreateDirectoryFailed", "a directory of the container could not be created"},
    {7, "TSYErrorStagingCreateFailed", "the staging directory could not be created"},
    {8, "TSYErrorStagingMoveFailed", "the container could not be moved into place"},
    {9, "TSYErrorStagingRemoveFailed", "the staging directory could not be removed"},
    {10, "TSYErrorInvalidPath", "a path is not where it must be"},
    {11, "TSYErrorInvalidObject", "an object is missing or malformed"},
    {12, "TSYErrorReadFailed", "a file could not be read"},
    {14, "TSYErrorReplaceStageOldFailed", "the old container could not be moved to staging"},
    {15, "TSYErrorReplaceFailed", "the container could not be replaced"},
    {17, "TSYErrorDestroyFailed", "an item could not be destroyed"},
    {18, "TSYErrorMissingIdentifier", "no identifier"},
    {20, "TSYErrorUnexpectedContainerType", "no such container class"},
    {21, "TSYErrorNotFound", "not found"},
    {22, "TSYErrorSameContainer", "a container cannot replace itself"},
    {23, "TSYErrorClassMismatch", "the containers are of different classes"},
    {24, "TSYErrorInfoValueNotFound", "no such info value"},
    {27, "TSYErrorAlreadyExists", "it exists already"},
    {28, "TSYErrorDeleteFailed", "the container could not be deleted"},
    {29, "TSYErrorInvalidMetadata", "the metadata is invalid"},
    {33, "TSYErrorInvalidReplaceInfo", "the replace journal is incomplete"},
    {34, "TSYErrorWriteFailed", "a file could not be written"},
    {35, "TSYErrorReplaceFileInvalid", "the replace journal is invalid"},
    {36, "TSYErrorRemoveFileFailed", "a file could not be removed"},
    {38, "TSYErrorInvalidArgument", "an argument is invalid"},
    {40, "TSYErrorException", "internal error"},
    {41, "TSYErrorFileOperationFailed", "a file operation failed"},
    {43, "TSYErrorCacheRebuildFailed", "the container directory could not be read"},
    {44, "TSYErrorCacheInconsistent", "the container has gone from the disk"},
    {45, "TSYErrorCacheAddFailed", "the container could not be entered into the cache"},
    {46, "TSYErrorCacheRemoveFailed", "the container could not be removed from the cache"},
    {47, "TSYErrorCacheInvalidInput", "invalid input to the cache"},
    {48, "TSYErrorUUIDMoveFailed", "the directory could not be renamed"},
    {49, "TSYErrorInvalidCommand", "no such command"},
    {55, "TSYErrorNotEntitled", "not entitled"},
    {60, "TSYErrorCountMismatch", "the lists are of different lengths"},
    {61, "TSYErrorLockedNoRetry", "the device is locked"},
    {62, "TSYErrorChownFailed", "the owner could not be changed"},
    {63, "TSYErrorACLFailed", "the access-control list could not be set"},
    {64, "TSYErrorStageSharedContentFailed", "shared content could not be staged"},
    {66, "TSYErrorDatabase", "database failure"},
    {67, "TSYErrorNotFoundInDatabase", "not found in the database"},
    {68, "TSYErrorDatabaseChangeCount", "the database changed in another way than expected"},
    {69, "TSYErrorSuperseded", "superseded by a later change"},
    {71, "TSYErrorUserManagedPathNotFound", "no such user-managed path"},
    {73, "TSYErrorAllocationFailed", "out of memory, or too large"},
    {75, "TSYErrorInvalidUserIdentityData", "the user identity is invalid"},
    {76, "TSYErrorPersonaMismatch", "the persona does not fit"},
    {77, "TSYErrorQueueEmpty", "the command queue is empty"},
});

const Meaning* meaningOf(uint64_t code) {
  const auto* found = std::find_if(kMeanings.begin(), kMeanings.end(),
                                   [code](const Meaning& meaning) { return meaning.code == code; });
  return found == kMeanings.end() ? nullptr : found;
}

}  // namespace

std::string_view errorName(uint64_t code) {
  const Meaning* meaning = meaningOf(code);
  return meaning == nullptr ? std::string_view() : meaning->name;
}

std::string_view errorMessage(uint64_t code) {
  const Meaning* meaning = meaningOf(code);
  return meaning == nullptr ? std::string_view() : meaning->message;
}

}  // namespace tessary
