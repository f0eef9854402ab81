#include "Platform/base/FileDescriptor.h"

#include <cerrno>

namespace platform {

void FileDescriptor::reset() {
  if (descriptor_ < 0) return;
  const int saved = errno;
  ::close(descriptor_);
  errno = saved;
  descriptor_ = -1;
}

}  // namespace platform
