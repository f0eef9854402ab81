// The listener queue orders everything: initialisation is the first work on it, and the message
// service accepts its connections on it, so that no client is served before the daemon is ready.
#include "Daemon/Service.h"

#include <atomic>
#include <csignal>
#include <cstdlib>
#include <memory>

#include "Daemon/Startup.h"
#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYDispatcher.h"
#include "Daemon/TSYLog.h"
#include "Platform/ipc/server/Server.h"
#include "Platform/os/Platform.h"
#include "Platform/os/RuntimeDirectory.h"

using platform::KeepAlive;
using platform::LogLevel;
using platform::Platform;
using platform::SerialQueue;
using platform::ipc::Server;

namespace {

constexpr char kServiceName[] = "com.veltra.tessaryd";
// How long running work may take once the daemon has been told to end, and what the service manager
// is asked to add to that.
constexpr std::chrono::seconds kPatienceAtTheEnd{60};
constexpr std::chrono::seconds kMargin{10};
constexpr unsigned kStaleRecordsInterval = 60;  // seconds

std::atomic<bool> isEnding = false;

std::unique_ptr<Server> createListener(SerialQueue& listenerQueue) {
  const Platform& platform = Platform::current();
  auto server = Server::create(platform::runtimeDirectory(platform.files) + "/" + kServiceName,
                               platform.serviceManager.takeSocket(kServiceName), platform.tasks,
                               platform.systemLog, listenerQueue, TSYProcessRelayEvent);
  if (server) return std::move(*server);
  TSYLogWriteText(TSYLogLevelError, "main", "unable to start relay service!");
  TSYSystemLogWrite(TSYChannel::relay, LogLevel::error, "unable to listen at {}: {}", kServiceName,
                    server.error().message());
  return nullptr;
}

// Runs on the listener queue, after initialisation.
void beginService(Server* server) {
  if (server == nullptr || isEnding) return;
  server->resume();
  Platform::current().serviceManager.notifyReady();
}

bool watchSignals(platform::RunLoop& loop) {
  for (const int signal : {SIGTERM, SIGINT}) {
    if (!loop.watchSignal(signal, [&loop] { loop.stop(); })) return false;
  }
  return true;
}

void keepHouse(platform::RunLoop& loop) {
  (void)loop.every(kStaleRecordsInterval, [] { Platform::current().tasks.removeStale(); });
  const auto watchdog = Platform::current().serviceManager.watchdogInterval();
  if (watchdog.count() == 0) return;
  const auto seconds = std::chrono::duration_cast<std::chrono::seconds>(watchdog).count();
  (void)loop.every(static_cast<unsigned>(std::max<int64_t>(seconds, 1)),
                   [] { Platform::current().serviceManager.keepWatchdogQuiet(); });
}

// Lets what runs finish; returns whether all has ended.
bool endService(Server* server) {
  isEnding = true;
  Platform& platform = Platform::current();
  platform.serviceManager.notifyStopping();
  platform.serviceManager.extendTimeout(kPatienceAtTheEnd + kMargin);
  const auto deadline = std::chrono::steady_clock::now() + kPatienceAtTheEnd;
  const bool drained = server == nullptr || server->drain(kPatienceAtTheEnd);
  const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
      deadline - std::chrono::steady_clock::now());
  return platform.keepAlive.waitUntilIdle(std::max(left, std::chrono::milliseconds(0))) && drained;
}

}  // namespace

int TSYRunDaemon() {
  Platform& platform = Platform::current();
  if (!watchSignals(platform.runLoop)) return EXIT_FAILURE;
  keepHouse(platform.runLoop);

  static SerialQueue& listenerQueue = *new SerialQueue("com.veltra.tessaryd.listener");
  // Open until the service has begun: nothing may go while the queue still has work with it.
  auto starting = std::make_shared<KeepAlive::Transaction>(platform.keepAlive, "starting");
  listenerQueue.async([starting] { TSYInitialiseDaemon(); });
  const std::unique_ptr<Server> server = createListener(listenerQueue);
  listenerQueue.async(
      [starting = std::move(starting), server = server.get()] { beginService(server); });
  platform.runLoop.run();

  if (endService(server.get())) {
    TSYCodeSigningMapping::sharedInstance().close();
    return EXIT_SUCCESS;
  }
  TSYLogWrite(TSYLogLevelError, "Ending with work in hand after {} seconds: {}",
              kPatienceAtTheEnd.count(), fmt::join(platform.keepAlive.openTransactions(), ", "));
  std::_Exit(EXIT_FAILURE);
}
