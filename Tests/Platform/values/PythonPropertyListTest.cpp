// Holds reader and writer against another implementation of both forms, Python's plistlib.
#include <gtest/gtest.h>

#include <array>
#include <cmath>
#include <cstdio>
#include <fstream>
#include <stdexcept>

#include "Platform/values/PropertyList.h"

namespace platform {
namespace {

// What Python makes of a binary property list when it reads it and writes it in a format.
std::string rewritten(const Value::Data& bytes, const std::string& format) {
  const std::string path = testing::TempDir() + "/python-property-list." + UUID::random().string();
  std::ofstream(path, std::ios::binary)
      .write(reinterpret_cast<const char*>(bytes.data()), static_cast<ptrdiff_t>(bytes.size()));
  const std::string command =
      "python3 -c 'import plistlib, sys; from sys import stdout, argv\n"
      "value = plistlib.loads(open(argv[1], \"rb\").read(), fmt=plistlib.FMT_BINARY)\n"
      "stdout.buffer.write(plistlib.dumps(value, fmt=plistlib." +
      format + "))' '" + path + "'";
  FILE* pipe = ::popen(command.c_str(), "r");
  if (pipe == nullptr) throw std::runtime_error("popen");
  std::string output;
  std::array<char, 65536> buffer{};
  while (const size_t size = std::fread(buffer.data(), 1, buffer.size(), pipe)) {
    output.append(buffer.data(), size);
  }
  EXPECT_EQ(::pclose(pipe), 0);
  EXPECT_EQ(std::remove(path.c_str()), 0);
  return output;
}

Value numberedStrings(size_t count) {
  Value::Array array;
  for (size_t index = 0; index < count; ++index) array.emplace_back(std::to_string(index));
  return array;
}

Value sample() {
  return Value::Dictionary{
      {"integers", Value::Array{0, 255, 256, 65535, 65536, 4294967295U, uint64_t{1} << 32,
                                INT64_MAX, uint64_t{1} << 63, UINT64_MAX, -1, INT64_MIN}},
      {"reals", Value::Array{0.5, -1e300, 5e-324, HUGE_VAL, -HUGE_VAL}},
      {"dates", Value::Array{Date{0}, Date{978307200}, Date{-62135596800}, Date{253402300799}}},
      {"types", Value::Array{true, 1, 1.0, false, 0, "1", Value::Data{'1'}}},
      {"strings", Value::Array{"", "fourteen chars", "fifteen chars !", "é", "€😀", "é<&>\"'",
                               std::string(70'000, 'x'), "strings", "two\nlines\ttab"}},
      {"data", Value::Array{Value::Data{}, Value::Data(1, 7), Value::Data(300, 8)}},
      {"empty", Value::Array{Value::Array{}, Value::Dictionary{}, Value::Dictionary{{"", ""}}}},
      {"\uFFFD sorts before the astral planes", 1},
      {"😀", 2},
  };
}

TEST(PythonPropertyListTest, WritesTheSameBytesAsPythonAndReadsBothItsForms) {
  // Counts of objects on either side of the widths of references and offsets.
  const Value cases[] = {sample(), numberedStrings(254), numberedStrings(255), numberedStrings(256),
                         numberedStrings(66'000)};
  for (const Value& value : cases) {
    const auto bytes = writeBinaryPropertyList(value);
    ASSERT_TRUE(bytes) << bytes.error().reason;
    EXPECT_TRUE(rewritten(*bytes, "FMT_BINARY") == std::string(bytes->begin(), bytes->end()))
        << value.description();
    EXPECT_EQ(readBinaryPropertyList(*bytes).value_or(nullptr), value);
    const auto xml = readXMLPropertyList(rewritten(*bytes, "FMT_XML"));
    ASSERT_TRUE(xml) << xml.error().reason;
    EXPECT_EQ(*xml, value);
  }
}

}  // namespace
}  // namespace platform
