#include "platform/linux/url/TLSTickets.h"

#include <gtest/gtest.h>

#include <string>
#include <variant>

#include "platform/linux/url/CurlURLSession.h"

namespace kyt {
namespace {

class TLSTicketsTest : public testing::Test {
 protected:
  TLSTickets::Shared of(const std::string& identity) {
    return tickets_.of(curl_, identity, certificates_, routes_, now_);
  }
  const CurlLibrary curl_ = std::get<CurlLibrary>(CurlLibrary::load(CurlURLSessionOptions().library.c_str()));
  TLSTickets tickets_;
  unsigned certificates_ = 1;
  uint64_t routes_ = 1;
  MonotonicTime now_{};
};

TEST_F(TLSTicketsTest, AreTheSameForOneIdentityAndOthersForAnother) {
  const TLSTickets::Shared one = of("one");
  EXPECT_EQ(of("one"), one);
  EXPECT_NE(of("two"), one);
  EXPECT_EQ(of("one"), one);
}

TEST_F(TLSTicketsTest, AreForgottenWhenRoutesHaveChanged) {
  const TLSTickets::Shared one = of("one"), two = of("two");
  ++routes_;
  EXPECT_NE(of("one"), one);
  EXPECT_NE(of("two"), two);
}

TEST_F(TLSTicketsTest, AreForgottenWhenCertificatesHaveChanged) {
  const TLSTickets::Shared one = of("one");
  ++certificates_;
  EXPECT_NE(of("one"), one);
}

TEST_F(TLSTicketsTest, AreForgottenAfterAnHourHoweverOftenTheyAreUsed) {
  const TLSTickets::Shared one = of("one");
  now_ += TLSTickets::kLifetime - std::chrono::nanoseconds(1);
  EXPECT_EQ(of("one"), one);
  now_ += std::chrono::nanoseconds(1);
  EXPECT_NE(of("one"), one);
}

TEST_F(TLSTicketsTest, OfTheIdentityUsedLongestAgoGoWhenThereAreTooMany) {
  const TLSTickets::Shared first = of("first"), second = of("second");
  for (size_t i = 2; i < TLSTickets::kMostIdentities; ++i) (void)of(std::to_string(i));
  EXPECT_EQ(of("first"), first);
  (void)of("one more");
  EXPECT_EQ(tickets_.identities(), TLSTickets::kMostIdentities);
  EXPECT_EQ(of("first"), first);
  EXPECT_NE(of("second"), second);
}

}  // namespace
}  // namespace kyt
