// Holds reader and writer against another implementation of both forms, Python's plistlib.
#include <gtest/gtest.h>

#include <array>
#include <cmath>
#include <cstdio>
#include <fstream>

#include "Platform/values/PropertyList.h"

namespace platform {
namespace {

using namespace std::string_literals;

// What Python prints for a script, run on a file of the given bytes named in sys.argv[1].
std::string runPython(const std::string& script, const Value::Data& bytes) {
  const std::string path = testing::TempDir() + "/python-property-list." + UUID::random().string();
  std::ofstream(path, std::ios::binary)
      .write(reinterpret_cast<const char*>(bytes.data()), static_cast<ptrdiff_t>(bytes.size()));
  const std::string command = "python3 -c '" + script + "' '" + path + "'";
  FILE* pipe = ::popen(command.c_str(), "r");
  std::string output;
  std::array<char, 65536> buffer{};
  while (const size_t size = std::fread(buffer.data(), 1, buffer.size(), pipe)) {
    output.append(buffer.data(), size);
  }
  EXPECT_EQ(::pclose(pipe), 0);
  EXPECT_EQ(std::remove(path.c_str()), 0);
  return output;
}

std::string rewritten(const Value::Data& bytes, const std::string& format) {
  return runPython(
      "import plistlib, sys; from sys import stdout, argv\n"
      "value = plistlib.loads(open(argv[1], \"rb\").read(), fmt=plistlib.FMT_BINARY)\n"
      "stdout.buffer.write(plistlib.dumps(value, fmt=plistlib." +
          format + "))",
      bytes);
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

TEST(PythonPropertyListTest, AgreesOnWhatXMLCannotHold) {
  const Value value = Value::Array{"a\0b"s, Date{978307200.25}, std::nan("")};
  const auto bytes = writeBinaryPropertyList(value);
  ASSERT_TRUE(bytes);
  EXPECT_EQ(rewritten(*bytes, "FMT_BINARY"), std::string(bytes->begin(), bytes->end()));
  EXPECT_EQ(runPython("import plistlib, sys\n"
                      "print(plistlib.loads(open(sys.argv[1], \"rb\").read()))",
                      *bytes),
            "['a\\x00b', datetime.datetime(2001, 1, 1, 0, 0, 0, 250000), nan]\n");
}

TEST(PythonPropertyListTest, ReadsObjectsThatPythonShares) {
  const std::string shared = runPython(
      "import plistlib, sys\n"
      "one = {\"a\": [1, 2.5]}\n"
      "value = [one, one, plistlib.UID(1 << 40)]\n"
      "sys.stdout.buffer.write(plistlib.dumps(value, fmt=plistlib.FMT_BINARY))",
      {});
  const Value one = Value::Dictionary{{"a", Value::Array{1, 2.5}}};
  const auto value =
      readPropertyList({reinterpret_cast<const uint8_t*>(shared.data()), shared.size()});
  ASSERT_TRUE(value) << value.error().reason;
  EXPECT_EQ(*value, Value(Value::Array{one, one, Value::Dictionary{{"CF$UID", int64_t{1} << 40}}}));
}

}  // namespace
}  // namespace platform
