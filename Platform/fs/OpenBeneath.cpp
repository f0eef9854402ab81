#include "Platform/fs/OpenBeneath.h"

#include <fmt/format.h>
#include <linux/openat2.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace platform {
namespace {

// The kernel answers EAGAIN when a rename elsewhere kept it from being sure of the result, and for
// a file on which someone holds a lease. The first passes at once; the second is a failure.
constexpr int kAttempts = 64;

Result<FileDescriptor> openResolving(int directory, const char* path, int flags, uint64_t resolve) {
  open_how how{};
  how.flags = static_cast<unsigned>(flags | O_CLOEXEC);
  how.resolve = resolve;
  for (int attempt = 1;; ++attempt) {
    const long descriptor = ::syscall(SYS_openat2, directory, path, &how, sizeof how);
    if (descriptor >= 0) return FileDescriptor(static_cast<int>(descriptor));
    if ((errno != EINTR && errno != EAGAIN) || attempt == kAttempts) return lastErrno();
  }
}

}  // namespace

Result<FileDescriptor> openBeneath(int directory, const char* path, int flags, Mounts mounts) {
  uint64_t resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS;
  if (mounts == Mounts::refuse) resolve |= RESOLVE_NO_XDEV;
  return openResolving(directory, path, flags, resolve);
}

Result<FileDescriptor> lookInside(int directory, const char* path, FinalLink finalLink) {
  const int flags = O_PATH | (finalLink == FinalLink::open ? O_NOFOLLOW : 0);
  return openResolving(directory, path, flags, RESOLVE_IN_ROOT | RESOLVE_NO_MAGICLINKS);
}

std::string linkToDescriptor(int descriptor) {
  return fmt::format("/proc/self/fd/{}", descriptor);
}

}  // namespace platform
