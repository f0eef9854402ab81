#include <sys/stat.h>

#include <CLI/CLI.hpp>
#include <csignal>
#include <cstdlib>

#include "Daemon/Service.h"
#include "Daemon/TSYLog.h"
#include "Platform/os/Platform.h"

int main(int argc, char** argv) {
  CLI::App application("The container daemon.");
  std::string root = "/";
  application.add_option("--root", root, "The directory that stands for /");
  CLI11_PARSE(application, argc, argv);

  ::umask(0);
  // A client that goes while it is written to is an error of the write.
  std::signal(SIGPIPE, SIG_IGN);
  TSYInstallUncaughtExceptionHandler();
  auto device = platform::DevicePlatform::open(root);
  if (!device) {
    fmt::print(stderr, "tessaryd: cannot use {} as the root: {}\n", root, device.error().message());
    return EXIT_FAILURE;
  }
  // The daemon's shared instances use the platform until the process is gone.
  static platform::DevicePlatform* const keptForever = device->release();
  platform::Platform::setCurrent(keptForever->platform());
  return TSYRunDaemon();
}
