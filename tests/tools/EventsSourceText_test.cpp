// Names and texts of an events.toml within source code.
#include <gtest/gtest.h>

#include <array>
#include <string>
#include <string_view>
#include <vector>

#include "tools/events/Identifiers.h"
#include "tools/events/SourceText.h"

namespace kyt::tools {
namespace {

using Lines = std::vector<std::string>;

TEST(EventsIdentifiers, KeepLettersAndDigits) {
  EXPECT_EQ(identifierOf("page_opened"), "page_opened");
  EXPECT_EQ(identifierOf("startupMilliseconds"), "startupMilliseconds");
  EXPECT_EQ(identifierOf("page-opened again"), "page_opened_again");
  EXPECT_EQ(identifierOf("__page__opened_"), "page_opened");
  EXPECT_EQ(identifierOf("2fa"), "n2fa");
  EXPECT_EQ(identifierOf("größe"), "gruF6uDFe");
  EXPECT_EQ(identifierOf("日"), "u65E5");
  EXPECT_EQ(identifierOf("😀"), "u1F600");
  EXPECT_EQ(identifierOf("*/"), "x2A2F");
  EXPECT_EQ(capitalisedIdentifierOf("page_opened"), "PageOpened");
  EXPECT_EQ(capitalisedIdentifierOf("pageOpened"), "PageOpened");
  EXPECT_EQ(capitalisedIdentifierOf("2fa asked"), "N2faAsked");
  EXPECT_EQ(capitalisedIdentifierOf("\""), "X22");
}

TEST(EventsIdentifiers, AreTakenOnceInAScope) {
  constexpr std::array<std::string_view, 2> kReserved = {"int", "for_"};
  Scope scope(kReserved);
  EXPECT_EQ(scope.take("a"), "a");
  EXPECT_EQ(scope.take("a"), "a_");
  EXPECT_EQ(scope.take("a"), "a_2");
  EXPECT_EQ(scope.take("a_2"), "a_2_");
  EXPECT_EQ(scope.take("a"), "a_3");
  EXPECT_EQ(scope.take("int"), "int_");
  EXPECT_EQ(scope.take("for"), "for");
  EXPECT_EQ(scope.take("for"), "for_2");
}

TEST(EventsIdentifiers, LookLikeMacrosWithoutALowerCaseLetter) {
  for (const char* macro : {"EOF", "INT_MAX", "X", "X1"}) EXPECT_TRUE(looksLikeAMacro(macro)) << macro;
  for (const char* name : {"Eof", "n1", "a"}) EXPECT_FALSE(looksLikeAMacro(name)) << name;
}

TEST(EventsSourceText, IsWrappedAtBlanks) {
  EXPECT_EQ(wrapped("one two three", 8), (Lines{"one two", "three"}));
  EXPECT_EQ(wrapped("\n\n one\n\n\ttwo \n", 80), (Lines{"one", "", "two"}));
  EXPECT_EQ(wrapped("incomprehensible", 4), Lines{"incomprehensible"});
}

TEST(EventsSourceText, DoesNotEndAComment) {
  EXPECT_EQ(blockComment("a */ b /* c", ""), "/* a * / b / * c */\n");
  EXPECT_EQ(blockComment("*/*/", ""), "/* * / * / */\n");
  EXPECT_EQ(blockComment("one\ntwo", "  "), "  /* one\n   * two\n   */\n");
  EXPECT_EQ(blockComment("what?\?\?\?/\nint x;", ""), "/* what? ? ? ?/\n * int x;\n */\n");
  EXPECT_EQ(lineComment("one\\\nint x;", ""), "// one\\ .\n// int x;\n");
  EXPECT_EQ(lineComment("one\n\ntwo", ""), "// one\n//\n// two\n");
}

TEST(EventsSourceText, DoesNotEndALiteral) {
  EXPECT_EQ(literal("a\"b\\c"), R"("a\"b\\c")");
  EXPECT_EQ(literal("é1?\?/"), R"("\303\2511\?\?/")");
  EXPECT_EQ(pythonLiteral("a\"b\\cé"), R"("a\"b\\cé")");
  EXPECT_EQ(docString("say \"\"\"", "  "), "  \"\"\"say \\\"\\\"\\\"\"\"\"\n");
  EXPECT_EQ(docString("say \"hi\" \n", ""), "\"\"\"say \"hi\\\"\"\"\"\n");
  EXPECT_EQ(docString("C:\\N{x} \"a\" b", ""), "\"\"\"C:\\\\N{x} \"a\" b\"\"\"\n");
  EXPECT_EQ(docString("one\n\ntwo\\", "  "), "  \"\"\"one\n\n  two\\\\\n  \"\"\"\n");
}

}  // namespace
}  // namespace kyt::tools
