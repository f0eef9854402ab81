// openat2(2): the only way in which a name becomes a descriptor here. Resolving stays beneath the
// directory given and waits for nobody. Any thread.
#pragma once

#include "Platform/base/Errno.h"
#include "Platform/base/FileDescriptor.h"

namespace platform {

enum class Mounts { cross, refuse };

// Follows no symbolic link and no magic one. `flags` without O_CREAT; O_CLOEXEC is added. A link
// fails with ELOOP, unless flags hold O_PATH and O_NOFOLLOW: then a final one is opened itself.
// With Mounts::refuse a mount point fails with EXDEV.
Result<FileDescriptor> openBeneath(int directory, const char* path, int flags,
                                   Mounts mounts = Mounts::cross);

// Follows symbolic links as if the directory were the root of everything: an absolute link starts
// there and ".." does not lead out. The result is good for looking only (O_PATH).
enum class FinalLink { open, follow };
Result<FileDescriptor> lookInside(int directory, const char* path, FinalLink finalLink);

}  // namespace platform
