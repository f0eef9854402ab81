#include "Daemon/TSYPropertyList.h"

#include "Daemon/TSYLog.h"
#include "Platform/os/Platform.h"
#include "Platform/values/PropertyList.h"

using platform::Platform;
using platform::Value;

namespace {

constexpr int kProtectionClassNone = 4;

}  // namespace

TSYResult<void> TSY_writeToURL(const Value::Dictionary& dictionary, const TSYURL& url,
                               uint32_t options) {
  const auto bytes = platform::writeBinaryPropertyList(dictionary);
  if (!bytes) {
    return TSYFailure(TSYPosixErrorCreate(platform::Errno{EINVAL},
                                          "no property-list form for {}: {}", url.path(),
                                          bytes.error().reason));
  }
  platform::WriteOptions how;
  how.atomic = (options & kTSYWriteAtomic) != 0;
  if ((options & kTSYWriteProtectionNone) != 0) how.protectionClass = kProtectionClassNone;
  const auto written = Platform::current().files.writeFile(url.path(), *bytes, how);
  if (!written) {
    return TSYFailure(TSYPosixErrorCreate(written.error(), "write of {} failed: {}", url.path(),
                                          written.error().message()));
  }
  return {};
}

TSYResult<Value::Dictionary> TSY_dictionaryWithContentsOfURL(const TSYURL& url) {
  const auto bytes =
      Platform::current().files.readFile(url.path(), platform::PropertyListLimits::kBytes);
  if (!bytes) {
    return TSYFailure(TSYPosixErrorCreate(bytes.error(), "read of {} failed: {}", url.path(),
                                          bytes.error().message()));
  }
  auto value = platform::readPropertyList(*bytes);
  if (!value) {
    return TSYFailure(TSYPosixErrorCreate(platform::Errno{EBADMSG}, "{} is no property list: {}",
                                          url.path(), value.error().reason));
  }
  Value::Dictionary* dictionary = value->asDictionary();
  if (dictionary == nullptr) {
    return TSYFailure(TSYPosixErrorCreate(
        platform::Errno{EILSEQ}, "{} holds no dictionary but a {}", url.path(), value->typeName()));
  }
  return std::move(*dictionary);
}

const Value* TSYValueUnder(const Value::Dictionary& dictionary, std::string_view key) {
  const auto found = dictionary.find(key);
  return found == dictionary.end() ? nullptr : &found->second;
}

bool TSYFlagUnder(const Value::Dictionary& dictionary, std::string_view key) {
  const Value* value = TSYValueUnder(dictionary, key);
  return value != nullptr && value->booleanOfNumber().value_or(false);
}

bool TSYHasPropertyListForm(const Value& value) {
  const auto form = platform::writeBinaryPropertyList(value);
  if (!form) TSYLogWrite(TSYLogLevelError, "No property-list form: {}", form.error().reason);
  return form.has_value();
}

bool containsDotDotPathComponents(std::string_view path) {
  for (size_t start = 0; start <= path.size();) {
    const size_t slash = path.find('/', start);
    const size_t end = slash == std::string_view::npos ? path.size() : slash;
    if (path.substr(start, end - start) == "..") return true;
    start = end + 1;
  }
  return false;
}
