// The listener queue orders everything: initialisation is the first work on it, and the message
// service accepts its connections on it, so that no client is served before the daemon is ready.

#include "Daemon/Startup.h"

#include <csignal>
#include <cstdlib>

#include "Daemon/TSYClientConnection.h"
#include "Daemon/TSYDaemonQueues.h"
#include "Daemon/TSYDispatcher.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYLockStateFollower.h"
#include "Daemon/TSYLog.h"
#include "Platform/ipc/server/Server.h"
#include "Platform/os/Platform.h"
#include "Platform/os/RuntimeDirectory.h"
#include "Platform/os/Signpost.h"

using platform::KeepAlive;
using platform::LogLevel;
using platform::Notifications;
using platform::Platform;
using platform::SerialQueue;

namespace {

constexpr char kServiceName[] = "com.veltra.tessaryd";
constexpr char kFirstBootMarker[] = "tessaryd.fb_check";
constexpr mode_t kFirstBootMarkerMode = 0444;
constexpr uint64_t kStartupSignpost = 0xEEEEB0B5B2B2EEEE;
constexpr TSYLogRotation kLogRotation{.files = 1, .bytesPerFile = 102'400};
constexpr TSYLogRotation kInternalLogRotation{.files = 4, .bytesPerFile = 262'144};
constexpr std::chrono::seconds kPatienceAtTheEnd{60};
constexpr unsigned kStaleRecordsInterval = 60;  // seconds

// What cannot be done without ends the process; the service manager sees it fail.
[[noreturn]] void stopProcess(std::string_view reason) {
  TSYSystemLogWriteText(TSYChannel::startup, LogLevel::fault, "Startup", reason);
  std::_Exit(EXIT_FAILURE);
}

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
    (void)TSYDeathRowQueue();
    (void)TSYLockStateQueue();
  } catch (const std::exception&) {
    stopProcess("Can't create dispatch queues.");
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
  const TSYUserIdentityRef user = TSYUserIdentityCache::defaultUserIdentity();
  if (!own || !user || !user->homeDirectoryURL()) return;
  const std::string& home = user->homeDirectoryURL()->path();
  const auto theirs = files.status(home);
  if (!theirs || theirs->st_dev == own->st_dev) return;
  TSYLogWrite(TSYLogLevelError, "{} is not on the file system of the daemon's directories", home);
}

void postAtStartup(const char* name, const char* shortName) {
  const uint32_t status = Platform::current().notifications.post(name);
  if (status == Notifications::kStatusOK) return;
  TSYSystemLogWrite(TSYChannel::startup, LogLevel::error, "Failed to post {}: {}", shortName,
                    status);
}

void set_first_boot_work_completed() {
  const auto created =
      Platform::current().semaphores.create(kFirstBootMarker, kFirstBootMarkerMode);
  if (created || created.error().value == EEXIST) return;
  TSYLogWrite(TSYLogLevelError, "Failed to create semaphore {}: {}", kFirstBootMarker,
              created.error().message());
}

void firstBootDidComplete() {
  TSYLogWrite(TSYLogLevelNotice, "tessaryd first boot cleanup complete");
  set_first_boot_work_completed();
  postAtStartup(platform::notification::kRebootCleanupComplete, "reboot-cleanup-complete");
}

void bootDidComplete() {
  postAtStartup(platform::notification::kCleanupComplete, "cleanup-complete");
  TSY_SIGNPOST_END(BootCleanup, kStartupSignpost, 0);
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

// Runs on the listener queue, before any request.
void initialise() {
  TSY_SIGNPOST_BEGIN(StartingUp, kStartupSignpost, 0);
  openLog();
  logMissingRights();
  createSharedQueues();
  TSYClientConnection& connection = TSYClientConnection::sharedClientConnection();
  const bool isFirstBoot = !Platform::current().semaphores.exists(kFirstBootMarker);
  if (isFirstBoot) {
    TSYLogWrite(TSYLogLevelNotice, "tessaryd performing first boot initialization");
  }
  followLockState();
  if (isFirstBoot) firstBootDidComplete();
  TSY_SIGNPOST_BEGIN(BootCleanup, kStartupSignpost, 0);
  connection.tessaryCleanupWithCompletion([](uint64_t /*code*/) { bootDidComplete(); });
  logSeparateFileSystems();
  TSY_SIGNPOST_END(StartingUp, kStartupSignpost, 0);
}

std::unique_ptr<platform::ipc::Server> createListener(SerialQueue& listenerQueue) {
  Platform& platform = Platform::current();
  auto server = platform::ipc::Server::create(
      platform::runtimeDirectory(platform.files) + "/" + kServiceName,
      platform.serviceManager.takeSocket(kServiceName), platform.tasks, platform.systemLog,
      listenerQueue, TSYProcessRelayEvent);
  if (server) return std::move(*server);
  TSYLogWriteText(TSYLogLevelError, "main", "unable to start relay service!");
  TSYSystemLogWrite(TSYChannel::relay, LogLevel::error, "unable to listen at {}: {}", kServiceName,
                    server.error().message());
  return nullptr;
}

void watchSignals(platform::RunLoop& loop) {
  for (const int signal : {SIGTERM, SIGINT}) {
    if (!loop.watchSignal(signal, [&loop] { loop.stop(); })) stopProcess("Can't watch signals.");
  }
}

void keepHouse(platform::RunLoop& loop) {
  (void)loop.every(kStaleRecordsInterval, [] { Platform::current().tasks.removeStale(); });
  const auto watchdog = Platform::current().serviceManager.watchdogInterval();
  const auto seconds = std::chrono::duration_cast<std::chrono::seconds>(watchdog / 2).count();
  if (watchdog.count() == 0) return;
  (void)loop.every(static_cast<unsigned>(std::max<int64_t>(seconds, 1)),
                   [] { Platform::current().serviceManager.keepWatchdogQuiet(); });
}

// Lets what runs finish; returns whether all has ended.
bool endService(platform::ipc::Server* server) {
  Platform& platform = Platform::current();
  platform.serviceManager.notifyStopping();
  platform.serviceManager.extendTimeout(kPatienceAtTheEnd);
  const auto deadline = std::chrono::steady_clock::now() + kPatienceAtTheEnd;
  const bool drained = server == nullptr || server->drain(kPatienceAtTheEnd);
  const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
      deadline - std::chrono::steady_clock::now());
  return platform.keepAlive.waitUntilIdle(std::max(left, std::chrono::milliseconds(0))) && drained;
}

}  // namespace

int TSYRunDaemon() {
  Platform& platform = Platform::current();
  watchSignals(platform.runLoop);
  keepHouse(platform.runLoop);

  static SerialQueue& listenerQueue = *new SerialQueue("com.veltra.tessaryd.listener");
  auto starting = std::make_shared<KeepAlive::Transaction>(platform.keepAlive);
  listenerQueue.async([starting = std::move(starting)] { initialise(); });
  const std::unique_ptr<platform::ipc::Server> server = createListener(listenerQueue);
  listenerQueue.async([server = server.get()] {
    if (server != nullptr) server->resume();
    Platform::current().serviceManager.notifyReady();
  });
  platform.runLoop.run();

  const bool allEnded = endService(server.get());
  if (!allEnded) {
    TSYLogWrite(TSYLogLevelError, "Ending with work in hand after {} seconds",
                kPatienceAtTheEnd.count());
    std::_Exit(EXIT_FAILURE);
  }
  return EXIT_SUCCESS;
}
