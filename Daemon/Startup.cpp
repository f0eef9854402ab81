#include "Daemon/Startup.h"

#include "Daemon/TSYClientConnection.h"
#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYDaemonQueues.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYInvariant.h"
#include "Daemon/TSYLockStateFollower.h"
#include "Daemon/TSYLog.h"
#include "Platform/os/Platform.h"
#include "Platform/os/Signpost.h"

using platform::LogLevel;
using platform::Notifications;
using platform::Platform;

namespace {

constexpr char kFirstBootMarker[] = "tessaryd.fb_check";
constexpr mode_t kFirstBootMarkerMode = 0444;
constexpr uint64_t kBootSignpost = 0xEEEEB0B5B2B2EEEE;
constexpr TSYLogRotation kLogRotation{.files = 1, .bytesPerFile = 102'400};
constexpr TSYLogRotation kInternalLogRotation{.files = 4, .bytesPerFile = 262'144};
// The id of the interval "StartingUp".
const char kStartingUp = 0;

void openLog() {
  TSYGlobalConfiguration& configuration = TSYGlobalConfiguration::sharedInstance();
  const std::string path = configuration.logDirectory().appending("tessaryd.log").path();
  const TSYLogRotation rotation =
      configuration.isInternalImage() ? kInternalLogRotation : kLogRotation;
  if (!TSYLogOpen(path, TSYLogLevelNotice, rotation)) {
    TSYSystemLogWrite(TSYChannel::startup, LogLevel::error,
                      "Failed to set up rotating logs at path {}", path);
  }
  TSYLogWrite(TSYLogLevelDebug, "tessaryd built at {} {} started", __DATE__, __TIME__);
}

void createSharedQueues() {
  try {
    // The first work starts a queue's thread.
    TSYDeathRowQueue().async([] {});
    TSYLockStateQueue().async([] {});
  } catch (const std::exception&) {
    TSYStopProcess(TSYChannel::startup, "Can't create dispatch queues.");
  }
}

void logMissingRights() {
  if (Platform::current().files.privilege() == platform::Privilege::root) return;
  TSYLogWrite(TSYLogLevelNotice,
              "Running without root's rights: changes of owner that are refused are passed over");
}

// A container on another file system cannot be renamed to death row.
void logSeparateFileSystems() {
  const platform::FileSystem& files = Platform::current().files;
  const auto own = files.status(TSYGlobalConfiguration::sharedInstance().cachesDirectory().path());
  if (!own) return;
  TSYUserIdentitySharedCache::sharedInstance()
      .forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const TSYUserIdentityRef& user) {
        if (!user || !user->homeDirectoryURL()) return;
        const std::string& home = user->homeDirectoryURL()->path();
        const auto theirs = files.status(home);
        if (!theirs || theirs->st_dev == own->st_dev) return;
        TSYLogWrite(TSYLogLevelError, "{} is not on the file system of the daemon's directories",
                    home);
      });
}

void postAtStartup(const char* name, const char* shortName) {
  const uint32_t status = Platform::current().notifications.post(name);
  if (status == Notifications::kStatusOK) return;
  TSYSystemLogWrite(TSYChannel::startup, LogLevel::error, "Failed to post {}: {}", shortName,
                    status);
}

void setFirstBootWorkCompleted() {
  const auto created =
      Platform::current().semaphores.create(kFirstBootMarker, kFirstBootMarkerMode);
  if (created || created.error().value == EEXIST) return;
  TSYLogWriteText(TSYLogLevelError, "set_first_boot_work_completed",
                  fmt::format("Failed to create semaphore {}: {}", kFirstBootMarker,
                              created.error().message()));
}

void firstBootDidComplete() {
  TSYLogWrite(TSYLogLevelNotice, "tessaryd first boot cleanup complete");
  setFirstBootWorkCompleted();
  postAtStartup(platform::notification::kRebootCleanupComplete, "reboot-cleanup-complete");
  TSY_SIGNPOST_END(FirstBootCleanup, kBootSignpost, 0);
}

void bootDidComplete() {
  postAtStartup(platform::notification::kCleanupComplete, "cleanup-complete");
  TSY_SIGNPOST_END(BootCleanup, kBootSignpost, 0);
}

void followLockState() {
  static TSYLockStateFollower& follower =
      *new TSYLockStateFollower(Platform::current().keyBag, TSYLockStateQueue());
  const uint32_t status = Platform::current().notifications.observe(
      platform::notification::kLockStatus, [] { follower.lockStateDidChange(); });
  if (status != Notifications::kStatusOK) {
    TSYLogWrite(TSYLogLevelError, "Failed to register for {}: {}",
                platform::notification::kLockStatus, status);
  }
  follower.lockStateDidChange();
}

}  // namespace

void TSYInitialiseDaemon() {
  TSY_SIGNPOST_BEGIN(StartingUp, &kStartingUp, 0);
  openLog();
  logMissingRights();
  createSharedQueues();
  // A database that cannot be opened ends the start here.
  (void)TSYCodeSigningMapping::sharedInstance();
  TSYClientConnection& connection = TSYClientConnection::sharedClientConnection();
  const bool isFirstBoot = !Platform::current().semaphores.exists(kFirstBootMarker);
  if (isFirstBoot) {
    TSYLogWrite(TSYLogLevelNotice, "tessaryd performing first boot initialization");
  }
  TSY_SIGNPOST_BEGIN(BootSetup, kBootSignpost, 0);
  connection.tessarySetup();
  TSY_SIGNPOST_END(BootSetup, kBootSignpost, 0);
  followLockState();
  if (isFirstBoot) {
    TSY_SIGNPOST_BEGIN(FirstBootCleanup, kBootSignpost, 0);
    connection.rebootTessaryCleanupWithCompletion(firstBootDidComplete);
  }
  TSY_SIGNPOST_BEGIN(BootCleanup, kBootSignpost, 0);
  connection.tessaryCleanupWithCompletion([](uint64_t /*code*/) { bootDidComplete(); });
  logSeparateFileSystems();
  TSY_SIGNPOST_END(StartingUp, &kStartingUp, 0);
}
