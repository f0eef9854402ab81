#include "Benchmarks/BareWork.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include "Benchmarks/Scratch.h"
#include "Platform/base/FileDescriptor.h"
#include "Platform/values/PropertyList.h"
#include "Platform/values/UUID.h"

using platform::FileDescriptor;
using platform::UUID;
using platform::Value;

void check(bool succeeded, const char* failure) {
  if (!succeeded) die(failure);
}

Value::Data metadata(const std::string& identifier) {
  const Value::Dictionary content{
      {"TSYMetadataVersion", "2"},
      {"TSYMetadataIdentifier", identifier},
      {"TSYMetadataUUID", UUID::random().string()},
      {"TSYMetadataContentClass", uint64_t{2}},
      {"TSYMetadataUserIdentity", Value::Dictionary{{"version", "2"},
                                                    {"posixUID", uint64_t{kUser}},
                                                    {"posixGID", uint64_t{kUser}},
                                                    {"type", uint64_t{0}}}}};
  return *platform::writeBinaryPropertyList(content);
}

void writeSynced(const std::string& path, const Value::Data& bytes) {
  const FileDescriptor file(::open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
  check(file.valid(), "cannot open");
  check(::fsetxattr(file.get(), "trusted.tessary.protection-class", "4", 1, 0) == 0,
        "cannot fsetxattr");
  check(::write(file.get(), bytes.data(), bytes.size()) == static_cast<ssize_t>(bytes.size()),
        "cannot write");
  check(::fsync(file.get()) == 0, "cannot fsync");
}

void makeOwnedDirectory(const std::string& path) {
  check(::mkdir(path.c_str(), 0755) == 0, "cannot mkdir");
  check(::chown(path.c_str(), kUser, kUser) == 0, "cannot chown");
}

void rename(const std::string& from, const std::string& to) {
  check(::rename(from.c_str(), to.c_str()) == 0, "cannot rename");
}

void syncDirectory(const std::string& path) {
  const FileDescriptor directory(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  check(directory.valid() && ::fsync(directory.get()) == 0, "cannot fsync");
}
