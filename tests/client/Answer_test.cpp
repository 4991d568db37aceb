// Replies as they are read by the contract, and the completions that get them.
#include "client/Answer.h"

#include <gtest/gtest.h>

#include "platform/ipc/MessageReader.h"
#include "platform/ipc/MessageWriter.h"

namespace kyt::client {
namespace {

using wire::Method;

// A reply of that signature, read back from its bytes.
struct Replied {
  template <typename Body>
  Replied(std::string_view signature, Body&& body) {
    MessageWriter writer(bytes);
    writer.beginReply(1, 2, signature);
    body(writer);
    EXPECT_TRUE(writer.end());
    EXPECT_EQ(readMessage(std::as_bytes(std::span(bytes)), wire::kMaxMessageBytes, message).status,
              FrameStatus::complete);
  }
  std::string bytes;
  Message message;
};
void nothing(MessageWriter&) {}

TEST(Answer, BringsTheNamesOfLiveBackEndsOrNone) {
  const auto states = [](std::optional<Array> names) {
    const Replied replied("aas", [&](MessageWriter& out) { out.writeOptionalStrings(names); });
    const auto reply = readReply(Method::fetchStatesWithUserInfo, replied.message);
    return reply ? std::get<StateNames>(reply->result) : std::vector<std::string>{"not read"};
  };
  EXPECT_EQ(states(Array{"httppost", "qrs"}), (std::vector<std::string>{"httppost", "qrs"}));
  EXPECT_EQ(states(Array{}), std::vector<std::string>());
  EXPECT_EQ(states(std::nullopt), std::nullopt);
}

TEST(Answer, BringsTheResultAndTheError) {
  const Replied flushed("ava(sis)", [](MessageWriter& out) {
    out.writeOptionalValue("text");
    out.writeOptionalError(Error{"domain", 3, "why"});
  });
  auto reply = readReply(Method::flushMessagesWithCompletion, flushed.message);
  ASSERT_TRUE(reply);
  EXPECT_EQ(std::get<Value>(reply->result), Value("text"));
  ASSERT_TRUE(reply->error);
  EXPECT_EQ(reply->error->code, 3);

  const Replied uploaded("ba(sis)", [](MessageWriter& out) {
    out.writeBoolean(false);
    out.writeOptionalError(std::nullopt);
  });
  reply = readReply(Method::uploadLogData, uploaded.message);
  ASSERT_TRUE(reply);
  EXPECT_FALSE(std::get<bool>(reply->result));
  EXPECT_FALSE(reply->error);
}

TEST(Answer, IsNoneWhenTheReplyHasAnotherForm) {
  const Replied text("s", [](MessageWriter& out) { out.writeString("url"); });
  const auto url = readReply(Method::fetchDisplayURL, text.message);
  ASSERT_TRUE(url);
  EXPECT_EQ(std::get<std::string>(url->result), "url");
  EXPECT_FALSE(readReply(Method::uploadFileAtPath, text.message));
  EXPECT_FALSE(readReply(Method::flushMessagesWithCompletion, Replied("", nothing).message));
}

TEST(Answer, OfACallWithoutResultsIsTheReplyItself) {
  for (const Replied& replied :
       {Replied("", nothing), Replied("s", [](auto& out) { out.writeString("more"); })}) {
    const auto reply = readReply(Method::finishSessionGracefully, replied.message);
    ASSERT_TRUE(reply);
    EXPECT_TRUE(std::get<bool>(reply->result));
  }
}

TEST(Answer, RunsItsCompletionOnceAtMost) {
  int runs = 0;
  KYTReporting::SuccessCompletion completion = [&runs](bool success, const std::optional<Error>& error) {
    ++runs;
    EXPECT_FALSE(success);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain, kKYTReportingClientErrorDomain);
    EXPECT_EQ(error->code, static_cast<int32_t>(ClientError::timedOut));
    EXPECT_EQ(error->localizedDescription, "late");
  };
  Answer answer(std::move(completion));
  EXPECT_TRUE(answer.isAwaited());
  answer.fail(ClientError::timedOut, "late");
  EXPECT_FALSE(answer.isAwaited());
  answer.fail(ClientError::closed, "again");
  answer.give({});
  EXPECT_EQ(runs, 1);
}

TEST(Answer, IsAwaitedByNobodyWithoutACompletion) {
  EXPECT_FALSE(Answer().isAwaited());
  EXPECT_FALSE(Answer(KYTReporting::TextCompletion()).isAwaited());
}

TEST(Answer, MayBeDroppedByTheCompletionThatItRuns) {
  auto owner = std::make_unique<Answer>();
  bool ran = false;
  KYTReporting::TextCompletion completion = [&](const std::string& text, const auto&) {
    owner.reset();
    ran = text == "url";
  };
  *owner = Answer(std::move(completion));
  owner->give({std::string("url"), std::nullopt});
  EXPECT_TRUE(ran);
}

}  // namespace
}  // namespace kyt::client
