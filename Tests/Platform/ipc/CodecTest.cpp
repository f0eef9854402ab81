#include "Platform/ipc/Codec.h"

#include <gtest/gtest.h>

#include <limits>

#include "Tests/Platform/ipc/HexBytes.h"

namespace platform::ipc {
namespace {

constexpr int64_t kLeast = std::numeric_limits<int64_t>::min();
constexpr uint64_t kGreatest = std::numeric_limits<uint64_t>::max();
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

std::vector<uint8_t> encodedBody(const Message& message) {
  auto frame = encodeFrame(message, 7, 0).value();
  frame.erase(frame.begin(), frame.begin() + kFrameHeaderSize);
  return frame;
}

// Arrays inside each other, as the value of a key: one level more than `depth`.
Value nestedArrays(size_t depth) {
  Value value;
  for (size_t level = 0; level < depth; ++level) {
    Value::Array outer;
    outer.push_back(std::move(value));
    value = Value(std::move(outer));
  }
  return value;
}

TEST(CodecTest, WritesShortestFormsAndReadsThemBack) {
  const struct {
    Value value;
    std::string hex;
  } cases[] = {
      {nullptr, "f6"},
      {true, "f5"},
      {uint64_t{23}, "17"},
      {uint64_t{24}, "1818"},
      {uint64_t{255}, "18ff"},
      {uint64_t{256}, "190100"},
      {uint64_t{65536}, "1a00010000"},
      {uint64_t{1} << 32, "1b0000000100000000"},
      {kGreatest, "1bffffffffffffffff"},
      {int64_t{5}, "05"},
      {int64_t{-25}, "3818"},
      {kLeast, "3b7fffffffffffffff"},
      {1.5, "fb3ff8000000000000"},
      {"caf\xC3\xA9 \xF0\x9F\x98\x80", "6a636166c3a920f09f9880"},
      {std::string(24, 'x'), "7818" + repeated("78", 24)},
      {Value::Data{0, 255}, "4200ff"},
      {kUUID, "d82550000102030405060708090a0b0c0d0e0f"},
      {Date{1.5}, "c1fb3ff8000000000000"},
      {Value::Array{uint64_t{1}, "x", Value::Array{nullptr}}, "83 01 6178 81f6"},
      {Value::Dictionary{{"b", true}, {"a", Value::Dictionary{}}}, "a2 6161 a0 6162 f5"},
  };
  for (const auto& [value, hex] : cases) {
    Message message;
    message.set("A", value);
    EXPECT_EQ(encodedBody(message), bodyWith(hex)) << value.description();
    const auto read = decodeMessage(bodyWith(hex));
    ASSERT_TRUE(read) << hex << ": " << read.error().reason;
    EXPECT_EQ(*read->value("A"), value) << hex;
  }
}

TEST(CodecTest, ReadsWhatOtherEncodersWrite) {
  const struct {
    std::string hex;
    Value value;
  } cases[] = {
      {"1800", uint64_t{0}},  // not the shortest form
      {"1b0000000000000001", uint64_t{1}},
      {"f93e00", 1.5},  // 16 and 32 bits
      {"fa3fc00000", 1.5},
      {"f90001", 0x1p-24},
      {"f9fc00", -std::numeric_limits<double>::infinity()},
      {"c101", Date{1}},
      {"c120", Date{-1}},
      {"c1f93e00", Date{1.5}},
      {"7f 6161 60 6162 ff", "ab"},  // strings in chunks
      {"7f ff", ""},
      {"5f 4101 420203 ff", Value::Data{1, 2, 3}},
      {"d825 5f 48 0001020304050607 48 08090a0b0c0d0e0f ff", kUUID},
      {"9f 01 9f ff 02 ff", Value::Array{uint64_t{1}, Value::Array{}, uint64_t{2}}},
      {"bf 7f 6162 ff 01 6161 02 ff", Value::Dictionary{{"a", uint64_t{2}}, {"b", uint64_t{1}}}},
  };
  for (const auto& [hex, value] : cases) {
    const auto read = decodeMessage(bodyWith(hex));
    ASSERT_TRUE(read) << hex << ": " << read.error().reason;
    EXPECT_EQ(*read->value("A"), value) << hex;
  }
  EXPECT_TRUE(decodeMessage(hexBytes("bfff")));
}

TEST(CodecTest, RefusesMalformedBodies) {
  const struct {
    std::string what;
    std::vector<std::string> bodies;
  } cases[] = {
      {"not one map", {"", "01", "80", "6161", "ff", "a0 00"}},
      {"a key without its value", {"a1 6141", "bf 6141 ff"}},
      {"a key that is not plain text", {"a1 01 02", "a1 4141 02", "a1 c1 6141 02", "a1 a0 02"}},
      {"a key twice", {"a2 6141 01 6141 02", "a3 6142 01 6141 02 6142 03"}},
      {"claims", {"ba ffffffff", "bb ffffffffffffffff 6141 00", "7a ffffffff"}},
  };
  for (const auto& [what, bodies] : cases) {
    for (const auto& body : bodies) EXPECT_FALSE(decodeMessage(hexBytes(body))) << what << body;
  }
}

TEST(CodecTest, RefusesMalformedValues) {
  const struct {
    std::string what;
    std::vector<std::string> values;
  } cases[] = {
      {"claims that the bytes do not bear out",
       {"9a ffffffff", "9b 0000000100000000 00", "9b 7fffffffffffffff 00",
        "5b ffffffffffffffff 00"}},
      {"the end in the middle", {"81", "82 01", "7f 6161"}},
      {"below -2^63", {"3b 8000000000000000"}},
      {"undefined, simple, reserved", {"f7", "f0", "f820", "e0", "1c", "fc"}},
      {"no UTF-8, or a NUL", {"61ff", "62c080", "63eda080", "64f4908080", "62c3", "6100"}},
      {"a character cut by chunks", {"7f 61c3 61a9 ff"}},
      {"no chunk of the string",
       {"7f 4161 ff", "5f 6161 ff", "7f 7f 6161 ff ff", "7f 01 ff", "7f c1 ff", "7f a0 ff"}},
      {"no UUID",
       {"d825 4f 000102030405060708090a0b0c0d0e", "d825 51 000102030405060708090a0b0c0d0e0f10",
        "d825 70 30303030303030303030303030303030", "d825 01"}},
      {"no date", {"c1 6130", "c1 f5", "c1 80", "c1 c1 01", "9f c1 ff"}},
      {"unknown tags", {"c0 6130", "c2 4101", "d818 4101", "d9d9f7 01"}},
  };
  for (const auto& [what, values] : cases) {
    for (const auto& value : values) EXPECT_FALSE(decodeMessage(bodyWith(value))) << what << value;
  }
}

TEST(CodecTest, KeepsToItsLimitsInBothDirections) {
  Message message;
  message.set("A", nestedArrays(kMaximumNesting - 1));
  EXPECT_TRUE(decodeMessage(encodedBody(message)));
  message.set("A", nestedArrays(kMaximumNesting));
  EXPECT_FALSE(encodeFrame(message, 1, 0));
  EXPECT_TRUE(decodeMessage(bodyWith(repeated("81", kMaximumNesting - 1) + "00")));
  EXPECT_FALSE(decodeMessage(bodyWith(repeated("81", kMaximumNesting) + "00")));
  EXPECT_FALSE(decodeMessage(bodyWith(repeated("9f", kMaximumBodySize / 16))));

  message.set("A", Value::Array(kMaximumValues - 2));
  EXPECT_TRUE(decodeMessage(encodedBody(message)));
  message.set("A", Value::Array(kMaximumValues - 1));
  EXPECT_FALSE(encodeFrame(message, 1, 0));
  std::vector<uint8_t> manyNulls = bodyWith("9f");
  manyNulls.resize(manyNulls.size() + kMaximumValues - 1, 0xF6);
  manyNulls.push_back(0xFF);
  EXPECT_FALSE(decodeMessage(manyNulls));

  constexpr size_t kOverhead = 1 + 2 + 5;  // map, key, head of the data
  message.set("A", Value::Data(kMaximumBodySize - kOverhead));
  EXPECT_EQ(encodedBody(message).size(), kMaximumBodySize);
  message.set("A", Value::Data(kMaximumBodySize - kOverhead + 1));
  EXPECT_FALSE(encodeFrame(message, 1, 0));
  for (const std::string& text : {std::string("\xFF"), std::string("a\0b", 3)}) {
    message.set("A", text);
    EXPECT_FALSE(encodeFrame(message, 1, 0));
  }
}

TEST(CodecTest, ReadsAndWritesHeaders) {
  const auto written = encodeHeader({.bodyLength = 0x010203, .sequence = 0x0A0B0C0D, .flags = 1});
  EXPECT_EQ(std::vector(written.begin(), written.end()),
            hexBytes("54535931 03020100 0d0c0b0a 01000000"));
  const auto read = decodeHeader(written);
  ASSERT_TRUE(read);
  EXPECT_EQ(read->bodyLength, 0x010203U);
  EXPECT_EQ(read->sequence, 0x0A0B0C0DU);
  EXPECT_EQ(read->flags, kReplyFlag);

  const struct {
    std::string hex;
    bool accepted;
  } cases[] = {
      {"54535931 00000001 00000000 00000000", true},
      {"54535931 01000001 00000000 00000000", false},
      {"54535931 ffffffff 00000000 00000000", false},
      {"54535932 00000000 00000000 00000000", false},
      {"54535931 00000000 00000000 02000000", false},
  };
  for (const auto& [hex, accepted] : cases) {
    const auto bytes = hexBytes(hex);
    const std::span<const uint8_t, kFrameHeaderSize> header(bytes.data(), kFrameHeaderSize);
    EXPECT_EQ(decodeHeader(header).has_value(), accepted) << hex;
  }
}

TEST(MessageTest, AnswersNothingForAnotherType) {
  const Message message({{"large", uint64_t{1} << 63}, {"small", uint64_t{7}}, {"text", "x"}});
  EXPECT_EQ(message.uint64("large"), uint64_t{1} << 63);
  EXPECT_EQ(message.int64("large"), std::nullopt);
  EXPECT_EQ(message.int64("small"), 7);
  EXPECT_EQ(message.boolean("small"), std::nullopt);
  EXPECT_EQ(message.string("small"), nullptr);
  EXPECT_EQ(message.string("missing"), nullptr);
}

}  // namespace
}  // namespace platform::ipc
