// Where the stand-ins keep their files under the root, and how names become file names.
#pragma once

#include <string>
#include <string_view>

#include "Platform/fs/FileSystem.h"

namespace platform {

// etc/tessary: what a device is configured with.
std::string configurationDirectory(const FileSystem& files);
// run/tessary: what lives until reboot.
std::string runtimeDirectory(const FileSystem& files);

// Makes run/tessary and its parents (0755, the daemon's own) and empties it when the boot id stored
// in it is not the kernel's. Called once at start, and by the tools before they write there.
Result<void> prepareRuntimeDirectory(const FileSystem& files);

// A file name for any identifier: bytes outside [A-Za-z0-9._-] and a leading dot as %XX, the empty
// string as "%", what would be longer than 200 bytes as "%%" and its BLAKE2b hash in hexadecimal.
std::string fileNameForIdentifier(std::string_view identifier);

}  // namespace platform
