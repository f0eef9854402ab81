#include "Platform/ipc/Codec.h"

#include <gtest/gtest.h>

#include <limits>

#include "Tests/Platform/ipc/HexBytes.h"

namespace platform::ipc {
namespace {

const UUID kUUID({0, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15});

std::string repeated(std::string_view text, size_t count) {
  std::string result;
  for (size_t index = 0; index < count; ++index) result += text;
  return result;
}

// The body of a message with one key, "A".
std::vector<uint8_t> bodyWith(const std::string& hexValue) {
  return hexBytes("a16141" + hexValue);
}

// The body of a message with one key, "A"; nothing when it cannot be sent.
std::vector<uint8_t> encodedBody(Value value) {
  Message message;
  message.set("A", std::move(value));
  const auto frame = encodeFrame(message, 7, 0);
  if (!frame) return {};
  return {frame->begin() + kFrameHeaderSize, frame->end()};
}

struct Encoding {
  Value value;
  std::string hex;
};

void expectRead(const Encoding& encoding) {
  const auto read = decodeMessage(bodyWith(encoding.hex));
  ASSERT_TRUE(read) << encoding.hex << ": " << read.error().reason;
  EXPECT_EQ(*read->value("A"), encoding.value) << encoding.hex;
}

TEST(CodecTest, WritesShortestFormsAndReadsThemBack) {
  const Encoding cases[] = {
      {nullptr, "f6"},
      {true, "f5"},
      {uint64_t{23}, "17"},
      {uint64_t{24}, "1818"},
      {uint64_t{256}, "190100"},
      {std::numeric_limits<uint64_t>::max(), "1bffffffffffffffff"},
      {int64_t{-25}, "3818"},
      {std::numeric_limits<int64_t>::min(), "3b7fffffffffffffff"},
      {1.5, "fb3ff8000000000000"},
      {"caf\xC3\xA9 \xF0\x9F\x98\x80", "6a636166c3a920f09f9880"},
      {std::string(24, 'x'), "7818" + repeated("78", 24)},
      {Value::Data{0, 255}, "4200ff"},
      {kUUID, "d82550000102030405060708090a0b0c0d0e0f"},
      {Date{1.5}, "c1fb3ff8000000000000"},
      {Value::Array{uint64_t{1}, "x", Value::Array{nullptr}}, "83 01 6178 81f6"},
      {Value::Dictionary{{"b", true}, {"a", Value::Dictionary{}}}, "a2 6161 a0 6162 f5"},
  };
  for (const Encoding& encoding : cases) {
    EXPECT_EQ(encodedBody(encoding.value), bodyWith(encoding.hex)) << encoding.hex;
    expectRead(encoding);
  }
}

TEST(CodecTest, ReadsWhatOtherEncodersWrite) {
  const Encoding cases[] = {
      {uint64_t{1}, "1b0000000000000001"},  // not the shortest form
      {1.5, "f93e00"},                      // 16 and 32 bits
      {1.5, "fa3fc00000"},
      {0x1p-24, "f90001"},
      {-std::numeric_limits<double>::infinity(), "f9fc00"},
      {Date{-1}, "c120"},
      {"ab", "7f 6161 60 6162 ff"},  // strings in chunks
      {Value::Data{1, 2, 3}, "5f 4101 420203 ff"},
      {kUUID, "d825 5f 48 0001020304050607 48 08090a0b0c0d0e0f ff"},
      {Value::Array{uint64_t{1}, Value::Array{}, uint64_t{2}}, "9f 01 9f ff 02 ff"},
      {Value::Dictionary{{"a", uint64_t{2}}, {"b", uint64_t{1}}}, "bf 7f 6162 ff 01 6161 02 ff"},
  };
  for (const Encoding& encoding : cases) expectRead(encoding);
}

TEST(CodecTest, RefusesMalformedBodiesAndValues) {
  for (const char* body :
       {"", "01", "80", "ff", "a0 00",              // not one map
        "a1 6141", "bf 6141 ff",                    // a key without its value
        "a1 01 02", "a1 4141 02", "a1 c1 6141 02",  // a key that is not plain text
        "a2 6141 01 6141 02", "ba ffffffff",        // twice; a claim
        "bb ffffffffffffffff 6141 00", "7a ffffffff"}) {
    EXPECT_FALSE(decodeMessage(hexBytes(body))) << body;
  }
  const std::pair<const char*, std::vector<std::string>> cases[] = {
      {"claims that the bytes do not bear out",
       {"9a ffffffff", "9b 0000000100000000 00", "9b 7fffffffffffffff 00",
        "5b ffffffffffffffff 00"}},
      {"the end in the middle", {"81", "82 01", "7f 6161"}},
      {"below -2^63", {"3b 8000000000000000"}},
      {"undefined, simple, reserved", {"f7", "f0", "1c"}},
      {"no UTF-8, or a NUL", {"61ff", "62c080", "63eda080", "64f4908080", "62c3", "6100"}},
      {"a character cut by chunks", {"7f 61c3 61a9 ff"}},
      {"no chunk of the string", {"7f 4161 ff", "5f 6161 ff", "7f 7f 6161 ff ff", "7f 01 ff"}},
      {"no UUID", {"d825 4f 000102030405060708090a0b0c0d0e", "d825 01"}},
      {"no date", {"c1 6130", "c1 f5", "c1 c1 01", "9f c1 ff"}},
      {"unknown tags", {"c0 6130", "c2 4101", "d9d9f7 01"}},
  };
  for (const auto& [what, values] : cases) {
    for (const auto& value : values) EXPECT_FALSE(decodeMessage(bodyWith(value))) << what << value;
  }
}

TEST(CodecTest, KeepsToItsLimitsInBothDirections) {
  Value nested;
  for (size_t level = 1; level < kMaximumNesting; ++level) nested = Value::Array{nested};
  EXPECT_TRUE(decodeMessage(encodedBody(nested)));
  EXPECT_TRUE(encodedBody(Value::Array{nested}).empty());
  EXPECT_FALSE(decodeMessage(bodyWith(repeated("81", kMaximumNesting) + "00")));

  EXPECT_TRUE(decodeMessage(encodedBody(Value::Array(kMaximumValues - 2))));
  EXPECT_TRUE(encodedBody(Value::Array(kMaximumValues - 1)).empty());
  EXPECT_FALSE(decodeMessage(bodyWith("9f" + repeated("f6", kMaximumValues - 1) + "ff")));

  constexpr size_t kOverhead = 1 + 2 + 5;  // map, key, head of the data
  EXPECT_EQ(encodedBody(Value::Data(kMaximumBodySize - kOverhead)).size(), kMaximumBodySize);
  EXPECT_TRUE(encodedBody(Value::Data(kMaximumBodySize - kOverhead + 1)).empty());
  for (const std::string& text : {std::string("\xFF"), std::string("a\0b", 3)}) {
    EXPECT_TRUE(encodedBody(text).empty());
  }
}

}  // namespace
}  // namespace platform::ipc
