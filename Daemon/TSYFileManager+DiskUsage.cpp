// How much room a tree takes, and what a tree looks like.
#include <sys/stat.h>

#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYLog.h"
#include "Platform/os/Platform.h"
#include "Platform/os/Signpost.h"

namespace {

using platform::Errno;
using platform::FileSystem;

// Nothing when the size is unknown.
FileSystem::TreeSize sizeByWalking(const TSYURL& url) {
  const std::string& path = url.path();
  if (path.empty()) {
    TSYLogWrite(TSYLogLevelError, "Failed to get path to url {}", path);
    return {};
  }
  const auto size = platform::Platform::current().files.measure(path);
  if (!size) {
    TSYLogWrite(TSYLogLevelError, "Failed to get dirstats on {} using fallback: (err {}) {}", path,
                size.error().value, size.error().message());
    return {};
  }
  TSYSystemLogWrite(TSYChannel::fs, platform::LogLevel::info,
                    "[{}]: descendants: {}, total size: {}, using fallback", path,
                    size->descendants, size->bytes);
  return *size;
}

}  // namespace

uint64_t TSYFileManager::fastDiskUsageForURL(const TSYURL& url) {
  const auto& device = platform::Platform::current().device;
  if (device.featureEnabled("tessaryd", "fast_container_sizing") && !url.path().empty()) {
    // No file system here keeps statistics of its directories.
    const Errno unsupported{ENOTSUP};
    TSYLogWrite(TSYLogLevelError, "Failed to set maintain-dir-stats on {}: (err {}) {}", url.path(),
                unsupported.value, unsupported.message());
    TSYLogWrite(TSYLogLevelError, "Failed to get dirstats on {}: (err {}) {}", url.path(),
                unsupported.value, unsupported.message());
  }
  return diskUsageForURL(url);
}

uint64_t TSYFileManager::diskUsageForURL(const TSYURL& url) {
  TSY_SIGNPOST_BEGIN(CalculatingDiskUsage, &url, url.path().c_str());
  const FileSystem::TreeSize size = sizeByWalking(url);
  TSY_SIGNPOST_END2(CalculatingDiskUsage, &url, size.descendants, size.bytes);
  return size.bytes;
}

void TSYFileManager::printDirectoryStructureAtURL(const TSYURL& url) {
  const auto walked =
      platform::Platform::current().files.walk(url.path(), [](const FileSystem::WalkEntry& entry) {
        if (entry.visit != FileSystem::Visit::directoryAfter) {
          TSYLogWrite(TSYLogLevelNotice, "{:06o} {}:{} {}", entry.status.st_mode,
                      entry.status.st_uid, entry.status.st_gid, entry.path);
        }
        return true;
      });
  if (!walked) {
    TSYLogWrite(TSYLogLevelError, "Error for path {}: {}", url.path(), walked.error().message());
  }
}
