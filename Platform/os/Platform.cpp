#include "Platform/os/Platform.h"

#include <sodium.h>
#include <unistd.h>

#include <cstdlib>

#include "Platform/os/DevicePersonas.h"
#include "Platform/os/PlatformLog.h"
#include "Platform/os/RuntimeDirectory.h"

namespace platform {
namespace {

Platform* currentPlatform = nullptr;

}  // namespace

Platform& Platform::current() {
  if (currentPlatform == nullptr) {
    platformLog(LogLevel::fault, "Platform::current", "no platform has been set");
    std::abort();
  }
  return *currentPlatform;
}

void Platform::setCurrent(Platform& platform) {
  currentPlatform = &platform;
}

// In the order in which they need one another; they end in the opposite order.
struct DevicePlatform::Services {
  explicit Services(std::unique_ptr<FileSystem> fileSystem) : files(std::move(fileSystem)) {
    files->setLockStateSource([this] { return keyBag.lockState() == KeyBag::kLocked; });
  }

  std::unique_ptr<FileSystem> files;
  KeyBag keyBag{*files};
  SystemLog systemLog;
  RunLoop runLoop;
  Accounts accounts{*files};
  ContainerLayout containerLayout{*files};
  Device device{*files};
  KeepAlive keepAlive;
  NamedSemaphores semaphores{*files};
  Notifications notifications{*files, &runLoop};
  DevicePersonas personas{*files, runLoop};
  Sandbox sandbox{*files};
  ServiceManager serviceManager;
  SystemVersion systemVersion{*files};
  Tasks tasks{*files};
  Platform platform{
      .files = *files,
      .accounts = accounts,
      .containerLayout = containerLayout,
      .device = device,
      .keepAlive = keepAlive,
      .keyBag = keyBag,
      .semaphores = semaphores,
      .notifications = notifications,
      .personas = personas,
      .runLoop = runLoop,
      .sandbox = sandbox,
      .serviceManager = serviceManager,
      .systemLog = systemLog,
      .systemVersion = systemVersion,
      .tasks = tasks,
  };
};

Result<std::unique_ptr<DevicePlatform>> DevicePlatform::open(const std::string& root) {
  if (::sodium_init() < 0) return failWith(ENOSYS);
  const Privilege privilege = ::geteuid() == 0 ? Privilege::root : Privilege::none;
  auto files = FileSystem::open(root, privilege);
  if (!files) return std::unexpected(files.error());
  if (const auto prepared = prepareRuntimeDirectory(**files); !prepared) {
    return std::unexpected(prepared.error());
  }
  auto services = std::make_unique<Services>(*std::move(files));
  return std::unique_ptr<DevicePlatform>(new DevicePlatform(std::move(services)));
}

DevicePlatform::DevicePlatform(std::unique_ptr<Services> services)
    : services_(std::move(services)) {}

DevicePlatform::~DevicePlatform() = default;

Platform& DevicePlatform::platform() {
  return services_->platform;
}

}  // namespace platform
