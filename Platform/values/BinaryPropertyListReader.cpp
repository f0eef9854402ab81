// Reads the binary form by walking it from the root: every value is made where it will stay, and
// nothing is kept for objects besides. A shared object is made anew each time that it is used, so
// two budgets bound what a small file can ask for: the number of values, and the bytes that are
// copied into strings and data (a file without sharing never exceeds the second).
#include <fmt/format.h>

#include <algorithm>
#include <bit>
#include <cmath>
#include <utility>

#include "Platform/values/BinaryPropertyListFormat.h"
#include "Platform/values/PropertyList.h"
#include "Platform/values/Unicode.h"

namespace platform {
namespace {

using namespace binary_property_list;
using Limits = PropertyListLimits;

uint64_t bigEndian(const uint8_t* bytes, size_t width) {
  uint64_t number = 0;
  for (size_t index = 0; index < width; ++index) number = number << 8 | bytes[index];
  return number;
}

Value integerValue(uint64_t number) {
  if (std::in_range<int64_t>(number)) return static_cast<int64_t>(number);
  return number;
}

// Every function that can fail returns false after it has said why with fail().
class Reader {
 public:
  explicit Reader(std::span<const uint8_t> bytes) : bytes_(bytes) {}

  PropertyListResult<Value> read() {
    Value root;
    if (readTrailer() && spendValues(1) && readValue(root_, nullptr, root)) return root;
    return std::unexpected(PropertyListError{std::move(reason_)});
  }

 private:
  // A container that is being read, and those around it.
  struct Ancestor {
    size_t offset;
    size_t depth;
    const Ancestor* outer;
  };

  // An object whose marker has been read; `at` is the place behind that.
  struct Object {
    size_t offset;
    size_t at;
    uint8_t marker;

    uint8_t kind() const { return marker & kKindMask; }
    uint8_t size() const { return marker & kSizeMask; }
  };

  bool fail(std::string_view reason) {
    reason_ = reason;
    return false;
  }
  bool fail(const Object& object, std::string_view reason) {
    reason_ = fmt::format("object at {}: {}", object.offset, reason);
    return false;
  }

  bool readTrailer();
  bool locate(uint64_t reference, Object& object);
  const uint8_t* take(Object& object, size_t size);
  bool readSize(Object& object, size_t elementSize, size_t& size);

  bool readValue(uint64_t reference, const Ancestor* outer, Value& into);
  bool readInteger(Object object, Value& into);
  bool readReal(Object object, Value& into);
  bool readDate(Object object, Value& into);
  bool readData(Object object, Value& into);
  bool readString(Object object, std::string& into);
  bool readUTF16(Object object, std::string& into);
  bool readUID(Object object, Value& into);
  bool readArray(Object object, const Ancestor* outer, Value& into);
  bool readDictionary(Object object, const Ancestor* outer, Value& into);
  bool readPair(const uint8_t* key, const uint8_t* value, const Ancestor& self,
                Value::Dictionary& into);

  bool enter(const Object& object, const Ancestor* outer, Ancestor& self);
  uint64_t reference(const uint8_t* bytes) const { return bigEndian(bytes, referenceWidth_); }
  bool spendValues(size_t count);
  bool spendBytes(const Object& object, size_t count);

  const std::span<const uint8_t> bytes_;
  // From the trailer. Objects end where the offset table begins.
  size_t objectsEnd_ = 0;
  size_t offsetWidth_ = 0;
  size_t referenceWidth_ = 0;
  uint64_t objectCount_ = 0;
  uint64_t root_ = 0;

  size_t valuesLeft_ = Limits::kValues;
  size_t copiedBytesLeft_ = Limits::kBytes;
  std::string reason_;
};

bool Reader::readTrailer() {
  if (bytes_.size() > Limits::kBytes) return fail("larger than a property list may be");
  if (bytes_.size() < kHeader.size() + kTrailerSize) return fail("too short");
  if (!std::equal(kHeader.begin(), kHeader.end(), bytes_.begin())) {
    return fail("no binary property list of a known version");
  }
  const size_t trailerOffset = bytes_.size() - kTrailerSize;
  const uint8_t* field = bytes_.data() + trailerOffset + kTrailerUnused;
  offsetWidth_ = field[0];
  referenceWidth_ = field[1];
  objectCount_ = bigEndian(field + 2, 8);
  root_ = bigEndian(field + 10, 8);
  const uint64_t table = bigEndian(field + 18, 8);
  if (offsetWidth_ < 1 || offsetWidth_ > 8 || referenceWidth_ < 1 || referenceWidth_ > 8) {
    return fail("the trailer has an impossible width");
  }
  if (table < kHeader.size() || table > trailerOffset ||
      objectCount_ > (trailerOffset - table) / offsetWidth_) {
    return fail("the offset table does not fit into the file");
  }
  objectsEnd_ = static_cast<size_t>(table);
  return true;
}

bool Reader::locate(uint64_t reference, Object& object) {
  if (reference >= objectCount_) return fail("a reference to an object that does not exist");
  const uint64_t offset =
      bigEndian(bytes_.data() + objectsEnd_ + reference * offsetWidth_, offsetWidth_);
  if (offset < kHeader.size() || offset >= objectsEnd_) {
    return fail("an object lies outside the objects");
  }
  object.offset = static_cast<size_t>(offset);
  object.at = object.offset + 1;
  object.marker = bytes_[object.offset];
  return true;
}

// The next `size` bytes of an object; null when it ends before.
const uint8_t* Reader::take(Object& object, size_t size) {
  if (size > objectsEnd_ - object.at) {
    fail(object, "cut short");
    return nullptr;
  }
  const uint8_t* bytes = bytes_.data() + object.at;
  object.at += size;
  return bytes;
}

// The size of an object of elements, all of which are there.
bool Reader::readSize(Object& object, size_t elementSize, size_t& size) {
  uint64_t count = object.size();
  if (count == kSizeFollows) {
    const uint8_t* marker = take(object, 1);
    if (marker == nullptr) return false;
    if ((*marker & kKindMask) != kInteger || (*marker & kSizeMask) > 3) {
      return fail(object, "its size is no integer");
    }
    const size_t width = size_t{1} << (*marker & kSizeMask);
    const uint8_t* bytes = take(object, width);
    if (bytes == nullptr) return false;
    count = bigEndian(bytes, width);
  }
  if (count > (objectsEnd_ - object.at) / elementSize) return fail(object, "cut short");
  size = static_cast<size_t>(count);
  return true;
}

bool Reader::spendValues(size_t count) {
  if (count > valuesLeft_) return fail("too many values");
  valuesLeft_ -= count;
  return true;
}

bool Reader::spendBytes(const Object& object, size_t count) {
  if (count > copiedBytesLeft_) return fail(object, "shared so often that it grows too large");
  copiedBytesLeft_ -= count;
  return true;
}

bool Reader::readValue(uint64_t reference, const Ancestor* outer, Value& into) {
  Object object{};
  if (!locate(reference, object)) return false;
  switch (object.kind()) {
    case kInteger:
      return readInteger(object, into);
    case kReal:
      return readReal(object, into);
    case kDate& kKindMask:
      return readDate(object, into);
    case kData:
      return readData(object, into);
    case kASCII:
    case kUTF16: {
      std::string text;
      if (!readString(object, text)) return false;
      into = std::move(text);
      return true;
    }
    case kUID:
      return readUID(object, into);
    case kArray:
      return readArray(object, outer, into);
    case kDictionary:
      return readDictionary(object, outer, into);
    case kSet:
      return fail(object, "a set, which is no property-list value");
    default:
      break;
  }
  if (object.marker == kNull) return fail(object, "null, which is no property-list value");
  if (object.marker != kFalse && object.marker != kTrue) return fail(object, "of unknown type");
  into = object.marker == kTrue;
  return true;
}

// Integers of 1, 2 and 4 bytes are unsigned. Those of 8 and 16 are signed: 16 bytes are how a
// number beyond the signed 64-bit ones is written.
bool Reader::readInteger(Object object, Value& into) {
  if (object.size() > 4) return fail(object, "an integer of more than 16 bytes");
  const size_t width = size_t{1} << object.size();
  const uint8_t* bytes = take(object, width);
  if (bytes == nullptr) return false;
  if (width < 16) {
    into = static_cast<int64_t>(bigEndian(bytes, width));
    return true;
  }
  const uint64_t high = bigEndian(bytes, 8);
  const uint64_t low = bigEndian(bytes + 8, 8);
  const auto lowSigned = static_cast<int64_t>(low);
  if (high == 0) {
    into = integerValue(low);
  } else if (high == UINT64_MAX && lowSigned < 0) {
    into = lowSigned;
  } else {
    return fail(object, "an integer beyond 64 bits");
  }
  return true;
}

bool Reader::readReal(Object object, Value& into) {
  if (object.marker != kReal32 && object.marker != kReal64) {
    return fail(object, "a real of unknown width");
  }
  const size_t width = size_t{1} << object.size();
  const uint8_t* bytes = take(object, width);
  if (bytes == nullptr) return false;
  const uint64_t bits = bigEndian(bytes, width);
  into = object.marker == kReal64
             ? std::bit_cast<double>(bits)
             : static_cast<double>(std::bit_cast<float>(static_cast<uint32_t>(bits)));
  return true;
}

bool Reader::readDate(Object object, Value& into) {
  if (object.marker != kDate) return fail(object, "a date of unknown width");
  const uint8_t* bytes = take(object, 8);
  if (bytes == nullptr) return false;
  const auto since2001 = std::bit_cast<double>(bigEndian(bytes, 8));
  if (!(std::fabs(since2001) <= kFarthestDate)) return fail(object, "a date out of range");
  into = Date{since2001 + kEpochSince1970};
  return true;
}

bool Reader::readData(Object object, Value& into) {
  size_t size = 0;
  if (!readSize(object, 1, size) || !spendBytes(object, size)) return false;
  const uint8_t* bytes = bytes_.data() + object.at;
  into = Value::Data(bytes, bytes + size);
  return true;
}

bool Reader::readString(Object object, std::string& into) {
  if (object.kind() == kUTF16) return readUTF16(object, into);
  size_t size = 0;
  if (!readSize(object, 1, size) || !spendBytes(object, size)) return false;
  const std::string_view text(reinterpret_cast<const char*>(bytes_.data() + object.at), size);
  if (!isASCII(text)) return fail(object, "an ASCII string with other characters");
  into = text;
  return true;
}

bool Reader::readUTF16(Object object, std::string& into) {
  size_t units = 0;
  if (!readSize(object, 2, units) || !spendBytes(object, units * 2)) return false;
  const uint8_t* bytes = bytes_.data() + object.at;
  const uint8_t* const end = bytes + units * 2;
  into.reserve(units);
  while (bytes != end) {
    auto character = static_cast<char32_t>(bigEndian(bytes, 2));
    bytes += 2;
    if (character >= 0xD800 && character <= 0xDFFF) {
      const auto low = bytes == end ? 0 : static_cast<char32_t>(bigEndian(bytes, 2));
      if (character > 0xDBFF || low < 0xDC00 || low > 0xDFFF) {
        return fail(object, "a string with half a surrogate pair");
      }
      bytes += 2;
      character = 0x10000 + ((character - 0xD800) << 10 | (low - 0xDC00));
    }
    appendCharacter(into, character);
  }
  return true;
}

// A UID has no type of its own among values: it reads as the XML form writes it.
bool Reader::readUID(Object object, Value& into) {
  const size_t width = size_t{object.size()} + 1;
  if (width > 8) return fail(object, "a UID of more than 8 bytes");
  const uint8_t* bytes = take(object, width);
  if (bytes == nullptr || !spendValues(1)) return false;
  into = Value::Dictionary{{"CF$UID", integerValue(bigEndian(bytes, width))}};
  return true;
}

bool Reader::enter(const Object& object, const Ancestor* outer, Ancestor& self) {
  for (const Ancestor* each = outer; each != nullptr; each = each->outer) {
    if (each->offset == object.offset) return fail(object, "a container that contains itself");
  }
  self = {object.offset, outer == nullptr ? 1 : outer->depth + 1, outer};
  return self.depth <= Limits::kDepth || fail(object, "nested too deeply");
}

bool Reader::readArray(Object object, const Ancestor* outer, Value& into) {
  Ancestor self{};
  size_t count = 0;
  if (!enter(object, outer, self) || !readSize(object, referenceWidth_, count) ||
      !spendValues(count)) {
    return false;
  }
  const uint8_t* element = bytes_.data() + object.at;
  Value::Array array(count);
  for (Value& value : array) {
    if (!readValue(reference(element), &self, value)) return false;
    element += referenceWidth_;
  }
  into = std::move(array);
  return true;
}

bool Reader::readDictionary(Object object, const Ancestor* outer, Value& into) {
  Ancestor self{};
  size_t count = 0;
  if (!enter(object, outer, self) || !readSize(object, referenceWidth_ * 2, count) ||
      !spendValues(count)) {
    return false;
  }
  const uint8_t* key = bytes_.data() + object.at;
  const uint8_t* value = key + count * referenceWidth_;
  Value::Dictionary dictionary;
  for (size_t index = 0; index < count; ++index) {
    if (!readPair(key, value, self, dictionary)) return false;
    key += referenceWidth_;
    value += referenceWidth_;
  }
  into = std::move(dictionary);
  return true;
}

bool Reader::readPair(const uint8_t* key, const uint8_t* value, const Ancestor& self,
                      Value::Dictionary& into) {
  Object keyObject{};
  if (!locate(reference(key), keyObject)) return false;
  if (keyObject.kind() != kASCII && keyObject.kind() != kUTF16) {
    return fail(keyObject, "a key that is no string");
  }
  std::string text;
  if (!readString(keyObject, text)) return false;
  // Our own files are ordered by key: each goes to the end.
  const size_t before = into.size();
  const auto place = into.try_emplace(into.end(), std::move(text));
  if (into.size() == before) return fail(keyObject, "a key that its dictionary has already");
  return readValue(reference(value), &self, place->second);
}

}  // namespace

PropertyListResult<Value> readBinaryPropertyList(std::span<const uint8_t> bytes) {
  return Reader(bytes).read();
}

}  // namespace platform
