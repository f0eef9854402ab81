#include <gtest/gtest.h>

#include <cmath>
#include <limits>

#include "Platform/values/PropertyList.h"

namespace platform {
namespace {

using namespace std::string_literals;

TEST(XMLPropertyListTest, ReadsValues) {
  const std::pair<std::string, Value> cases[] = {
      {"<integer> -9223372036854775808\n</integer>", std::numeric_limits<int64_t>::min()},
      {"<integer>18446744073709551615</integer>", UINT64_MAX},
      {"<integer>-0X10</integer>", -16},
      {"<real>-1.5e3</real>", -1500.0},
      {"<real>+infinity</real>", HUGE_VAL},
      {"<date>2000-02-29T23:59:59Z</date>", Date{951868799}},
      {"<date>1969-12-31T23:59:58Z</date>", Date{-2}},
      {"<data>\n\tAP8Q\n\tAA = =\n</data>", Value::Data{0x00, 0xFF, 0x10, 0x00}},
      {"<string/>", ""},
      {"<string> \r\n </string>", " \n "},
      {"<string>a&amp;lt;&lt;&#233;&#x1F600;&#13;</string>", "a&lt;<é😀\r"},
      {"<string>a<!-- b --> <!-- c --><![CDATA[<&lt;>]]> d</string>", "a <&lt;> d"},
      {"<array> <!-- none --> </array>", Value::Array{}},
      {"<dict><key>a &gt; b</key><array><dict/></array><key/><true/></dict>",
       Value::Dictionary{{"a > b", Value::Array{Value::Dictionary{}}}, {"", true}}},
  };
  for (const auto& [element, expected] : cases) {
    const auto value = readXMLPropertyList(
        "\xEF\xBB\xBF<?xml version=\"1.0\" encoding=\"utf-8\"?>\n"
        "<!DOCTYPE plist PUBLIC \"-//X//DTD 1.0//EN\" \"x.dtd\">\n"
        "<plist version=\"1.0\">\n" +
        element + "\n</plist>\n");
    ASSERT_TRUE(value) << element << ": " << value.error().reason;
    EXPECT_EQ(*value, expected) << element << ": " << value->description();
    EXPECT_TRUE(readXMLPropertyList(element)) << element;
  }
  EXPECT_TRUE(std::isnan(*readXMLPropertyList("<real>NaN</real>").value_or(0.0).asDouble()));
}

TEST(XMLPropertyListTest, RefusesWhatIsNoPropertyList) {
  const std::string cases[] = {
      "",
      "<plist/>",
      "<plist><true/><true/></plist>",
      "<plist><true/>",
      "<true>1</true>",
      "<integer/>",
      "<integer>18446744073709551616</integer>",
      "<integer>-9223372036854775809</integer>",
      "<integer>1.0</integer>",
      "<real>1.0x</real>",
      "<date>2001-02-29T00:00:00Z</date>",
      "<date>2001-01-01T24:00:00Z</date>",
      "<date>2001-01-01T00:00: 1Z</date>",
      "<data>AA=</data>",
      "<data>AA==AA==</data>",
      "<dict><key>a</key></dict>",
      "<dict><key>a</key><key>b</key></dict>",
      "<dict><key>a</key><true/><key>a</key><true/></dict>",
      "<array>x</array>",
      "<string>&unknown;</string>",
      "<string>&#0;</string>",
      "<string>&#xD800;</string>",
      "<string>\xC3</string>",
      "<string>a\0b</string>"s,
      "<string>\x01</string>",
      "<?xml version='1.0' encoding='ISO-8859-1'?><true/>",
      "<!DOCTYPE plist [<!ENTITY a 'x'>]><plist><string>&a;</string></plist>",
      "<!DOCTYPE plist [<!ENTITY a SYSTEM 'file:///etc/passwd'>]><string>&a;</string>",
  };
  for (const std::string& text : cases) {
    const auto value = readXMLPropertyList(text);
    ASSERT_FALSE(value) << text << ": " << value->description();
    EXPECT_FALSE(value.error().reason.empty()) << text;
  }
}

TEST(XMLPropertyListTest, HoldsItsLimits) {
  const auto repeated = [](std::string_view text, size_t count) {
    std::string all;
    for (size_t index = 0; index < count; ++index) all += text;
    return all;
  };
  const auto nested = [&](size_t depth) {
    return readXMLPropertyList(repeated("<array>", depth) + repeated("</array>", depth));
  };
  EXPECT_TRUE(nested(PropertyListLimits::kDepth));
  EXPECT_FALSE(nested(PropertyListLimits::kDepth + 1));
  EXPECT_FALSE(nested(900'000));
  const std::string whole =
      "<true/>" +
      std::string(PropertyListLimits::kXMLBytes - std::string_view("<true/>").size(), ' ');
  EXPECT_TRUE(readXMLPropertyList(whole));
  EXPECT_FALSE(readXMLPropertyList(whole + ' '));
}

}  // namespace
}  // namespace platform
