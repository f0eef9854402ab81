// Any bytes as the metadata file of an application's data container. What is accepted must say what
// the directory is, and must read as the same container when it is written again.
#include <cstdlib>

#include "Daemon/TSYMetadata.h"
#include "Daemon/TSYUserIdentityCache.h"
#include "Fuzz/FuzzDevice.h"
#include "Platform/values/PropertyList.h"

namespace {

constexpr char kContainer[] =
    "/private/var/mobile/Containers/Data/Application/7D1C5F66-6A3B-4E0C-9B6E-2F4B8B0A3C11";

void require(bool condition) {
  if (!condition) std::abort();
}

TSYResult<TSYMetadata> read(const TSYURL& container) {
  return TSYMetadata::readAndValidateMetadataAtUrl(
      container, TSYUserIdentityCache::defaultUserIdentity(), /*checkClassPath=*/true);
}

// Compared as bytes: a number that is none is not equal to itself.
bool sameInfo(const TSYMetadata& left, const TSYMetadata& right) {
  if (!left.info() || !right.info()) return left.info() == right.info();
  return *platform::writeBinaryPropertyList(*left.info()) ==
         *platform::writeBinaryPropertyList(*right.info());
}

void requireRoundTrip(const TSYMetadata& metadata, const TSYURL& container) {
  require(metadata.writeMetadataToDisk().has_value());
  const auto again = read(container);
  require(again && again->identifier() == metadata.identifier());
  require(again->uuid() == metadata.uuid());
  require(again->userManagedAssetsDirName() == metadata.userManagedAssetsDirName());
  require(sameInfo(*again, metadata));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* bytes, size_t size) {
  static const FuzzDevice device;
  const TSYURL container(device.root() + kContainer);
  static const bool made = device.files().makePath(container.path(), 0755).has_value();
  require(made);
  require(device.files()
              .writeFile(container.appending(kTSYMetadataFileName).path(), {bytes, size}, {})
              .has_value());
  const auto metadata = read(container);
  if (!metadata) return 0;
  require(metadata->containerClass() == kTSYContainerClassAppData);
  require(metadata->url() == container);
  require(metadata->userIdentity()->isEqualToUserIdentity(
      *TSYUserIdentityCache::defaultUserIdentity()));
  requireRoundTrip(*metadata, container);
  return 0;
}
