// Small files: read whole, and written so that a reader and a power cut see the old content or the
// new one.
#include <fcntl.h>
#include <unistd.h>

#include "Platform/fs/FileSystem.h"
#include "Platform/fs/RandomName.h"

namespace platform {
namespace {

// Reads until `bytes` is full or the file ends, whichever is first.
Result<void> readInto(int descriptor, std::vector<uint8_t>& bytes) {
  size_t done = 0;
  while (done < bytes.size()) {
    const ssize_t count = ::read(descriptor, bytes.data() + done, bytes.size() - done);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return lastErrno();
    if (count == 0) break;
    done += static_cast<size_t>(count);
  }
  bytes.resize(done);
  return {};
}

Result<void> writeAll(int descriptor, std::span<const uint8_t> bytes) {
  while (!bytes.empty()) {
    const ssize_t count = ::write(descriptor, bytes.data(), bytes.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return lastErrno();
    bytes = bytes.subspan(static_cast<size_t>(count));
  }
  return {};
}

}  // namespace

Result<std::vector<uint8_t>> FileSystem::readFile(const std::string& path, size_t limit) const {
  const auto file = openItem(path);
  if (!file) {
    // A socket cannot be opened at all.
    const int error = file.error().value;
    return failWith(error == ENXIO ? EINVAL : error);
  }
  struct stat status{};
  if (::fstat(file->get(), &status) != 0) return lastErrno();
  if (!S_ISREG(status.st_mode)) return failWith(EINVAL);
  const auto size = static_cast<size_t>(status.st_size);
  if (size > limit) return failWith(EFBIG);
  std::vector<uint8_t> bytes(size);
  const auto read = readInto(file->get(), bytes);
  if (!read) return std::unexpected(read.error());
  return bytes;
}

// Creates `name`, which must not exist, with everything that `options` asks for, on disk.
Result<void> FileSystem::createFileAt(int parent, const std::string& name,
                                      std::span<const uint8_t> bytes,
                                      const WriteOptions& options) const {
  constexpr int kCreate = O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC;
  const FileDescriptor file(::openat(parent, name.c_str(), kCreate, S_IRUSR | S_IWUSR));
  if (!file.valid()) return lastErrno();
  Result<void> result = writeAll(file.get(), bytes);
  if (result && ::fchmod(file.get(), options.mode) != 0) result = lastErrno();
  if (result && options.protectionClass) {
    result = setProtectionClass(file.get(), *options.protectionClass);
  }
  if (result && ::fsync(file.get()) != 0) result = lastErrno();
  if (!result) ::unlinkat(parent, name.c_str(), 0);
  return result;
}

Result<void> FileSystem::writeFile(const std::string& path, std::span<const uint8_t> bytes,
                                   const WriteOptions& options) const {
  const auto place = locate(path);
  if (!place) return std::unexpected(place.error());
  const int parent = place->parent.get();
  if (!options.atomic) {
    if (::unlinkat(parent, place->name.c_str(), 0) != 0 && errno != ENOENT) return lastErrno();
    return createFileAt(parent, place->name, bytes, options);
  }
  const auto temporary = temporarySiblingName();
  if (!temporary) return std::unexpected(temporary.error());
  const auto created = createFileAt(parent, *temporary, bytes, options);
  if (!created) return created;
  if (::renameat(parent, temporary->c_str(), parent, place->name.c_str()) != 0) {
    const Errno error{errno};
    ::unlinkat(parent, temporary->c_str(), 0);
    return std::unexpected(error);
  }
  return {};
}

Result<void> FileSystem::removeTemporaryFiles(const std::string& directory) const {
  const auto entries = list(directory);
  if (!entries && entries.error() == Errno{ENOENT}) return {};
  if (!entries) return std::unexpected(entries.error());
  for (const DirectoryEntry& entry : *entries) {
    if (!entry.name.starts_with(kTemporaryPrefix)) continue;
    const auto place = locate(directory + "/" + entry.name);
    if (!place) return std::unexpected(place.error());
    if (::unlinkat(place->parent.get(), place->name.c_str(), 0) != 0 && errno != ENOENT) {
      return lastErrno();
    }
  }
  return {};
}

}  // namespace platform
