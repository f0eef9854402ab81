// lock, unlock: the key bag's state, and word of it.
#include "Platform/os/KeyBag.h"
#include "Platform/os/Notifications.h"
#include "Tools/tessary-platform/Command.h"

namespace {

int setLockState(const Application& application, int state) {
  const auto files = openPreparedRoot(application);
  if (files == nullptr) return kFailed;
  if (const auto set = platform::KeyBag(*files).setLockState(state); !set) {
    return complain(kFailed, fmt::format("the lock state: {}", set.error().message()));
  }
  const platform::Notifications notifications(*files, /*loop=*/nullptr);
  const uint32_t status = notifications.post(platform::notification::kLockStatus);
  if (status == platform::Notifications::kStatusOK) return kDone;
  const platform::Errno error{static_cast<int>(status)};
  return complain(kFailed, fmt::format("the lock-status notification: {}", error.message()));
}

}  // namespace

void addLockCommands(Application& application) {
  const auto add = [&](const char* name, const char* description, int state) {
    application.cli.add_subcommand(name, description)->callback([&application, state] {
      application.chosen = [&application, state] { return setLockState(application, state); };
    });
  };
  add("lock", "Lock the device", platform::KeyBag::kLocked);
  add("unlock", "Unlock the device", platform::KeyBag::kUnlocked);
}
