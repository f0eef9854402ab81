#include <gtest/gtest.h>

#include <limits>

#include "Platform/values/PropertyList.h"

namespace platform {
namespace {

using Limits = PropertyListLimits;
using namespace std::string_literals;

void appendNumber(std::string& file, uint64_t number, size_t width) {
  for (size_t left = width; left > 0; --left) {
    file += left > 8 ? '\0' : static_cast<char>(number >> (left - 1) * 8);
  }
}

// A file of the given encoded objects, the first of which is the root.
std::string fileOf(const std::vector<std::string>& objects, size_t referenceWidth = 1,
                   size_t offsetWidth = 4) {
  std::string file = "bplist00";
  std::string table;
  for (const std::string& object : objects) {
    appendNumber(table, file.size(), offsetWidth);
    file += object;
  }
  const size_t tableOffset = file.size();
  file += table + std::string(6, '\0');
  appendNumber(file, offsetWidth, 1);
  appendNumber(file, referenceWidth, 1);
  for (const size_t field : {objects.size(), size_t{0}, tableOffset}) appendNumber(file, field, 8);
  return file;
}

PropertyListResult<Value> readFile(const std::string& file) {
  return readPropertyList({reinterpret_cast<const uint8_t*>(file.data()), file.size()});
}

// A string or an array ("\x5F", "\xAF") whose size is written with four bytes.
std::string sized(const char* marker, const std::string& content) {
  std::string object = marker + "\x12"s;
  appendNumber(object, content.size(), 4);
  return object + content;
}

// The encodings that the writer never uses.
TEST(BinaryPropertyListTest, ReadsWhatOthersWrite) {
  const std::pair<std::string, Value> cases[] = {
      {"\x13\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFE", -2},
      {"\x14" + std::string(15, '\0') + "\x07", 7},
      {"\x14" + std::string(15, '\xFF') + "\xFD", -3},
      {"\x22\x3F\xC0\x00\x00"s, 1.5},
      {"\x4F\x11\x00\x02\x00\xFF"s, Value::Data{0x00, 0xFF}},
      {"\x80\x2A", Value::Dictionary{{"CF$UID", 42}}},
      {"\x87" + std::string(8, '\xFF'), Value::Dictionary{{"CF$UID", UINT64_MAX}}},
  };
  for (const auto& [object, expected] : cases) {
    const auto value = readFile(fileOf({object}));
    ASSERT_TRUE(value) << value.error().reason;
    EXPECT_EQ(*value, expected) << value->description();
  }
  const Value shared = Value::Dictionary{{"k", Value::Array{}}, {"l", Value::Array{}}};
  for (size_t width = 1; width <= 8; ++width) {
    std::string references;
    for (const unsigned reference : {1U, 3U, 2U, 2U}) appendNumber(references, reference, width);
    EXPECT_EQ(readFile(fileOf({"\xD2" + references, "\x51k", "\xA0", "\x51l"}, width, width))
                  .value_or(nullptr),
              shared);
  }
}

TEST(BinaryPropertyListTest, RefusesWhatIsNoPropertyList) {
  const std::pair<std::vector<std::string>, std::string> cases[] = {
      {{"\xC0"}, "a set"},
      {{"\x0F"}, "unknown type"},
      {{"\x15" + std::string(32, '\0')}, "more than 16 bytes"},
      {{"\x14" + std::string(7, '\0') + "\x01" + std::string(8, '\0')}, "beyond 64 bits"},
      {{"\x21\x3C\x00"s}, "real of unknown width"},
      {{"\x33\x7F\xF8\x00\x00\x00\x00\x00\x00"s}, "date out of range"},
      {{"\x51\x80"}, "ASCII"},
      {{"\x61\xD8\x3D"}, "surrogate"},
      {{"\x62\xD8\x3D\x00\x61"s}, "surrogate"},
      {{"\x52" + "a"s}, "cut short"},
      {{"\x5F\x13\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF"}, "cut short"},
      {{"\x6F\x13\x80\x00\x00\x00\x00\x00\x00\x00"s}, "cut short"},
      {{"\x5F\x14" + std::string(16, '\0')}, "its size"},
      {{"\xA1\x01"}, "does not exist"},
      {{"\xD1\x01\x02", "\x51k", "\xA1\x00"s}, "contains itself"},
      {{"\xD1\x01\x01", "\x10\x01"}, "no string"},
      {{"\xD2\x01\x02\x01\x01", "\x51k", "\x61\x00k"s}, "already"},
      {{"\x88" + std::string(9, '\0')}, "more than 8 bytes"},
  };
  for (const auto& [objects, reason] : cases) {
    const auto value = readFile(fileOf(objects));
    ASSERT_FALSE(value) << reason << ", got " << value->description();
    EXPECT_NE(value.error().reason.find(reason), std::string::npos)
        << value.error().reason << ", not " << reason;
  }
}

TEST(BinaryPropertyListTest, ChecksTheTrailer) {
  const std::string good = fileOf({"\x09"}, 1, 1);
  const size_t trailer = good.size() - 32;
  const std::tuple<size_t, size_t, uint64_t> changes[] = {
      // Field, its width, its value.
      {6, 1, 0},  {6, 1, 9},           {7, 1, 0},           {7, 1, 9},
      {8, 8, 0},  {8, 8, 2},           {16, 8, 1},          {8, 8, 1UL << 63},
      {24, 8, 7}, {16, 8, UINT64_MAX}, {24, 8, UINT64_MAX}, {24, 8, 11}};
  ASSERT_TRUE(readFile(good));
  for (const auto& [field, width, number] : changes) {
    std::string file = good.substr(0, trailer + field);
    appendNumber(file, number, width);
    file += good.substr(file.size());
    EXPECT_FALSE(readFile(file)) << field << " " << number;
  }
  for (size_t size = 0; size < good.size(); ++size) EXPECT_FALSE(readFile(good.substr(0, size)));
}

TEST(BinaryPropertyListTest, HoldsItsLimits) {
  std::vector<std::string> nested;
  for (char depth = 1; depth <= static_cast<char>(Limits::kDepth); ++depth) {
    nested.push_back("\xA1"s + depth);
  }
  nested.push_back("\xA0");
  EXPECT_FALSE(readFile(fileOf(nested)));
  nested[Limits::kDepth] = "\x09";
  const auto deepest = readFile(fileOf(nested));
  ASSERT_TRUE(deepest);
  EXPECT_TRUE(writeBinaryPropertyList(*deepest));
  EXPECT_FALSE(writeBinaryPropertyList(Value::Array{*deepest}));

  // Ten levels of arrays, each of which uses the next ten times.
  std::vector<std::string> laughs;
  for (char level = 1; level <= 10; ++level) laughs.push_back("\xAA" + std::string(10, level));
  laughs.push_back("\xA0");
  EXPECT_EQ(readFile(fileOf(laughs)).error().reason, "too many values");

  // One value short of the limit, and at it: the array itself counts.
  for (const bool isTooMany : {false, true}) {
    const size_t count = Limits::kValues - (isTooMany ? 0 : 1);
    const auto many = readFile(fileOf({sized("\xAF", std::string(count, '\x01')), "\x09"}));
    EXPECT_EQ(!many, isTooMany);
    EXPECT_EQ(!writeBinaryPropertyList(Value::Array(count, true)), isTooMany);
  }

  // A long string used a hundred times, as a value and as a key of a hundred dictionaries.
  const std::string text = sized("\x5F", std::string(Limits::kBytes / 64, 'x'));
  const std::string hundred = sized("\xAF", std::string(100, '\x01'));
  EXPECT_FALSE(readFile(fileOf({hundred, text})));
  EXPECT_FALSE(readFile(fileOf({hundred, "\xD1\x02\x03", text, "\x09"})));
  // The writer refuses what the reader would: the hundred, though it would write the string once.
  EXPECT_FALSE(writeBinaryPropertyList(Value::Array(100, std::string(Limits::kBytes / 64, 'x'))));
}

TEST(BinaryPropertyListTest, RefusesToWriteWhatHasNoForm) {
  for (const Value& value :
       {Value(), Value(UUID::random()), Value("\xED\xA0\x80"), Value("\xC0\x80"),
        Value("\xF4\x90\x80\x80"), Value(Date{std::numeric_limits<double>::infinity()})}) {
    EXPECT_FALSE(writeBinaryPropertyList(Value::Array{value})) << value.typeName();
  }
  EXPECT_FALSE(writeBinaryPropertyList(Value::Dictionary{{"\xFF", 1}}));
}

}  // namespace
}  // namespace platform
