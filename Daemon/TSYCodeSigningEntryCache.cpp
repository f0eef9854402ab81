#include "Daemon/TSYCodeSigningEntryCache.h"

using platform::MutexLock;
using platform::Value;

namespace {

size_t bytesOf(const Value::Dictionary& dictionary);

// Roughly the memory that a value takes.
size_t bytesOf(const Value& value) {
  if (const std::string* text = value.asString()) return sizeof(Value) + text->size();
  if (const Value::Data* data = value.asData()) return sizeof(Value) + data->size();
  if (const Value::Dictionary* dictionary = value.asDictionary()) return bytesOf(*dictionary);
  size_t bytes = sizeof(Value);
  if (const Value::Array* array = value.asArray()) {
    for (const Value& element : *array) bytes += bytesOf(element);
  }
  return bytes;
}

size_t bytesOf(const Value::Dictionary& dictionary) {
  constexpr size_t kNode = sizeof(Value::Dictionary::value_type);
  size_t bytes = sizeof(Value);
  for (const auto& [key, element] : dictionary) bytes += kNode + key.size() + bytesOf(element);
  return bytes;
}

size_t bytesOf(const std::string& identifier, const TSYCodeSigningEntryRef& entryOrNull) {
  size_t bytes = sizeof(TSYCodeSigningEntry) + identifier.size();
  if (!entryOrNull) return bytes;
  if (entryOrNull->codeSigningInfo) bytes += bytesOf(*entryOrNull->codeSigningInfo);
  if (!entryOrNull->childBundleIdentifiers) return bytes;
  for (const std::string& child : *entryOrNull->childBundleIdentifiers) {
    bytes += sizeof(std::string) + child.size();
  }
  return bytes;
}

}  // namespace

std::optional<TSYCodeSigningEntryRef> TSYCodeSigningEntryCache::find(
    const std::string& identifier) const {
  const MutexLock lock(lock_);
  const auto found = entries_.find(identifier);
  if (found == entries_.end()) return std::nullopt;
  return found->second;
}

void TSYCodeSigningEntryCache::store(const std::string& identifier,
                                     TSYCodeSigningEntryRef entryOrNull) {
  const size_t bytes = bytesOf(identifier, entryOrNull);
  if (bytes > kMostBytes) return;
  const MutexLock lock(lock_);
  if (entries_.size() >= kMostEntries || bytes_ + bytes > kMostBytes) {
    entries_.clear();
    bytes_ = 0;
  }
  if (entries_.emplace(identifier, std::move(entryOrNull)).second) bytes_ += bytes;
}

void TSYCodeSigningEntryCache::clear() {
  const MutexLock lock(lock_);
  entries_.clear();
  bytes_ = 0;
}
