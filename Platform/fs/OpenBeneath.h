// openat2(2): the only way in which a name becomes a descriptor here. Resolving stays beneath the
// directory given and waits for nobody. Any thread.
#pragma once

#include <fcntl.h>

#include <string>

#include "Platform/base/Errno.h"
#include "Platform/base/FileDescriptor.h"

namespace platform {

enum class Mounts { cross, refuse };

// Follows no symbolic link and no magic one. `flags` without O_CREAT; O_CLOEXEC is added. A link
// fails with ELOOP, unless flags hold O_PATH and O_NOFOLLOW: then a final one is opened itself.
// With Mounts::refuse a mount point fails with EXDEV.
Result<FileDescriptor> openBeneath(int directory, const char* path, int flags,
                                   Mounts mounts = Mounts::cross);

// The flags that open a directory for reading, and whether they have found something else.
inline constexpr int kReadDirectory = O_RDONLY | O_DIRECTORY;
inline bool isNoDirectory(Errno error) {
  return error == Errno{ENOTDIR} || error == Errno{ELOOP};
}
// How often a name may change between a directory and something else under our hands.
inline constexpr int kSwaps = 16;

// Follows symbolic links as if the directory were the root of everything: an absolute link starts
// there and ".." does not lead out. The result is good for looking only (O_PATH).
enum class FinalLink { open, follow };
Result<FileDescriptor> lookInside(int directory, const char* path, FinalLink finalLink);

// The link in /proc that leads to the item behind a descriptor, for calls that take a path only.
std::string linkToDescriptor(int descriptor);

}  // namespace platform
