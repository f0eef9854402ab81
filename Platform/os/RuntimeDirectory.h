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
// EPERM when the directory belongs to somebody else; one that others could write is closed to them
// and emptied as well.
Result<void> prepareRuntimeDirectory(const FileSystem& files);

// Waits for the lock on run/tessary, which keeps processes and threads apart that read, change and
// write one of its files. It is held until the descriptor is closed: for a moment only.
Result<FileDescriptor> lockRuntimeDirectory(const FileSystem& files);

// A file name for any identifier: bytes outside [A-Za-z0-9._-] and a leading dot as %XX, the empty
// string as "%", what would be longer than 200 bytes as "%%" and its BLAKE2b hash in hexadecimal.
std::string fileNameForIdentifier(std::string_view identifier);

}  // namespace platform
