#include "Platform/values/Value.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>

namespace platform {
namespace {

constexpr uint64_t kMost = std::numeric_limits<uint64_t>::max();
constexpr int64_t kLeast = std::numeric_limits<int64_t>::min();

TEST(UUIDTest, ReadsAndWritesOnlyTheTextForm) {
  const UUID uuid({0x01, 0x23, 0x45, 0x67, 0x89, 0xAB, 0xCD, 0xEF, 0xFE, 0xDC, 0xBA, 0x98, 0x76,
                   0x54, 0x32, 0x10});
  EXPECT_EQ(uuid.string(), "01234567-89AB-CDEF-FEDC-BA9876543210");
  EXPECT_EQ(UUID::parse("01234567-89AB-CDEF-FEDC-BA9876543210"), uuid);
  EXPECT_EQ(UUID::parse("01234567-89ab-cdef-fedc-ba9876543210"), uuid);
  for (const char* text :
       {"", "01234567-89AB-CDEF-FEDC-BA987654321", "01234567-89AB-CDEF-FEDC-BA98765432100",
        "0123456789AB-CDEF-FEDC-BA9876543210-", "01234567-89AB-CDEF-FEDC-BA987654321G",
        "01234567+89AB-CDEF-FEDC-BA9876543210", "{1234567-89AB-CDEF-FEDC-BA987654321}",
        "01234567-89AB-CDEF-FEDC-BA98765432\xB1\xB0"}) {
    EXPECT_FALSE(UUID::parse(text)) << text;
  }
  const UUID random = UUID::random();
  EXPECT_NE(random, UUID::random());
  EXPECT_EQ(random.bytes()[6] >> 4, 4);
  EXPECT_EQ(random.bytes()[8] >> 6, 2);
}

TEST(ValueTest, ConvertsNumbers) {
  struct Case {
    Value value;
    std::optional<int64_t> int64;
    std::optional<uint64_t> uint64;
    std::optional<bool> boolean;
    std::optional<uint64_t> unsignedNumber;
  };
  const Case cases[] = {
      {true, {}, {}, true, 1},
      {-1, -1, {}, true, kMost},
      {kLeast, kLeast, {}, true, uint64_t{1} << 63},
      {kMost, {}, kMost, true, kMost},
      {0U, 0, 0, false, 0},
      {-0.0, {}, {}, false, 0},
      {-2.9, {}, {}, true, 0},
      {2.9, {}, {}, true, 2},
      {0x1p64, {}, {}, true, kMost},
      {0x1.fffffffffffffp63, {}, {}, true, 0xFFFFFFFFFFFFF800},
      {std::nan(""), {}, {}, true, 0},
      {"1", {}, {}, {}, {}},
      {nullptr, {}, {}, {}, {}},
  };
  for (const Case& each : cases) {
    SCOPED_TRACE(each.value.description());
    EXPECT_EQ(each.value.asInt64(), each.int64);
    EXPECT_EQ(each.value.asUInt64(), each.uint64);
    EXPECT_EQ(each.value.booleanOfNumber(), each.boolean);
    EXPECT_EQ(each.value.unsignedOfNumber(), each.unsignedNumber);
    EXPECT_EQ(each.value.isNumber(), each.boolean.has_value());
  }
}

TEST(ValueTest, ComparesByTypeAndValue) {
  EXPECT_EQ(Value(int64_t{1}), Value(uint64_t{1}));
  EXPECT_EQ(Value(Value::Array{int64_t{1}}), Value(Value::Array{uint64_t{1}}));
  EXPECT_EQ(Value(kMost), Value(kMost));
  EXPECT_NE(Value(-1), Value(kMost));
  EXPECT_NE(Value(true), Value(1));
  EXPECT_NE(Value(1.0), Value(1));
  EXPECT_NE(Value("a"), Value(Value::Data{'a'}));
  EXPECT_NE(Value(), Value(false));
}

TEST(ValueTest, DescribesItselfInOneShortLine) {
  const std::pair<Value, std::string> cases[] = {
      {Value::Dictionary{{"b", Value::Array{1, "x", nullptr}}, {"a", true}},
       "{a = true; b = (1, x, null)}"},
      {Value::Data{0x00, 0xAB}, "<00ab>"},
      {Date{978307200}, "2001-01-01T00:00:00Z"},
      {Date{-0.5}, "1969-12-31T23:59:59Z"},
      {Date{1e300}, "1e+300 seconds since 1970"},
      {std::string("line\nline\0", 10), "line\\x0Aline\\x00"},
      {std::string(1000, 'x'), std::string(1000, 'x')},
      {std::string(1001, 'x'), std::string(1000, 'x') + "…"},
      {std::string(999, 'x') + "éé", std::string(999, 'x') + "…"},
  };
  for (const auto& [value, text] : cases) EXPECT_EQ(value.description(), text);
  const Value large = Value::Array(100'000, Value::Dictionary{{"key", Value::Data(1000)}});
  EXPECT_LE(large.description().size(), 1000 + std::string("…").size());
}

}  // namespace
}  // namespace platform
