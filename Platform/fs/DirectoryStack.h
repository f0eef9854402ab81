// The open directories on the way down a tree, and how far each has been read.
//
// A tree may be ten thousand levels deep, so nothing recurses and only the innermost directories
// stay open: an outer one is closed when the way down gets long, and opened again through ".." on
// the way back. Whoever owns the tree may have moved things meanwhile; the directory that ".."
// leads to is taken only when it is the very one that was left (device, inode and time of birth),
// else the way back ends with ESTALE.
//
// Belongs to one thread.
#pragma once

#include <dirent.h>
#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <vector>

#include "Platform/base/Errno.h"
#include "Platform/base/FileDescriptor.h"

namespace platform {

class DirectoryStack {
 public:
  // `type` is the d_type of the directory entry. The name stays good until the directory it comes
  // from is read again or left.
  struct Entry {
    const char* name;
    unsigned char type;
  };

  bool isEmpty() const { return levels_.empty(); }
  size_t depth() const { return levels_.size(); }
  int innermost() const { return levels_.back().directory.get(); }

  // Goes down into a directory that is open for reading.
  Result<void> push(FileDescriptor directory);
  // Goes back up. After a failure there is no way on.
  Result<void> pop();
  // The innermost directory's next entry, without "." and ".."; none at the end.
  Result<std::optional<Entry>> next();

 private:
  struct Identity {
    uint64_t device = 0;
    uint64_t inode = 0;
    int64_t bornSeconds = 0;
    uint32_t bornNanoseconds = 0;
    bool operator==(const Identity&) const = default;
  };
  struct Level {
    FileDescriptor directory;   // not valid while closed
    Identity identity;          // known while closed
    std::vector<char> entries;  // as the kernel gave them
    size_t offset = 0;          // of the first entry not yet handed out
    off_t position = 0;         // in the directory, behind the last entry handed out
  };

  static Result<Identity> identify(int directory);
  static Result<void> close(Level& level);
  Result<bool> fill(Level& level);

  std::vector<Level> levels_;
  std::vector<char> buffer_;  // one for all levels: what the kernel writes into
};

}  // namespace platform
