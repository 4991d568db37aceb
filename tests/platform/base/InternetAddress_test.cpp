// The classic parser of dotted-decimal addresses.
#include "platform/base/InternetAddress.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>

#include <string>

namespace kyt {
namespace {

TEST(InternetAddress, ReadsFourDecimalNumbersTheFirstByteHighest) {
  EXPECT_EQ(ipv4Address("192.168.1.254"), 0xC0A801FEu);
  EXPECT_EQ(ipv4Address("0.0.0.0"), 0u);
  EXPECT_EQ(ipv4Address("127.0.0.1"), 0x7F000001u);
}

TEST(InternetAddress, ReadsTheShortFormsAndTheOtherBases) {
  EXPECT_EQ(ipv4Address("127.1"), 0x7F000001u);
  EXPECT_EQ(ipv4Address("10.1.513"), 0x0A010201u);
  EXPECT_EQ(ipv4Address("0x7f.010.1"), 0x7F080001u);
  EXPECT_EQ(ipv4Address("2130706433"), 0x7F000001u);
}

TEST(InternetAddress, IsAllOnesForWhatIsNoAddress) {
  for (const char* text :
       {"", "server.example.org", "1.2.3.4.5", "256.1.1.1", "1.2.3.256", "1..2", "1.2.3.", "1.2.3.4x",
        "-1.2.3.4", "0x.1", "08.1.1.1", "4294967296", "1.16777216", " 1.2.3.4"})
    EXPECT_EQ(ipv4Address(text), kNoIPv4Address) << text;
}

TEST(InternetAddress, AgreesWithTheSystemsParser) {
  const std::string alphabet = "0129.xXaf8 \t-";
  uint32_t state = 12345;
  int addresses = 0;
  for (int round = 0; round < 200000; ++round) {
    std::string text;
    for (unsigned length = 1 + (state >> 8) % 12; length > 0; --length) {
      state = state * 1664525 + 1013904223;
      text += alphabet[(state >> 16) % alphabet.size()];
    }
    state = state * 1664525 + 1013904223;
    const uint32_t expected = ntohl(inet_addr(text.c_str()));
    addresses += expected != kNoIPv4Address ? 1 : 0;
    ASSERT_EQ(ipv4Address(text), expected) << '"' << text << '"';
  }
  EXPECT_GT(addresses, 1000);
}

}  // namespace
}  // namespace kyt
