#include "platform/linux/data/PugixmlPropertyLists.h"

#include <gtest/gtest.h>

#include <cmath>
#include <string>

#include "platform/base/Limits.h"

namespace kyt {
namespace {

constexpr char kHead[] =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
    "<!DOCTYPE plist PUBLIC \"-//EXAMPLE//DTD PLIST 1.0//EN\" \"http://www.example.com/PropertyList-1.0.dtd\">\n";

Value parsed(const std::string& body) {
  auto result = PugixmlPropertyLists().parse(kHead + ("<plist version=\"1.0\">" + body + "</plist>\n"));
  if (const Error* error = std::get_if<Error>(&result)) {
    ADD_FAILURE() << error->localizedDescription << " in " << body;
    return {};
  }
  return std::get<Value>(result);
}

std::string errorOf(const std::string& document) {
  auto result = PugixmlPropertyLists().parse(document);
  const Error* error = std::get_if<Error>(&result);
  if (error == nullptr) return "no error";
  EXPECT_EQ(error->domain, kPropertyListErrorDomain);
  return error->localizedDescription;
}
std::string errorIn(const std::string& body) {
  return errorOf("<plist>" + body + "</plist>");
}

std::string nested(int depth) {
  std::string text;
  for (int i = 0; i < depth; ++i) text += "<array>";
  for (int i = 0; i < depth; ++i) text += "</array>";
  return text;
}

TEST(PropertyLists, ReadEveryKindOfElement) {
  const Value value = parsed(
      "<dict>\n <key>s</key> <string> a b </string>\n<key>i</key><integer>-7</integer><key>r</key><real>2.5</real>"
      "<key>t</key><true/><key>f</key><false></false><key>d</key><date>2026-01-31T12:00:00Z</date>"
      "<key>x</key><data>\n\tAAEC\n\t/w==\n</data><key>a</key><array><string/><dict/></array></dict>");
  EXPECT_EQ(value, Value(Dictionary{{"s", " a b "},
                                    {"i", -7},
                                    {"r", 2.5},
                                    {"t", true},
                                    {"f", false},
                                    {"d", Date{1769860800}},
                                    {"x", Data(std::string_view("\0\1\2\xFF", 4))},
                                    {"a", Array{"", Dictionary()}}}));
  EXPECT_EQ(value.dictionary()->find("t")->kind(), Value::Kind::boolean);
  EXPECT_EQ(value.dictionary()->find("r")->kind(), Value::Kind::real);
}

TEST(PropertyLists, ReadIntegersOfSixtyFourBits) {
  EXPECT_EQ(parsed("<integer>9223372036854775807</integer>").integer(), INT64_MAX);
  EXPECT_EQ(parsed("<integer>-9223372036854775808</integer>").integer(), INT64_MIN);
  EXPECT_EQ(parsed("<integer>9223372036854775808</integer>").unsignedInteger(), uint64_t{1} << 63);
  EXPECT_EQ(parsed("<integer>18446744073709551615</integer>").unsignedInteger(), UINT64_MAX);
  EXPECT_EQ(parsed("<integer> 0xfF </integer>").integer(), 255);
  EXPECT_EQ(parsed("<integer>+5</integer>").integer(), 5);
  EXPECT_EQ(parsed("<integer>-0x10</integer>").integer(), -16);
  for (const char* text :
       {"", " ", "18446744073709551616", "-9223372036854775809", "1 2", "x", "0x", "--1", "1.0"})
    EXPECT_EQ(errorIn("<integer>" + std::string(text) + "</integer>"),
              "The element \"integer\" holds no such value (offset 8)")
        << text;
}

TEST(PropertyLists, ReadReals) {
  EXPECT_EQ(parsed("<real>1e3</real>").real(), 1000);
  EXPECT_EQ(parsed("<real>+0.1</real>").real(), 0.1);
  EXPECT_EQ(parsed("<real>-infinity</real>").real(), -HUGE_VAL);
  EXPECT_TRUE(std::isnan(parsed("<real>nan</real>").real().value_or(0)));
  for (const char* text : {"", "1x", "+-1", "1e999"})
    EXPECT_EQ(errorIn("<real>" + std::string(text) + "</real>"),
              "The element \"real\" holds no such value (offset 8)");
}

TEST(PropertyLists, ReadDatesOfTheCalendar) {
  EXPECT_EQ(parsed("<date>1970-01-01T00:00:00Z</date>").date(), Date{0});
  EXPECT_EQ(parsed("<date>2024-02-29T23:59:59Z</date>").date(), Date{1709251199});
  for (const char* text :
       {"", "2023-02-29T00:00:00Z", "2024-13-01T00:00:00Z", "2024-01-01T24:00:00Z", "2024-01-01T00:00:60Z",
        "2024-01-01T00:00:00", "2024-01-01 00:00:00Z", "2024-01-01T00:00:00+01:00", "20x4-01-01T00:00:00Z"})
    EXPECT_EQ(errorIn("<date>" + std::string(text) + "</date>"),
              "The element \"date\" holds no such value (offset 8)");
}

TEST(PropertyLists, ReadTextWithReferencesCommentsAndSections) {
  EXPECT_EQ(parsed("<string>a &lt;&amp;&gt; &#228;<!-- no -->b<![CDATA[<c>&amp;]]></string>"),
            Value("a <&> \xC3\xA4"
                  "b<c>&amp;"));
}

TEST(PropertyLists, NeverResolveADeclaredEntity) {
  auto result = PugixmlPropertyLists().parse(
      "<!DOCTYPE plist [<!ENTITY x SYSTEM \"file:///etc/passwd\"><!ENTITY y \"boom\">]>"
      "<plist><string>&x;&y;</string></plist>");
  ASSERT_TRUE(std::holds_alternative<Value>(result));
  EXPECT_EQ(std::get<Value>(result), Value("&x;&y;"));
}

TEST(PropertyLists, LetTheLastOfEqualKeysWin) {
  EXPECT_EQ(parsed("<dict><key>a</key><integer>1</integer><key>a</key><integer>2</integer></dict>"),
            Value(Dictionary{{"a", 2}}));
}

TEST(PropertyLists, RefuseWhatIsNoPropertyListAndSayWhere) {
  EXPECT_EQ(errorIn("<dict><string>a</string></dict>"), "A key is missing (offset 14)");
  EXPECT_EQ(errorIn("<dict><key>a</key><key>b</key></dict>"), "A value is missing (offset 26)");
  EXPECT_EQ(errorIn("<dict><key>a</key></dict>"), "The last key of a dictionary has no value (offset 8)");
  EXPECT_EQ(errorIn("<dict>text</dict>"), "Text among the elements of a dictionary (offset 13)");
  EXPECT_EQ(errorIn("<array>text</array>"), "Text among the elements of an array (offset 14)");
  EXPECT_EQ(errorIn("<string><b/></string>"), "The element \"string\" holds another element (offset 16)");
  EXPECT_EQ(errorIn("<true>1</true>"), "The element \"true\" holds no such value (offset 8)");
  EXPECT_EQ(errorIn("<data>A</data>"), "The element \"data\" holds no such value (offset 8)");
  EXPECT_EQ(errorIn("<set/>"), "An unknown element (offset 8)");
  EXPECT_EQ(errorIn("<true/><true/>"), "The element \"plist\" does not hold exactly one element (offset 15)");
  EXPECT_EQ(errorIn("x"), "The element \"plist\" does not hold exactly one element (offset 7)");
  EXPECT_EQ(errorIn(""), "The element \"plist\" is empty (offset 1)");
  EXPECT_EQ(errorOf("<dict/>"), "The root element is not \"plist\" (offset 1)");
}

TEST(PropertyLists, RefuseWhatIsNoXML) {
  for (const char* text :
       {"", " ", "bplist00", "<plist><dict></plist>", "<plist><string>a", "<plist>", "<<>>"})
    EXPECT_NE(errorOf(text), "no error") << text;
  EXPECT_EQ(errorOf("<plist><dict></plist>"), "Start-end tags mismatch (offset 15)");
  EXPECT_EQ(errorOf(std::string("<plist><true/></plist>\0<", 24)), "A NUL character (offset 22)");
}

TEST(PropertyLists, RefuseTextThatIsNotUTF8) {
  EXPECT_EQ(errorIn("<string>\xFF</string>"), "The text is not valid UTF-8 (offset 8)");
  EXPECT_EQ(errorIn("<string>&#xD800;</string>"), "The text is not valid UTF-8 (offset 8)");
  EXPECT_EQ(errorIn("<dict><key>\xC3</key><true/></dict>"), "The text is not valid UTF-8 (offset 14)");
}

TEST(PropertyLists, LimitDepthTagsAndSize) {
  EXPECT_EQ(parsed(nested(32)).kind(), Value::Kind::array);
  EXPECT_EQ(errorIn(nested(33)), "Containers are nested too deep (offset 232)");
  EXPECT_EQ(errorIn(nested(65000)), "Containers are nested too deep (offset 232)");
  EXPECT_EQ(errorIn(nested(65536)), "The property list has too many tags");
  EXPECT_EQ(errorOf(std::string(Limits::maxHTTPReplyBytes + 1, ' ')), "The property list is too long");
}

TEST(PropertyLists, ReadBackWhatTheyWrote) {
  const Value value(Dictionary{{"text <&>", "a\r\n\t\"'&#13; \xE2\x82\xAC"},
                               {"empty", ""},
                               {"low", INT64_MIN},
                               {"high", UINT64_MAX},
                               {"real", 0.1},
                               {"huge", -HUGE_VAL},
                               {"yes", true},
                               {"date", Date{-86400}},
                               {"data", Data(std::string_view("\0\xFF", 2))},
                               {"list", Array{1, Array(), Dictionary{{"k", "v"}}}}});
  const std::string text = PugixmlPropertyLists().serialize(value);
  auto result = PugixmlPropertyLists().parse(text);
  ASSERT_TRUE(std::holds_alternative<Value>(result)) << text;
  EXPECT_EQ(std::get<Value>(result), value) << text;
}

TEST(PropertyLists, LeaveOutWhatTheyCannotCarry) {
  PugixmlPropertyLists lists;
  const std::string text = lists.serialize(Dictionary{
      {"a", Value()}, {"b", Array{Value(), 1, Date{1e18}, Date{std::nan("")}}}, {"c", Date{-1e18}}});
  auto result = lists.parse(text);
  ASSERT_TRUE(std::holds_alternative<Value>(result)) << text;
  EXPECT_EQ(std::get<Value>(result), Value(Dictionary{{"b", Array{1}}}));
  EXPECT_EQ(std::get<Value>(lists.parse(lists.serialize("a\x01z"))), Value("a\xEF\xBF\xBDz"));
}

}  // namespace
}  // namespace kyt
