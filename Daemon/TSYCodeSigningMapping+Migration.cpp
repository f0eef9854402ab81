// What older releases kept elsewhere. Taking it over is not built yet: what is there stays there.
#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYLog.h"

namespace {

constexpr char kMappingFile[] = "tsy_code_signing_info.plist";
constexpr char kEntitlementsFile[] = "tsy_entitlements.plist";

void complainOfFile(const char* name) {
  const TSYURL url = TSYGlobalConfiguration::sharedInstance().libraryDirectory().appending(name);
  if (!TSYFileManager::defaultManager().itemExistsAtURL(url)) return;
  TSYLogWrite(TSYLogLevelError, "Taking over {} is not built yet", url.path());
}

}  // namespace

void TSYCodeSigningMapping::_onQueue_migrateFromMappingFileToDBIfNecessary() {
  complainOfFile(kMappingFile);
}

void TSYCodeSigningMapping::_onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile() {
  complainOfFile(kEntitlementsFile);
}

void TSYCodeSigningMapping::migrateAppGroupIdsFromDataContainersToFile() {
  TSYLogWrite(TSYLogLevelError, "Taking over groups from data containers is not built yet");
}

void TSYCodeSigningMapping::migrateCachedCodeSigningInfoFromBundleContainersToMapping() {
  TSYLogWrite(TSYLogLevelError,
              "Taking over code signing info from bundle containers is not built yet");
}
