// show: everything that the stand-ins keep, read as it stands. Nothing is changed by looking.
#include "Platform/os/Accounts.h"
#include "Platform/os/ConfigurationFile.h"
#include "Platform/os/KeyBag.h"
#include "Platform/os/OpenFile.h"
#include "Platform/os/PersonaList.h"
#include "Platform/os/RuntimeDirectory.h"
#include "Platform/os/SandboxLog.h"
#include "Platform/os/SystemVersion.h"
#include "Platform/os/Tasks.h"
#include "Tools/tessary-platform/Command.h"

namespace {

using platform::FileSystem;
using platform::Value;

void heading(const char* text) {
  fmt::print("\n{}\n", text);
}

// What is shown in place of something that could not be read.
std::string absence(platform::Errno error) {
  return error.value == ENOENT ? "none" : error.message();
}

// What run/tessary holds is of no meaning once the device has been started anew.
void showBoot(const FileSystem& files) {
  constexpr size_t kLongestBootID = 4096;
  const auto stored =
      files.readFile(platform::runtimeDirectory(files) + "/boot-id", kLongestBootID);
  const auto bootID = stored ? platform::asText(*stored) : "not yet known\n";
  fmt::print("run/tessary is of boot: {}", bootID);
}

void showVersion(const FileSystem& files) {
  heading("system version (etc/os-release)");
  const platform::SystemVersion version(files);
  for (const auto& [key, value] : version.dictionary()) {
    fmt::print("  {} = {}\n", key, value.description());
  }
  fmt::print("  internal build: {}\n", version.isInternalBuild() ? "yes" : "no");
}

void showAccounts(const FileSystem& files) {
  heading("accounts (etc/passwd, etc/group)");
  const platform::Accounts accounts(files);
  if (const auto mobile = accounts.accountNamed("mobile")) {
    fmt::print("  mobile: uid {}, gid {}, home {}\n", mobile->uid, mobile->gid, mobile->home);
  } else {
    fmt::print("  mobile: none\n");
  }
  const auto group = accounts.groupNamed(platform::kSystemUsersGroup);
  fmt::print("  group {}: {}\n", platform::kSystemUsersGroup,
             group ? std::to_string(*group) : "none");
}

void showConfiguration(const FileSystem& files, const char* name) {
  heading(fmt::format("etc/tessary/{}", name).c_str());
  const auto value = platform::readConfigurationFile(
      files, fmt::format("{}/{}", platform::configurationDirectory(files), name));
  fmt::print("  {}\n", value ? value->description() : absence(value.error()));
}

void showPersonas(const FileSystem& files) {
  heading("personas (etc/tessary/personas.plist)");
  const auto value = platform::readConfigurationFile(files, platform::personaListPath(files));
  if (!value) {
    fmt::print("  {}\n", absence(value.error()));
    return;
  }
  const auto personas = platform::parsePersonaList(*value, files.root());
  if (!personas) {
    fmt::print("  malformed: {}\n", personas.error());
    return;
  }
  for (const auto& persona : *personas) fmt::print("  {}\n", persona.description());
}

// The names in a directory under run/tessary, each with what `describe` says of it.
void showDirectory(const FileSystem& files, const char* name,
                   const std::function<std::string(const std::string& path)>& describe) {
  heading(name);
  const std::string directory = platform::runtimeDirectory(files) + "/" + name;
  const auto entries = files.list(directory);
  if (!entries && entries.error().value != ENOENT) {
    fmt::print("  {}\n", entries.error().message());
  }
  if (!entries) return;
  for (const auto& entry : *entries) {
    fmt::print("  {}{}\n", entry.name, describe(directory + "/" + entry.name));
  }
}

std::string describeRecord(const platform::Result<platform::TaskRecord>& record) {
  if (!record) return record.error().message();
  std::string text = record->signingIdentifier.value_or("no identifier");
  if (record->sandboxed) text += ", sandboxed";
  if (record->kernelTask) text += ", for the kernel";
  if (record->personaUniqueString) text += ", persona " + *record->personaUniqueString;
  if (record->entitlements) text += ", entitlements " + Value(*record->entitlements).description();
  return text;
}

void showTasks(const FileSystem& files) {
  heading("tasks");
  const platform::Tasks tasks(files);
  const auto processes = tasks.processes();
  if (!processes) {
    fmt::print("  {}\n", processes.error().message());
    return;
  }
  for (const platform::TaskProcess& process : *processes) {
    fmt::print("  {} started at {}{}: {}\n", process.pid, process.startTime,
               process.isAlive() ? "" : " (ended)",
               describeRecord(tasks.record(process.pid, process.startTime)));
  }
}

void showMappings(const FileSystem& files) {
  heading("sandbox mappings, every push (the last of a key counts)");
  const auto log = files.openItem(platform::sandboxLogPath(files));
  if (!log) {
    fmt::print("  {}\n", absence(log.error()));
    return;
  }
  const auto read = platform::forEachLine(log->get(), [](std::string_view line) {
    // As it stands in the file: encoded, and so without anything that a terminal would obey.
    fmt::print("  {}\n", platform::parseMappingLine(line) ? line : "malformed");
  });
  if (!read) fmt::print("  {}\n", read.error().message());
}

int show(const Application& application) {
  const auto files = openRoot(application);
  if (files == nullptr) return kFailed;
  const bool hasKey =
      files->status(platform::runtimeDirectory(*files) + "/extension.key").has_value();
  fmt::print("root: {}\n", files->root().empty() ? "/" : files->root());
  showBoot(*files);
  fmt::print("lock state: {}\n", platform::KeyBag(*files).lockState());
  fmt::print("extension key: {}\n", hasKey ? "made" : "not yet made");
  showVersion(*files);
  showAccounts(*files);
  showConfiguration(*files, "device.plist");
  showConfiguration(*files, "container-layout.plist");
  showPersonas(*files);
  showDirectory(*files, "notifications", [&](const std::string& path) {
    const auto count = platform::readNumberFile(*files, path);
    return count ? fmt::format(": {}", *count) : ": malformed";
  });
  showDirectory(*files, "semaphores", [](const std::string&) { return std::string(); });
  showTasks(*files);
  showMappings(*files);
  return kDone;
}

}  // namespace

void addShowCommand(Application& application) {
  application.cli.add_subcommand("show", "Show everything that the stand-ins keep")
      ->callback(
          [&application] { application.chosen = [&application] { return show(application); }; });
}
