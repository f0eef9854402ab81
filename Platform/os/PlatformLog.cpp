#include "Platform/os/PlatformLog.h"

namespace platform {
namespace {

// The services log while they are being opened, before there is a current platform.
const SystemLog& log() {
  static const SystemLog systemLog;
  return systemLog;
}

}  // namespace

void platformLogText(LogLevel level, std::string_view function, std::string_view text) {
  log().write(level, "platform", function, 0, text);
}

bool platformLogIsEnabled(LogLevel level) {
  return log().enabled(level);
}

}  // namespace platform
