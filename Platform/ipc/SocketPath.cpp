// A name in the file system fits into sockaddr_un up to 107 bytes. A longer one is reached through
// /proc/self/fd/N/NAME, where N is an O_PATH descriptor of its directory: that is short whatever
// the directory is called.
#include "Platform/ipc/SocketPath.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <algorithm>
#include <string_view>

namespace platform::ipc {
namespace {

// The address of a socket, with the directory descriptor that it may lead through.
struct Address {
  FileDescriptor directory;
  sockaddr_un value{};

  const sockaddr* get() const { return reinterpret_cast<const sockaddr*>(&value); }
  static constexpr socklen_t kSize = sizeof(sockaddr_un);
};

bool fits(std::string_view path) {
  return path.size() < sizeof(sockaddr_un::sun_path);
}

Result<Address> addressOf(const std::string& path) {
  if (path.empty() || path.find('\0') != std::string::npos) return failWith(EINVAL);
  Address address;
  address.value.sun_family = AF_UNIX;
  std::string shortPath = path;
  if (!fits(path)) {
    const size_t slash = path.rfind('/');
    const std::string directory = slash == std::string::npos ? "." : path.substr(0, slash + 1);
    address.directory = FileDescriptor(::open(directory.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!address.directory.valid()) return lastErrno();
    shortPath = fmt::format("/proc/self/fd/{}/{}", address.directory.get(),
                            path.substr(slash == std::string::npos ? 0 : slash + 1));
    if (!fits(shortPath)) return failWith(ENAMETOOLONG);
  }
  std::ranges::copy(shortPath, std::begin(address.value.sun_path));
  return address;
}

// Whether nobody listens on the socket at an address any more.
bool isStale(const Address& address, int type) {
  struct stat status{};
  if (::lstat(address.value.sun_path, &status) != 0 || !S_ISSOCK(status.st_mode)) return false;
  const FileDescriptor probe(::socket(AF_UNIX, type | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  return probe.valid() && ::connect(probe.get(), address.get(), Address::kSize) != 0 &&
         errno == ECONNREFUSED;
}

Result<void> bindReplacingStale(int socket, const Address& address, int type) {
  if (::bind(socket, address.get(), Address::kSize) == 0) return {};
  if (errno != EADDRINUSE) return lastErrno();
  if (!isStale(address, type)) return failWith(EADDRINUSE);
  if (::unlink(address.value.sun_path) != 0 && errno != ENOENT) return lastErrno();
  if (::bind(socket, address.get(), Address::kSize) != 0) return lastErrno();
  return {};
}

}  // namespace

Result<FileDescriptor> listenAt(const std::string& path, int type, unsigned mode) {
  const auto address = addressOf(path);
  if (!address) return std::unexpected(address.error());
  FileDescriptor socket(::socket(AF_UNIX, type | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!socket.valid()) return lastErrno();
  if (const auto bound = bindReplacingStale(socket.get(), *address, type); !bound) {
    return std::unexpected(bound.error());
  }
  // Before anybody can connect: until listen() the socket refuses everyone.
  if (::chmod(address->value.sun_path, mode) != 0) return lastErrno();
  if (::listen(socket.get(), SOMAXCONN) != 0) return lastErrno();
  return socket;
}

Result<FileDescriptor> connectTo(const std::string& path, int type) {
  const auto address = addressOf(path);
  if (!address) return std::unexpected(address.error());
  FileDescriptor socket(::socket(AF_UNIX, type | SOCK_CLOEXEC, 0));
  if (!socket.valid()) return lastErrno();
  while (::connect(socket.get(), address->get(), Address::kSize) != 0) {
    if (errno != EINTR) return lastErrno();
  }
  return socket;
}

}  // namespace platform::ipc
