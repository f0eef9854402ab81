// Of each mapping that is set, memory keeps a hash of its key and a hash of its path: enough to see
// that a push changes nothing. The hashes are SipHash of 128 bits under a key of this process, so
// that nobody can choose two mappings that collide.
//
// A batch keeps the last push of each key back until it ends, unless it changes nothing. The order
// of pushes holds between threads all the same: a push takes back what any batch still holds for
// its key, so that at a commit each push that is left is the last one of its key.
#include "Platform/os/Sandbox.h"

#include <fcntl.h>
#include <sodium.h>
#include <unistd.h>

#include <array>
#include <cstring>
#include <unordered_map>
#include <utility>
#include <vector>

#include "Platform/base/Mutex.h"
#include "Platform/os/FileExtensions.h"
#include "Platform/os/OpenFile.h"
#include "Platform/os/PlatformLog.h"
#include "Platform/os/SandboxLog.h"

namespace platform {
namespace {

struct Hash {
  uint64_t high;
  uint64_t low;
  bool operator==(const Hash&) const = default;
};

struct HashOfHash {
  size_t operator()(const Hash& hash) const { return hash.low; }
};

using HashKey = std::array<unsigned char, crypto_shorthash_siphashx24_KEYBYTES>;

Hash hashOf(const HashKey& key, std::string_view bytes) {
  std::array<unsigned char, crypto_shorthash_siphashx24_BYTES> digest{};
  crypto_shorthash_siphashx24(digest.data(), reinterpret_cast<const unsigned char*>(bytes.data()),
                              bytes.size(), key.data());
  Hash hash{};
  static_assert(sizeof hash == sizeof digest);
  std::memcpy(&hash, digest.data(), sizeof hash);
  return hash;
}

Hash hashOfMappingKey(const HashKey& key, const SandboxMappingKey& mapping) {
  const std::array<uint32_t, 3> numbers{mapping.uid, static_cast<uint32_t>(mapping.personaID),
                                        mapping.itemType};
  std::string bytes(reinterpret_cast<const char*>(numbers.data()), sizeof numbers);
  bytes += mapping.identifier;
  return hashOf(key, bytes);
}

// A mapping as a hash of its key and, unless it is to be cleared, of its path.
struct HashedMapping {
  Hash key;
  std::optional<Hash> path;
};

// A push that has been kept back.
struct Push {
  std::optional<Hash> pathHash;
  SandboxMapping mapping;

  std::string line() const {
    return formatMappingLine({mapping.uid, mapping.personaID, mapping.itemType, mapping.identifier},
                             mapping.path);
  }
};
using Pushes = std::unordered_map<Hash, Push, HashOfHash>;

// What one read of the log found.
struct LogContent {
  struct Path {
    Hash hash;
    size_t line;  // where its last line is
  };
  std::unordered_map<Hash, Path, HashOfHash> live;
  size_t lines = 0;
  size_t malformed = 0;
};

Result<LogContent> readLog(int descriptor, const HashKey& hashKey) {
  LogContent content;
  const auto read = forEachLine(descriptor, [&](std::string_view line) {
    ++content.lines;
    const auto mapping = parseMappingLine(line);
    if (!mapping) {
      ++content.malformed;
      return;
    }
    const Hash key = hashOfMappingKey(
        hashKey, {mapping->uid, mapping->personaID, mapping->itemType, mapping->identifier});
    if (mapping->path) {
      content.live.insert_or_assign(
          key, LogContent::Path{hashOf(hashKey, *mapping->path), content.lines});
    } else {
      content.live.erase(key);
    }
  });
  if (!read) return std::unexpected(read.error());
  return content;
}

// The lines that count, from a second read: the first one keeps no text.
Result<std::string> linesThatCount(int descriptor, const LogContent& content) {
  std::vector<bool> counts(content.lines + 1);
  for (const auto& [key, path] : content.live) counts[path.line] = true;
  if (::lseek(descriptor, 0, SEEK_SET) != 0) return lastErrno();
  std::string text;
  size_t number = 0;
  const auto read = forEachLine(descriptor, [&](std::string_view line) {
    if (++number < counts.size() && counts[number]) text.append(line) += '\n';
  });
  if (!read) return std::unexpected(read.error());
  return text;
}

}  // namespace

struct Sandbox::Batch::Pending {
  State* sandbox;
  Pending* outer;  // of this thread
  Pushes pushes;   // under the sandbox's lock
};

struct Sandbox::State {
  explicit State(const FileSystem& fileSystem) : files(fileSystem), extensions(fileSystem) {
    randombytes_buf(hashKey.data(), hashKey.size());
  }

  Result<void> open() REQUIRES(mutex);
  Result<void> compact(int descriptor) REQUIRES(mutex);
  Result<void> append(const std::string& lines) REQUIRES(mutex);
  int push(const SandboxMappingKey& key, const std::optional<std::string>& path,
           Batch::Pending* batch);
  void commit(Batch::Pending& batch);
  bool changesNothing(const HashedMapping& mapping) const REQUIRES(mutex);
  void remember(const HashedMapping& mapping) REQUIRES(mutex);

  const FileSystem& files;
  const FileExtensions extensions;
  HashKey hashKey{};
  Mutex mutex;
  FileDescriptor log GUARDED_BY(mutex);  // invalid until the log could be opened
  std::unordered_map<Hash, Hash, HashOfHash> mappings GUARDED_BY(mutex);
  std::vector<Batch::Pending*> batches GUARDED_BY(mutex);
};

namespace {

thread_local Sandbox::Batch::Pending* innermostBatch = nullptr;

}  // namespace

// Reads the log into memory and leaves only the lines that count in it.
Result<void> Sandbox::State::compact(int descriptor) {
  const auto content = readLog(descriptor, hashKey);
  if (!content) return std::unexpected(content.error());
  if (content->malformed > 0) {
    platformLog(LogLevel::error, "Sandbox::compact", "{}: {} malformed lines are dropped",
                sandboxLogPath(files), content->malformed);
  }
  mappings.clear();
  for (const auto& [key, path] : content->live) mappings.emplace(key, path.hash);
  if (content->live.size() == content->lines) return {};
  const auto text = linesThatCount(descriptor, *content);
  if (!text) return std::unexpected(text.error());
  return files.writeFile(sandboxLogPath(files), asBytes(*text), {.atomic = true});
}

Result<void> Sandbox::State::open() {
  if (log.valid()) return {};
  const std::string path = sandboxLogPath(files);
  if (const auto made = files.makePath(path.substr(0, path.rfind('/')), 0755); !made) return made;
  const auto place = files.locate(path);
  if (!place) return std::unexpected(place.error());
  constexpr int kFlags = O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;
  const char* const name = place->name.c_str();
  const FileDescriptor old(::openat(place->parent.get(), name, O_RDONLY | kFlags));
  if (!old.valid() && errno != ENOENT) return lastErrno();
  if (old.valid()) {
    if (const auto compacted = compact(old.get()); !compacted) return compacted;
  }
  FileDescriptor file(
      ::openat(place->parent.get(), name, O_WRONLY | O_APPEND | O_CREAT | kFlags, 0644));
  struct stat status{};
  if (!file.valid() || ::fstat(file.get(), &status) != 0) return lastErrno();
  if (!S_ISREG(status.st_mode)) return failWith(EINVAL);
  log = std::move(file);
  return {};
}

// All of the lines or none: half a line would spoil the next one.
Result<void> Sandbox::State::append(const std::string& lines) {
  if (const auto opened = open(); !opened) return opened;
  const off_t before = ::lseek(log.get(), 0, SEEK_END);
  if (before < 0) return lastErrno();
  const auto written = writeAll(log.get(), lines);
  // Where even this fails the log is opened, and thereby compacted, anew.
  if (!written && ::ftruncate(log.get(), before) != 0) log.reset();
  return written;
}

bool Sandbox::State::changesNothing(const HashedMapping& mapping) const {
  const auto known = mappings.find(mapping.key);
  if (known == mappings.end()) return !mapping.path;
  return mapping.path == known->second;
}

void Sandbox::State::remember(const HashedMapping& mapping) {
  if (mapping.path) {
    mappings.insert_or_assign(mapping.key, *mapping.path);
  } else {
    mappings.erase(mapping.key);
  }
}

int Sandbox::State::push(const SandboxMappingKey& key, const std::optional<std::string>& path,
                         Batch::Pending* batch) {
  if (!fitsMappingLine(key, path)) return ENAMETOOLONG;
  const HashedMapping mapping{hashOfMappingKey(hashKey, key),
                              path ? std::optional(hashOf(hashKey, *path)) : std::nullopt};
  const MutexLock lock(mutex);
  // Opened first: what the log holds decides whether the push changes anything.
  if (const auto opened = open(); !opened) return opened.error().value;
  for (Batch::Pending* other : batches) other->pushes.erase(mapping.key);
  if (changesNothing(mapping)) return 0;
  if (batch != nullptr) {
    SandboxMapping copy{key.uid, key.personaID, key.itemType, std::string(key.identifier), path};
    batch->pushes.emplace(mapping.key, Push{mapping.path, std::move(copy)});
    return 0;
  }
  if (const auto appended = append(formatMappingLine(key, path)); !appended) {
    return appended.error().value;
  }
  remember(mapping);
  return 0;
}

void Sandbox::State::commit(Batch::Pending& batch) {
  const MutexLock lock(mutex);
  std::erase(batches, &batch);
  if (batch.pushes.empty()) return;
  std::string lines;
  for (const auto& [key, push] : batch.pushes) lines += push.line();
  if (const auto appended = append(lines); !appended) {
    platformLog(LogLevel::error, "Sandbox::commit", "{} mappings are lost: {}", batch.pushes.size(),
                appended.error().message());
    return;
  }
  for (const auto& [key, push] : batch.pushes) remember({key, push.pathHash});
}

Sandbox::Sandbox(const FileSystem& files) : state_(std::make_unique<State>(files)) {
  const MutexLock lock(state_->mutex);
  if (const auto opened = state_->open(); !opened) {
    platformLog(LogLevel::error, "Sandbox::Sandbox", "{}: {}", sandboxLogPath(files),
                opened.error().message());
  }
}

Sandbox::~Sandbox() = default;

int Sandbox::setContainerPath(const SandboxMappingKey& key,
                              const std::optional<std::string>& path) {
  Batch::Pending* const batch = innermostBatch != nullptr && innermostBatch->sandbox == state_.get()
                                    ? innermostBatch
                                    : nullptr;
  return state_->push(key, path, batch);
}

Sandbox::Batch::Batch(Sandbox& sandbox)
    : sandbox_(sandbox),
      pending_(std::make_unique<Pending>(Pending{sandbox.state_.get(), innermostBatch, {}})) {
  innermostBatch = pending_.get();
  const MutexLock lock(sandbox_.state_->mutex);
  sandbox_.state_->batches.push_back(pending_.get());
}

Sandbox::Batch::~Batch() {
  innermostBatch = pending_->outer;
  sandbox_.state_->commit(*pending_);
}

Result<std::string> Sandbox::issueFileExtension(const std::string& extensionClass,
                                                const std::string& path,
                                                const AuditToken& process) const {
  return state_->extensions.issue(extensionClass, path, process);
}

bool Sandbox::verifyExtension(const std::string& token, const AuditToken& process) const {
  return state_->extensions.verify(token, process);
}

}  // namespace platform
