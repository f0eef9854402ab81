#include "Daemon/TSYConfigurationDirectory.h"

#include "Daemon/TSYLog.h"

void TSYMakeConfigurationDirectory(const TSYURL& url, const TSYConfigurationDirectory& directory,
                                   std::source_location where) {
  constexpr mode_t kMode = 0755;
  const TSYResult<void> made = TSYFileManager::defaultManager().createDirectoryAtURL(
      url, /*withIntermediateDirectories=*/true, kMode, directory.owner, directory.protectionClass);
  if (made) return;
  TSYLogWriteText(
      TSYLogLevelError, TSYFunctionName(where),
      fmt::format("Failed to create {} at \"{}\": {}", directory.kind, url.path(), made.error()));
}
