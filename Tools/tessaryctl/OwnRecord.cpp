#include "Tools/tessaryctl/OwnRecord.h"

#include <fmt/format.h>
#include <unistd.h>

#include "Platform/os/RuntimeDirectory.h"
#include "Platform/os/Tasks.h"
#include "Tools/PropertyListFile.h"

using platform::FileSystem;
using platform::TaskRecord;
using platform::Value;

namespace {

constexpr char kIdentifier[] = "com.veltra.tessaryctl";
constexpr char kPrefix[] = "com.veltra.private.Tessary.";

std::shared_ptr<const Value::Dictionary> everyEntitlement() {
  Value::Dictionary entitlements;
  for (const char* name : {"allowed", "userManagedAssets", "deleteContainerContent",
                           "dataMigration", "testability", "stageSharedContent"}) {
    entitlements.emplace(std::string(kPrefix) + name, true);
  }
  return std::make_shared<const Value::Dictionary>(std::move(entitlements));
}

// Records are read and written by the user whom the daemon runs as.
bool mayKeepRecords(const FileSystem& files) {
  const auto directory = files.status(platform::runtimeDirectory(files));
  return directory && directory->st_uid == ::geteuid();
}

bool choosesAnother(const OwnRecordOptions& options) {
  return options.identifier || options.entitlementsFile || options.sandboxed || options.persona;
}

}  // namespace

std::optional<std::string> writeOwnRecord(const OwnRecordOptions& options) {
  const auto files = FileSystem::open(
      options.root, ::geteuid() == 0 ? platform::Privilege::root : platform::Privilege::none);
  if (!files) return fmt::format("cannot use {}: {}", options.root, files.error().message());
  if (!mayKeepRecords(**files)) {
    // The daemon will say what it thinks of this process as it is.
    if (choosesAnother(options)) return "only the daemon's own user may choose who asks";
    return std::nullopt;
  }
  const auto startTime = platform::processStartTime(::getpid());
  if (!startTime) return startTime.error().message();
  const platform::Tasks tasks(**files);
  if (tasks.record(::getpid(), *startTime)) {
    if (choosesAnother(options)) return "this process has a record already; it cannot be changed";
    return std::nullopt;
  }
  TaskRecord record{.signingIdentifier = options.identifier.value_or(kIdentifier),
                    .entitlements = everyEntitlement(),
                    .sandboxed = options.sandboxed,
                    .personaUniqueString = options.persona};
  if (options.entitlementsFile) {
    auto entitlements = readDictionaryFile(*options.entitlementsFile);
    if (!entitlements) {
      return fmt::format("--entitlements {}: {}", *options.entitlementsFile, entitlements.error());
    }
    record.entitlements = std::make_shared<const Value::Dictionary>(*std::move(entitlements));
  }
  const auto written = tasks.write(::getpid(), *startTime, record);
  if (!written) return fmt::format("cannot write a record: {}", written.error().message());
  return std::nullopt;
}
