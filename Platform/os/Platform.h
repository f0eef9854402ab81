// Everything that the operating system gives the daemon, in one place.
//
// The current platform is set once, before anything else runs, and outlives everything. The
// services are plain classes; Personas is abstract because tests need one that misbehaves.
#pragma once

#include "Platform/fs/FileSystem.h"
#include "Platform/os/Accounts.h"
#include "Platform/os/ContainerLayout.h"
#include "Platform/os/Device.h"
#include "Platform/os/KeepAlive.h"
#include "Platform/os/KeyBag.h"
#include "Platform/os/NamedSemaphores.h"
#include "Platform/os/Notifications.h"
#include "Platform/os/Personas.h"
#include "Platform/os/RunLoop.h"
#include "Platform/os/Sandbox.h"
#include "Platform/os/ServiceManager.h"
#include "Platform/os/SystemLog.h"
#include "Platform/os/SystemVersion.h"
#include "Platform/os/Tasks.h"

namespace platform {

struct Platform {
  FileSystem& files;
  Accounts& accounts;
  ContainerLayout& containerLayout;
  Device& device;
  KeepAlive& keepAlive;
  KeyBag& keyBag;
  NamedSemaphores& semaphores;
  Notifications& notifications;
  Personas& personas;
  RunLoop& runLoop;
  Sandbox& sandbox;
  ServiceManager& serviceManager;
  SystemLog& systemLog;
  SystemVersion& systemVersion;
  Tasks& tasks;

  static Platform& current();
  // `platform` must outlive every use. Called once, before any other thread runs.
  static void setCurrent(Platform& platform);
};

// All services of a real device under one root, ready to be made current.
class DevicePlatform {
 public:
  // Resolves the root, prepares run/tessary and opens every service. Runs as root's rights allow
  // (geteuid). Fails with the errno of the root or of run/tessary.
  static Result<std::unique_ptr<DevicePlatform>> open(const std::string& root);
  ~DevicePlatform();

  Platform& platform();

 private:
  struct Services;
  explicit DevicePlatform(std::unique_ptr<Services> services);
  std::unique_ptr<Services> services_;
};

}  // namespace platform
