// Writes the binary form in two steps. The first walks the tree, gives every object its number and
// encodes the scalars: their encoding tells type and value, so two that encode alike are the same
// and get one number. The second knows how many objects there are, hence how wide references must
// be, and puts everything together.
//
// The scalars met so far are kept ordered, not hashed: no choice of strings makes it slow.
#include <algorithm>
#include <bit>
#include <cmath>
#include <cstring>
#include <set>
#include <utility>

#include "Platform/values/BinaryPropertyListFormat.h"
#include "Platform/values/PropertyList.h"
#include "Platform/values/Unicode.h"

namespace platform {
namespace {

using namespace binary_property_list;
using Limits = PropertyListLimits;
using Data = Value::Data;

constexpr size_t kWidestInteger = 8;

void appendBigEndian(Data& bytes, uint64_t number, size_t width) {
  for (size_t left = width; left > 0; --left) {
    bytes.push_back(static_cast<uint8_t>(number >> (left - 1) * 8));
  }
}

// The smallest width that an unsigned integer is written with.
size_t widthOf(uint64_t number) {
  if (number <= UINT8_MAX) return 1;
  if (number <= UINT16_MAX) return 2;
  return number <= UINT32_MAX ? 4 : kWidestInteger;
}

void appendUnsigned(Data& bytes, uint64_t number) {
  if (std::in_range<int64_t>(number)) {
    const size_t width = widthOf(number);
    bytes.push_back(static_cast<uint8_t>(kInteger | std::countr_zero(width)));
    appendBigEndian(bytes, number, width);
  } else {
    // Eight bytes would read as a negative number.
    bytes.push_back(kInteger | 4);
    appendBigEndian(bytes, 0, 8);
    appendBigEndian(bytes, number, 8);
  }
}

void appendMarker(Data& bytes, uint8_t kind, size_t size) {
  bytes.push_back(static_cast<uint8_t>(kind | std::min<size_t>(size, kSizeFollows)));
  if (size >= kSizeFollows) appendUnsigned(bytes, size);
}

class Writer {
 public:
  Writer() = default;
  Writer(const Writer&) = delete;  // the order of its scalars points to it
  Writer& operator=(const Writer&) = delete;

  PropertyListResult<Data> write(const Value& root) {
    if (!addValue(root, 0)) return std::unexpected(PropertyListError{reason_});
    return assemble();
  }

 private:
  using Number = uint32_t;

  struct Object {
    // A container's kind (0 for a scalar) and number of references.
    uint8_t kind;
    // Of a scalar: its encoding in scalars_; of a container: its elements in references_.
    size_t begin;
    size_t size;
  };

  struct EncodingOrder {
    const Writer* writer;
    bool operator()(Number left, Number right) const {
      const Object& a = writer->objects_[left];
      const Object& b = writer->objects_[right];
      if (a.size != b.size) return a.size < b.size;
      const uint8_t* bytes = writer->scalars_.data();
      return std::memcmp(bytes + a.begin, bytes + b.begin, a.size) < 0;
    }
  };

  bool fail(const char* reason) {
    reason_ = reason;
    return false;
  }

  bool addValue(const Value& value, size_t depth);
  bool addArray(const Value::Array& array, size_t depth);
  bool addDictionary(const Value::Dictionary& dictionary, size_t depth);
  size_t beginContainer(uint8_t kind, size_t size, size_t references);
  bool addScalar(const Value& value);
  bool addString(const std::string& text);
  // Gives what has been encoded at the end of scalars_, from `begin` on, its number.
  void finishScalar(size_t begin);
  // Counts each use of a string or data, as the reader will.
  bool spendBytes(size_t count);

  bool encode(std::monostate) { return fail("null has no property-list form"); }
  bool encode(const UUID&) { return fail("a UUID has no property-list form"); }
  bool encode(bool value);
  bool encode(int64_t value);
  bool encode(uint64_t value);
  bool encode(double value);
  bool encode(Date value);
  bool encode(const Data& value);
  bool encode(const std::string& value);

  PropertyListResult<Data> assemble() const;

  // The number of the object added last.
  Number added_ = 0;
  std::vector<Object> objects_;
  Data scalars_;
  std::vector<Number> references_;
  std::set<Number, EncodingOrder> uniqueScalars_{EncodingOrder{this}};
  size_t valuesLeft_ = Limits::kValues;
  size_t copiedBytesLeft_ = Limits::kBytes;
  const char* reason_ = "";
};

bool Writer::addValue(const Value& value, size_t depth) {
  if (valuesLeft_-- == 0) return fail("too many values");
  const Value::Array* array = value.asArray();
  const Value::Dictionary* dictionary = value.asDictionary();
  if (array == nullptr && dictionary == nullptr) return addScalar(value);
  if (depth == Limits::kDepth) return fail("nested too deeply");
  return array != nullptr ? addArray(*array, depth + 1) : addDictionary(*dictionary, depth + 1);
}

// Adds a container whose references are yet to be filled in, and returns where they stand.
size_t Writer::beginContainer(uint8_t kind, size_t size, size_t references) {
  added_ = static_cast<Number>(objects_.size());
  objects_.push_back({kind, references_.size(), size});
  references_.resize(references_.size() + references);
  return objects_.back().begin;
}

bool Writer::addArray(const Value::Array& array, size_t depth) {
  if (array.size() > valuesLeft_) return fail("too many values");
  size_t place = beginContainer(kArray, array.size(), array.size());
  const Number self = added_;
  for (const Value& element : array) {
    if (!addValue(element, depth)) return false;
    references_[place++] = added_;
  }
  added_ = self;
  return true;
}

bool Writer::addDictionary(const Value::Dictionary& dictionary, size_t depth) {
  if (dictionary.size() > valuesLeft_) return fail("too many values");
  size_t place = beginContainer(kDictionary, dictionary.size(), dictionary.size() * 2);
  const Number self = added_;
  for (const auto& [key, value] : dictionary) {
    if (!addString(key)) return false;
    references_[place++] = added_;
  }
  for (const auto& [key, value] : dictionary) {
    if (!addValue(value, depth)) return false;
    references_[place++] = added_;
  }
  added_ = self;
  return true;
}

bool Writer::addScalar(const Value& value) {
  const size_t begin = scalars_.size();
  const bool encoded = std::visit(
      [this]<typename T>(const T& scalar) {
        if constexpr (std::is_same_v<T, Value::Array> || std::is_same_v<T, Value::Dictionary>) {
          return false;
        } else {
          return encode(scalar);
        }
      },
      value.storage());
  if (encoded) finishScalar(begin);
  return encoded;
}

bool Writer::addString(const std::string& text) {
  const size_t begin = scalars_.size();
  if (!encode(text)) return false;
  finishScalar(begin);
  return true;
}

void Writer::finishScalar(size_t begin) {
  const auto number = static_cast<Number>(objects_.size());
  objects_.push_back({0, begin, scalars_.size() - begin});
  const auto [place, isNew] = uniqueScalars_.insert(number);
  if (!isNew) {
    objects_.pop_back();
    scalars_.resize(begin);
  }
  added_ = *place;
}

bool Writer::spendBytes(size_t count) {
  if (count > copiedBytesLeft_) return fail("too large");
  copiedBytesLeft_ -= count;
  return true;
}

bool Writer::encode(bool value) {
  scalars_.push_back(value ? kTrue : kFalse);
  return true;
}

bool Writer::encode(int64_t value) {
  if (value >= 0) return encode(static_cast<uint64_t>(value));
  scalars_.push_back(kInteger | 3);
  appendBigEndian(scalars_, static_cast<uint64_t>(value), 8);
  return true;
}

bool Writer::encode(uint64_t value) {
  appendUnsigned(scalars_, value);
  return true;
}

bool Writer::encode(double value) {
  scalars_.push_back(kReal64);
  appendBigEndian(scalars_, std::bit_cast<uint64_t>(value), 8);
  return true;
}

bool Writer::encode(Date value) {
  const double since2001 = value.secondsSince1970 - kEpochSince1970;
  if (!(std::fabs(since2001) <= kFarthestDate)) return fail("a date out of range");
  scalars_.push_back(kDate);
  appendBigEndian(scalars_, std::bit_cast<uint64_t>(since2001), 8);
  return true;
}

bool Writer::encode(const Data& value) {
  if (!spendBytes(value.size())) return false;
  appendMarker(scalars_, kData, value.size());
  scalars_.insert(scalars_.end(), value.begin(), value.end());
  return true;
}

bool Writer::encode(const std::string& value) {
  if (isASCII(value)) {
    if (!spendBytes(value.size())) return false;
    appendMarker(scalars_, kASCII, value.size());
    scalars_.insert(scalars_.end(), value.begin(), value.end());
    return true;
  }
  if (value.size() > Limits::kBytes) return fail("too large");
  std::u16string units;
  for (std::string_view text = value; !text.empty();) {
    const std::optional<char32_t> character = takeCharacter(text);
    if (!character) return fail("a string that is not UTF-8");
    if (*character < 0x10000) {
      units.push_back(static_cast<char16_t>(*character));
    } else {
      const char32_t pair = *character - 0x10000;
      units.push_back(static_cast<char16_t>(0xD800 | pair >> 10));
      units.push_back(static_cast<char16_t>(0xDC00 | (pair & 0x3FF)));
    }
  }
  if (!spendBytes(units.size() * 2)) return false;
  appendMarker(scalars_, kUTF16, units.size());
  for (const char16_t unit : units) appendBigEndian(scalars_, unit, 2);
  return true;
}

PropertyListResult<Data> Writer::assemble() const {
  // Widths hold the count itself, not only the last number: readers check for that.
  const size_t referenceWidth = widthOf(objects_.size());
  Data bytes(kHeader.begin(), kHeader.end());
  std::vector<size_t> offsets;
  offsets.reserve(objects_.size());
  for (const Object& object : objects_) {
    offsets.push_back(bytes.size());
    if (object.kind == 0) {
      const auto begin = scalars_.begin() + static_cast<ptrdiff_t>(object.begin);
      bytes.insert(bytes.end(), begin, begin + static_cast<ptrdiff_t>(object.size));
      continue;
    }
    appendMarker(bytes, object.kind, object.size);
    const size_t count = object.kind == kDictionary ? object.size * 2 : object.size;
    for (size_t index = 0; index < count; ++index) {
      appendBigEndian(bytes, references_[object.begin + index], referenceWidth);
    }
  }
  const size_t table = bytes.size();
  const size_t offsetWidth = widthOf(table);
  for (const size_t offset : offsets) appendBigEndian(bytes, offset, offsetWidth);
  bytes.insert(bytes.end(), kTrailerUnused, 0);
  bytes.push_back(static_cast<uint8_t>(offsetWidth));
  bytes.push_back(static_cast<uint8_t>(referenceWidth));
  appendBigEndian(bytes, objects_.size(), 8);
  appendBigEndian(bytes, 0, 8);  // the root was numbered first
  appendBigEndian(bytes, table, 8);
  if (bytes.size() > Limits::kBytes) return std::unexpected(PropertyListError{"too large"});
  return bytes;
}

}  // namespace

PropertyListResult<Value::Data> writeBinaryPropertyList(const Value& value) {
  return Writer().write(value);
}

}  // namespace platform
