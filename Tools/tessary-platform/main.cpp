// tessary-platform: the other side of the platform stand-ins. What a device's own services would do
// (start applications, lock the device, change personas), this tool does by writing their files.
#include <sodium.h>
#include <unistd.h>

#include "Platform/os/RuntimeDirectory.h"
#include "Tools/tessary-platform/Command.h"

int complain(int status, const std::string& text) {
  fmt::print(stderr, "tessary-platform: {}\n", text);
  return status;
}

std::unique_ptr<platform::FileSystem> openRoot(const Application& application) {
  using platform::Privilege;
  const Privilege privilege = ::geteuid() == 0 ? Privilege::root : Privilege::none;
  auto files = platform::FileSystem::open(application.root, privilege);
  if (files) return *std::move(files);
  complain(kFailed, fmt::format("{}: {}", application.root, files.error().message()));
  return nullptr;
}

std::unique_ptr<platform::FileSystem> openPreparedRoot(const Application& application) {
  auto files = openRoot(application);
  if (files == nullptr) return nullptr;
  const auto prepared = platform::prepareRuntimeDirectory(*files);
  if (prepared) return files;
  complain(kFailed,
           fmt::format("{}: {}", platform::runtimeDirectory(*files), prepared.error().message()));
  return nullptr;
}

int main(int argc, char** argv) {
  if (::sodium_init() < 0) return complain(kFailed, "no source of random numbers");
  Application application;
  application.cli
      .add_option("--root", application.root, "The directory that the system lies under")
      ->type_name("DIR");
  application.cli.require_subcommand(1);
  addInitCommand(application);
  addRunCommand(application);
  addLockCommands(application);
  addShowCommand(application);
  addPersonaCommands(application);
  try {
    application.cli.parse(argc, argv);
  } catch (const CLI::ParseError& error) {
    return application.cli.exit(error) == 0 ? kDone : kBadUsage;
  }
  return application.chosen();
}
