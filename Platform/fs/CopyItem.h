// Copying one item that is no directory, and the attributes of any. Any thread.
#pragma once

#include <sys/stat.h>

#include <string>

#include "Platform/base/Errno.h"
#include "Platform/fs/FileSystem.h"

namespace platform {

// Copies the regular file, FIFO or symbolic link `name` of `source` to `newName` in `target`, which
// must not exist. Sockets and devices fail with ENOTSUP: a socket means nothing without the process
// behind it, and copying must never make a device. EISDIR for a directory, EXDEV for a mount.
Result<void> copyItem(int source, const std::string& name, int target, const std::string& newName,
                      Privilege privilege);

// Gives `target` the owner, mode, extended attributes (ACLs are among them) and times of `source`,
// in the order in which one does not undo the other. Both are open; neither is a link.
Result<void> copyAttributes(int source, const struct stat& status, int target, Privilege privilege);

}  // namespace platform
