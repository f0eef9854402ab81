// The access-control lists of system containers: named rights, applied as POSIX ACLs.
#pragma once

#include <sys/types.h>

#include <string>

#include "Platform/base/Errno.h"

namespace platform {

// The three places in a system container, each with a shape of its own. G is the group given.
enum class ACLShape {
  topLevelDirectory,  // access u::rwx,g::r-x,g:G:rwx,m::rwx,o::r-x; default
                      // u::rwx,g::---,g:G:rwx,m::rwx,o::---
  directory,          // access u::---,g::---,g:G:rwx,m::rwx,o::---; default as the top level's
  file,               // access as the directory's, no default
};

// Why an ACL could not be built or set: the libacl call that failed, or none when setting failed.
struct ACLFailure {
  std::string call;
  Errno error;
  unsigned permissions = 0;  // what acl_add_perm was to add
};

template <typename T>
using ACLResult = std::expected<T, ACLFailure>;

// Sets the shape on the item (descriptor of its parent, name), which must not be a symbolic link.
// libacl knows only paths: the item is reached through /proc/self/fd. Any thread.
ACLResult<void> setACL(int parent, const std::string& name, ACLShape shape, gid_t group);
// The same for an item that is open already; O_PATH will do.
ACLResult<void> setACL(int item, ACLShape shape, gid_t group);

// A directory made under a default ACL inherits its entries, but the mode of mkdir(2) or chmod(2)
// narrows the mask that limits the named ones: mode 0 leaves nobody in. This widens the mask again
// to what the entries grant. Nothing happens to a directory without a default ACL.
Result<void> restoreInheritedACL(int directory);

}  // namespace platform
