#include "platform/base/JSONLayout.h"

#include <gtest/gtest.h>

namespace kyt {
namespace {

std::string laidOut(std::string_view compact) {
  std::string out;
  appendLaidOutJSON(out, compact);
  return out;
}

TEST(JSONLayout, PutsEachEntryOnALineOfItsOwn) {
  EXPECT_EQ(laidOut(R"({"a":1,"list":[true,null,{"b":-2.5e+30}],"c":"d"})"),
            "{\n"
            "    \"a\": 1,\n"
            "    \"list\": [\n"
            "        true,\n"
            "        null,\n"
            "        {\n"
            "            \"b\": -2.5e+30\n"
            "        }\n"
            "    ],\n"
            "    \"c\": \"d\"\n"
            "}");
}

TEST(JSONLayout, ClosesEmptyContainersAtOnce) {
  EXPECT_EQ(laidOut("{}"), "{}");
  EXPECT_EQ(laidOut("[]"), "[]");
  EXPECT_EQ(laidOut(R"([{},[],""])"), "[\n    {},\n    [],\n    \"\"\n]");
}

TEST(JSONLayout, LeavesTextsAsTheyAre) {
  for (const char* text : {R"("a,b:c{d}[e]")", R"("quoted \" and \\")", R"("\\")", R"("\"")", R"("12345678")",
                           R"("1234567\"1234567\\")", R"("\u0001 {")",
                           "\"Gr\xC3\xBC\xC3\x9F"
                           "e, {}\""})
    EXPECT_EQ(laidOut(text), text);
  EXPECT_EQ(laidOut(R"(["\\",":"])"), "[\n    \"\\\\\",\n    \":\"\n]");
}

TEST(JSONLayout, AppendsTextsOfAnyLengthAndDepth) {
  const std::string text = '"' + std::string(10000, 'x') + '"';
  std::string out = "before ";
  appendLaidOutJSON(out, text);
  EXPECT_EQ(out, "before " + text);
  std::string deep = std::string(2000, '[') + "1" + std::string(2000, ']');
  const std::string lines = laidOut(deep);
  EXPECT_NE(lines.find("\n" + std::string(8000, ' ') + "1\n"), std::string::npos);
}

TEST(JSONLayout, EndsWithTextsThatAreNoJSON) {
  for (const char* text : {"", "\"", "\"\\", "}", "{", "]]", "\"1234567\\", "{\"a\""})
    EXPECT_LT(laidOut(text).size(), 50U);
}

}  // namespace
}  // namespace kyt
