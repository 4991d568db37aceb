#include "config/ClientTypes.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <fstream>
#include <iterator>
#include <limits>
#include <map>
#include <optional>
#include <sstream>
#include <string>

namespace kyt {
namespace {

struct Row {
  const char* code;
  const char* storebag;  // null: none
};

constexpr Row kRows[] = {
    {"QA", nullptr},    {"QB", nullptr},     {"QCX", nullptr},       {"QD", nullptr},
    {"QE", nullptr},    {"QF", "torvel"},    {"QG", "brisca"},       {"QH", "cadmor"},
    {"QJ", "dulvek"},   {"QK", "emrit"},     {"QL", "fosska"},       {"QM", "cadmor"},
    {"QNPA", "gelmar"}, {"QPRAV", "cadmor"}, {"QG-TRS", "brisca"},   {"QG-VELMO", "brisca"},
    {"HOVIT", "hovit"}, {"QUTRIN", "ismel"}, {"QWERNOLT", "jorvan"}, {"QN", "kelvit"},
    {"QPW", "cadmor"},  {"QS", "lurra"},     {"QT", "morvek"},       {"QV", "nessim"}};

// Servers and clients rely on each of them.
TEST(ClientTypes, EachHasItsCodeAndItsStorebag) {
  ASSERT_EQ(std::size(kRows), static_cast<size_t>(kNumberOfClientTypes));
  for (int32_t type = 0; type < kNumberOfClientTypes; ++type) {
    EXPECT_STREQ(clientTypeShortCode(type), kRows[type].code) << type;
    const std::optional<String> storebag = storebagNameForClientType(type);
    ASSERT_EQ(storebag.has_value(), kRows[type].storebag != nullptr) << type;
    if (storebag) {
      EXPECT_EQ(*storebag, String(kRows[type].storebag)) << type;
    }
  }
}

// The document's table stands as three triples a line: type, code, storebag.
TEST(ClientTypes, AreThoseOfTheDocument) {
  std::ifstream document(KYT_DOCS_DIR "/WIRE-STOREBAG.md");
  int found = 0;
  for (std::string line; std::getline(document, line);) {
    std::istringstream cells(line);
    std::string bar, storebag, code;
    int32_t type = 0;
    while (cells >> bar >> type >> bar >> code >> bar >> storebag) {
      ++found;
      EXPECT_EQ(code, clientTypeShortCode(type)) << type;
      EXPECT_EQ(storebag, storebagNameForClientType(type).value_or("none").str()) << type;
    }
  }
  EXPECT_EQ(found, kNumberOfClientTypes);
}

TEST(ClientTypes, TypesShareStorebags) {
  std::map<std::string, int> uses;
  for (int32_t type = 0; type < kNumberOfClientTypes; ++type)
    if (const auto name = storebagNameForClientType(type)) ++uses[name->str()];
  EXPECT_EQ(uses["cadmor"], 4);
  EXPECT_EQ(uses["brisca"], 3);
  EXPECT_EQ(uses.size(), 14U);
}

TEST(ClientTypes, NamesTheStorebagAndTheCode) {
  EXPECT_EQ(storebagNameForClientType(11), String("cadmor"));
  EXPECT_STREQ(clientTypeShortCode(11), "QM");
  EXPECT_EQ(storebagNameForClientType(5), String("torvel"));
  EXPECT_STREQ(clientTypeShortCode(0), "QA");
  EXPECT_STREQ(clientTypeShortCode(15), "QG-VELMO");
  EXPECT_EQ(storebagNameForClientType(23), String("nessim"));
  EXPECT_STREQ(clientTypeShortCode(23), "QV");
}

TEST(ClientTypes, HasNoStorebagBelowFiveAndPastTheTable) {
  for (int32_t type : {0, 1, 2, 3, 4, 24, -1, std::numeric_limits<int32_t>::min()})
    EXPECT_FALSE(storebagNameForClientType(type)) << type;
}

TEST(ClientTypes, AnswersUnknownForNumbersThatAreNoType) {
  for (int32_t type : {24, -1, std::numeric_limits<int32_t>::max(), std::numeric_limits<int32_t>::min()})
    EXPECT_STREQ(clientTypeShortCode(type), "Unknown") << type;
}

}  // namespace
}  // namespace kyt
