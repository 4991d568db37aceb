#include "platform/ipc/Handshake.h"

#include <gtest/gtest.h>

#include "WireTestSupport.h"

namespace kyt {
namespace {

using Status = ServerHandshake::Status;
constexpr const char* kGuid = "0123456789abcdef0123456789abcdef";
const std::string kNul(1, '\0');
const std::string kOK = std::string("OK ") + kGuid + "\r\n";

struct Outcome {
  Status status;
  std::string answers;
  size_t consumed;
  bool descriptors;
};

// Feeds a whole dialogue in pieces of `step` bytes.
Outcome shake(const std::string& bytes, size_t step = 1 << 20, uint32_t user = 1000) {
  ServerHandshake handshake(user, kGuid);
  Outcome outcome{Status::goingOn, "", 0, false};
  for (size_t at = 0; at < bytes.size() && outcome.status == Status::goingOn; at += step) {
    size_t consumed = 0;
    outcome.status =
        handshake.feed(test::bytesOf(std::string_view(bytes).substr(at, step)), consumed, outcome.answers);
    outcome.consumed += consumed;
  }
  outcome.descriptors = handshake.descriptorsAgreed();
  return outcome;
}

TEST(ServerHandshake, TakesAnInitialResponsePipelinedOrByteByByte) {
  const std::string opening = kNul + "AUTH EXTERNAL 31303030\r\nNEGOTIATE_UNIX_FD\r\nBEGIN\r\n";
  for (const size_t step : {size_t{1}, size_t{2}, size_t{7}, size_t{1000}}) {
    const Outcome outcome = shake(opening + "lmessage", step);
    EXPECT_EQ(outcome.status, Status::done);
    EXPECT_EQ(outcome.answers, kOK + "AGREE_UNIX_FD\r\n");
    EXPECT_EQ(outcome.consumed, opening.size()) << "what follows belongs to the first message";
    EXPECT_TRUE(outcome.descriptors);
  }
}

TEST(ServerHandshake, AsksForTheIdentityWhenItIsNotGiven) {
  const Outcome outcome = shake(kNul + "AUTH EXTERNAL\r\nDATA\r\nBEGIN\r\n");
  EXPECT_EQ(outcome.status, Status::done);
  EXPECT_EQ(outcome.answers, "DATA\r\n" + kOK);
  EXPECT_FALSE(outcome.descriptors);
  EXPECT_EQ(shake(kNul + "AUTH EXTERNAL\r\nDATA 31303030\r\nBEGIN\r\n").answers, "DATA\r\n" + kOK);
}

TEST(ServerHandshake, TellsABareAuthWhatThereIs) {
  const Outcome outcome = shake(kNul + "AUTH\r\nAUTH EXTERNAL 31303030\r\nNEGOTIATE_UNIX_FD\r\nBEGIN\r\n");
  EXPECT_EQ(outcome.status, Status::done);
  EXPECT_EQ(outcome.answers, "REJECTED EXTERNAL\r\n" + kOK + "AGREE_UNIX_FD\r\n");
}

TEST(ServerHandshake, RefusesAnotherIdentityThanTheSocketsOwn) {
  for (const char* claim : {"30", "3130303", "xx", "31303031", "2d31", "31303030313030303130303030303030"}) {
    const Outcome outcome = shake(kNul + "AUTH EXTERNAL " + claim + "\r\nBEGIN\r\n");
    EXPECT_EQ(outcome.status, Status::failed) << claim;
    EXPECT_EQ(outcome.answers, "REJECTED EXTERNAL\r\n");
  }
  EXPECT_EQ(shake(kNul + "AUTH EXTERNAL\r\nDATA 30\r\n").answers, "DATA\r\nREJECTED EXTERNAL\r\n");
}

TEST(ServerHandshake, RefusesOtherMechanisms) {
  for (const char* mechanism :
       {"ANONYMOUS", "ANONYMOUS 74657374", "DBUS_COOKIE_SHA1 31303030", "external 31303030"}) {
    const Outcome outcome = shake(kNul + "AUTH " + mechanism + "\r\n");
    EXPECT_EQ(outcome.status, Status::goingOn);
    EXPECT_EQ(outcome.answers, "REJECTED EXTERNAL\r\n") << mechanism;
  }
}

TEST(ServerHandshake, EndsWithTheFirstByteThatIsNoNUL) {
  EXPECT_EQ(shake("AUTH EXTERNAL 31303030\r\n").status, Status::failed);
}

TEST(ServerHandshake, EndsWithABeginBeforeTheIdentityIsKnown) {
  EXPECT_EQ(shake(kNul + "BEGIN\r\n").status, Status::failed);
  EXPECT_EQ(shake(kNul + "AUTH EXTERNAL\r\nBEGIN\r\n").status, Status::failed);
}

TEST(ServerHandshake, AnswersWhatItDoesNotUnderstandAndCancels) {
  EXPECT_EQ(shake(kNul + "HELLO\r\n").answers, "ERROR \"Not understood\"\r\n");
  EXPECT_EQ(shake(kNul + "NEGOTIATE_UNIX_FD\r\n").answers, "ERROR \"Not understood\"\r\n")
      << "before authentication";
  EXPECT_EQ(shake(kNul + "AUTH EXTERNAL\r\nCANCEL\r\nAUTH EXTERNAL 31303030\r\nBEGIN\r\n").answers,
            "DATA\r\nREJECTED EXTERNAL\r\n" + kOK);
}

TEST(ServerHandshake, EndsAfterTooManyAttempts) {
  std::string bytes = kNul;
  for (int i = 0; i < 20; ++i) bytes += "AUTH\r\n";
  EXPECT_EQ(shake(bytes).status, Status::failed);
}

TEST(ServerHandshake, TakesNoMoreThanItsLimitWhateverThePieces) {
  for (const size_t step : {size_t{1}, size_t{100}, size_t{1} << 20}) {
    const Outcome outcome = shake(kNul + std::string(20000, 'A'), step);
    EXPECT_EQ(outcome.status, Status::failed);
    EXPECT_LE(outcome.consumed, 16384u);
  }
  const std::string opening = kNul + "AUTH EXTERNAL 31303030\r\nBEGIN\r\n";
  EXPECT_EQ(shake(opening + std::string(20000, 'x')).status, Status::done) << "what follows is not counted";
}

TEST(ClientHandshake, UnderstandsTheServer) {
  for (const uint32_t user : {0u, 1000u, 4294967294u}) {
    ServerHandshake server(user, kGuid);
    ClientHandshake client;
    std::string answers;
    size_t consumed = 0;
    EXPECT_EQ(server.feed(test::bytesOf(ClientHandshake::opening(user)), consumed, answers), Status::done);
    EXPECT_EQ(client.feed(test::bytesOf(answers + "l"), consumed), ClientHandshake::Status::done);
    EXPECT_EQ(consumed, answers.size());
    EXPECT_TRUE(client.descriptorsAgreed());
  }
}

TEST(ClientHandshake, TakesAnswersByteByByteAndARefusalOfDescriptors) {
  const std::string answers = kOK + "ERROR\r\n";
  ClientHandshake client;
  for (size_t i = 0; i < answers.size(); ++i) {
    size_t consumed = 0;
    const auto status = client.feed(test::bytesOf(std::string_view(answers).substr(i, 1)), consumed);
    EXPECT_EQ(status,
              i + 1 == answers.size() ? ClientHandshake::Status::done : ClientHandshake::Status::goingOn);
  }
  EXPECT_FALSE(client.descriptorsAgreed());
}

TEST(ClientHandshake, FailsWhenRejected) {
  for (const std::string& answer :
       {std::string("REJECTED EXTERNAL\r\n"), std::string("what?\r\n"), std::string(20000, 'x')}) {
    ClientHandshake client;
    size_t consumed = 0;
    EXPECT_EQ(client.feed(test::bytesOf(answer), consumed), ClientHandshake::Status::failed);
    EXPECT_NE(client.problem(), nullptr);
  }
}

}  // namespace
}  // namespace kyt
