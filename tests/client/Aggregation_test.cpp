// The daemon's calls on its client, as they come from the wire.
#include "client/Aggregation.h"

#include <gtest/gtest.h>

#include <optional>
#include <string>

#include "platform/ipc/Contract.h"
#include "platform/ipc/MessageReader.h"
#include "platform/ipc/MessageWriter.h"

namespace kyt::client {
namespace {

class ClientAggregation : public testing::Test {
 protected:
  // Handles a call of SendMessageToClient with these names in place of its own.
  bool handle(MessageWriter::Call header) {
    if (header.signature.empty()) header.signature = wire::kSendMessageToClientSignature;
    std::string bytes;
    MessageWriter writer(bytes);
    writer.beginCall(1, header);
    if (header.signature == wire::kSendMessageToClientSignature) {
      writer.writeOptionalDictionary(Dictionary{{"SessionID", 5}});
      writer.writeDouble(1.5);
      writer.writeUInt16(3);
      writer.writeUInt16(4);
      writer.writeOptionalDictionary(std::nullopt);
    } else {
      writer.writeString("text");
    }
    EXPECT_TRUE(writer.end());
    Message message;
    EXPECT_EQ(readMessage(std::as_bytes(std::span(bytes)), wire::kMaxMessageBytes, message).status,
              FrameStatus::complete);
    return aggregation_.handle(message);
  }
  static MessageWriter::Call ours() {
    return {
        .path = wire::kClientPath, .interface = wire::kReplyInterface, .member = wire::kSendMessageToClient};
  }

  int runs_ = 0;
  AggregatedMessage last_;
  Aggregation aggregation_{[this](const AggregatedMessage& message) {
    ++runs_;
    last_ = message;
  }};
};

TEST_F(ClientAggregation, GivesTheMessageToTheBlock) {
  EXPECT_TRUE(handle(ours()));
  EXPECT_EQ(runs_, 1);
  EXPECT_EQ(last_.sessionInfo, (Dictionary{{"SessionID", 5}}));
  EXPECT_EQ(last_.timestamp, 1.5);
  EXPECT_EQ(last_.category, 3);
  EXPECT_EQ(last_.type, 4);
  EXPECT_EQ(last_.payload, std::nullopt);
}

TEST_F(ClientAggregation, TakesACallThatNamesNoInterface) {
  MessageWriter::Call call = ours();
  call.interface = "";
  EXPECT_TRUE(handle(call));
}

TEST_F(ClientAggregation, TakesNoOtherCall) {
  MessageWriter::Call otherMember = ours(), otherPath = ours(), otherInterface = ours(), otherForm = ours();
  otherMember.member = "Other";
  otherPath.path = "/other";
  otherInterface.interface = "other.interface";
  otherForm.signature = "s";
  for (const MessageWriter::Call& call : {otherMember, otherPath, otherInterface, otherForm})
    EXPECT_FALSE(handle(call));
  EXPECT_EQ(runs_, 0);
}

TEST_F(ClientAggregation, TakesMessagesThatNobodyGetsAfterItsEnd) {
  aggregation_.end();
  EXPECT_TRUE(handle(ours()));
  EXPECT_EQ(runs_, 0);
}

}  // namespace
}  // namespace kyt::client
