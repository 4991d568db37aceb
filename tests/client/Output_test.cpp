// The bytes of calls and messages, and the descriptors that leave with them.
#include "client/Output.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cstring>
#include <string>

#include "platform/ipc/BodyReader.h"
#include "platform/ipc/MessageReader.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt::client {
namespace {

const std::string kMegabyte(1024 * 1024, 'x');

// A connection whose other end the test reads.
class ClientOutput : public testing::Test {
 protected:
  void SetUp() override {
    const std::string path = folder_ / "socket";
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    const int listener = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    ASSERT_EQ(bind(listener, reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    ASSERT_EQ(listen(listener, 1), 0);
    std::string problem;
    ASSERT_EQ(linux_client::ClientSocket::connect(path, socket_, problem), linux_client::Outcome::done)
        << problem;
    peer_ = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
    ASSERT_GE(peer_, 0);
    close(listener);
  }
  void TearDown() override {
    if (peer_ >= 0) close(peer_);
  }
  struct Got {
    std::string bytes;
    int descriptors = 0;
  };
  // What one read brings; the kernel ends it after bytes with descriptors.
  Got read() const {
    Got got;
    std::array<char, 65536> bytes;
    alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int) * 16)> control;
    iovec vector{bytes.data(), bytes.size()};
    msghdr message{};
    message.msg_iov = &vector;
    message.msg_iovlen = 1;
    message.msg_control = control.data();
    message.msg_controllen = control.size();
    const ssize_t size = recvmsg(peer_, &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
    if (size > 0) got.bytes.assign(bytes.data(), static_cast<size_t>(size));
    if (size <= 0) return got;
    for (cmsghdr* header = CMSG_FIRSTHDR(&message); header != nullptr;
         header = CMSG_NXTHDR(&message, header)) {
      int fds[16];
      got.descriptors = static_cast<int>((header->cmsg_len - CMSG_LEN(0)) / sizeof(int));
      std::memcpy(fds, CMSG_DATA(header), sizeof(int) * static_cast<size_t>(got.descriptors));
      for (int i = 0; i < got.descriptors; ++i) close(fds[i]);
    }
    return got;
  }
  std::string readAll() const {
    std::string all;
    for (Got got = read(); !got.bytes.empty(); got = read()) all += got.bytes;
    return all;
  }
  static Call upload() {
    UploadFileArguments arguments{"file:///f", {}};
    for (int i = 0; i < 2; ++i) {
      const int descriptor = open("/dev/null", O_RDONLY | O_CLOEXEC);
      arguments.extension.emplace_back(descriptor, linux_client::closeDescriptor);
    }
    return {Method::uploadFileAtPath, std::move(arguments)};
  }

  TemporaryFolder folder_;
  linux_client::ClientSocket socket_;
  int peer_ = -1;
  Output output_;
};

Message parsed(std::string_view bytes, size_t& size) {
  Message message;
  const Frame frame = readMessage(std::as_bytes(std::span(bytes)), wire::kMaxMessageBytes, message);
  EXPECT_EQ(frame.status, FrameStatus::complete);
  size = frame.size;
  return message;
}

TEST_F(ClientOutput, GivesEachCallTheNextSerialAndItsContract) {
  output_.restart("hello");
  Call url{Method::fetchDisplayURL};
  EXPECT_EQ(output_.message({3, 4, 1, {{"a", 1}}}), 1U);
  EXPECT_EQ(output_.call(url, true), 2U);
  EXPECT_EQ(output_.ping(), 3U);
  output_.refuse(77);
  EXPECT_TRUE(output_.writeTo(socket_).any);
  EXPECT_EQ(output_.waiting(), 0U);

  std::string all = readAll();
  ASSERT_EQ(all.substr(0, 5), "hello");
  all.erase(0, 5);
  size_t at = 0, size = 0;
  const Message event = parsed(all, size);
  EXPECT_EQ(event.member, "SendMessageWithDictionary");
  EXPECT_FALSE(event.expectsReply());
  Dictionary dictionary;
  BodyReader reader(event);
  ASSERT_TRUE(reader.hasSignature("a{sv}") && reader.readDictionary(dictionary));
  EXPECT_EQ(dictionary, (Dictionary{{kKYTReportingMessageParametersCategory, 3u},
                                    {kKYTReportingMessageParametersType, 4u},
                                    {kKYTReportingMessageParametersFlag, 1u},
                                    {kKYTReportingMessageParametersPayload, Dictionary{{"a", 1}}}}));
  at += size;
  const Message call = parsed(std::string_view(all).substr(at), size);
  EXPECT_EQ(call.serial, 2U);
  EXPECT_EQ(call.member, "FetchDisplayURL");
  EXPECT_EQ(call.interface, wire::kSessionInterface);
  EXPECT_TRUE(call.expectsReply());
  at += size;
  const Message ping = parsed(std::string_view(all).substr(at), size);
  EXPECT_EQ(ping.interface, wire::kPeerInterface);
  EXPECT_EQ(ping.member, "Ping");
  at += size;
  const Message refusal = parsed(std::string_view(all).substr(at), size);
  EXPECT_EQ(refusal.type, wire::MessageType::error);
  EXPECT_EQ(refusal.replySerial, 77U);
  EXPECT_EQ(at + size, all.size());
}

TEST_F(ClientOutput, LeavesAMessageOutWithoutAFlag) {
  ASSERT_TRUE(output_.message({3, 4, 0, {}}));
  (void)output_.writeTo(socket_);
  const std::string all = readAll();
  size_t size = 0;
  const Message event = parsed(all, size);
  Dictionary dictionary;
  BodyReader reader(event);
  ASSERT_TRUE(reader.hasSignature("a{sv}") && reader.readDictionary(dictionary));
  EXPECT_EQ(dictionary.find(kKYTReportingMessageParametersFlag), nullptr);
}

TEST_F(ClientOutput, WritesNothingOfWhatIsTooLargeOrTooDeep) {
  EXPECT_TRUE(output_.message({1, 1, 0, {{"a", 1}}}));
  const size_t before = output_.waiting();
  EXPECT_FALSE(output_.message({1, 1, 0, {{"a", std::string_view(kMegabyte)}}}));
  Call entries{Method::updateSharedDataWithDictionary,
               SharedDataArguments{{{"a", std::string_view(kMegabyte)}}}};
  EXPECT_FALSE(output_.call(entries, true));
  Dictionary deep;
  for (int i = 0; i < 100; ++i) deep = Dictionary{{"d", deep}};
  EXPECT_FALSE(output_.message({1, 1, 0, deep}));
  EXPECT_EQ(output_.waiting(), before);
}

TEST_F(ClientOutput, PassesAnExtensionWithTheFirstByteOfItsCall) {
  ASSERT_TRUE(output_.message({1, 1, 0, {{"a", 1}}}));
  Call first = upload(), second = upload();
  ASSERT_TRUE(output_.call(first, true));
  ASSERT_TRUE(output_.call(second, true));
  ASSERT_TRUE(output_.message({1, 2, 0, {}}));
  (void)output_.writeTo(socket_);
  EXPECT_TRUE(std::get<UploadFileArguments>(first.arguments).extension.empty());
  // What has descriptors is the last that one read brings.
  std::vector<int> passed;
  std::vector<std::string> firstOfEach;
  for (Got got = read(); !got.bytes.empty(); got = read()) {
    passed.push_back(got.descriptors);
    size_t size = 0;
    firstOfEach.emplace_back(parsed(got.bytes, size).member);
  }
  EXPECT_EQ(passed, (std::vector<int>{2, 2}));
  EXPECT_EQ(firstOfEach, (std::vector<std::string>{"SendMessageWithDictionary", "UploadFileAtPath"}));
}

TEST_F(ClientOutput, KeepsAnExtensionThatCannotBePassedWithItsCall) {
  Call call = upload();
  ASSERT_TRUE(output_.call(call, false));
  EXPECT_EQ(std::get<UploadFileArguments>(call.arguments).extension.size(), 2U);
  (void)output_.writeTo(socket_);
  EXPECT_EQ(read().descriptors, 0);
}

TEST_F(ClientOutput, ClosesDescriptorsThatDidNotLeave) {
  int ends[2];
  ASSERT_EQ(pipe2(ends, O_CLOEXEC | O_NONBLOCK), 0);
  UploadFileArguments arguments{"file:///f", {}};
  arguments.extension.emplace_back(ends[1], linux_client::closeDescriptor);
  Call call{Method::uploadFileAtPath, std::move(arguments)};
  ASSERT_TRUE(output_.call(call, true));
  char byte = 0;
  EXPECT_EQ(::read(ends[0], &byte, 1), -1);
  output_.restart();
  EXPECT_EQ(::read(ends[0], &byte, 1), 0) << "the other end is still open";
  close(ends[0]);
  EXPECT_EQ(output_.waiting(), 0U);
}

TEST_F(ClientOutput, GoesOnWhereAFullSocketStoppedIt) {
  std::string sent;
  for (int i = 0; i < 40; ++i) ASSERT_TRUE(output_.message({1, 1, 0, {{"a", std::string(50000, 'x')}}}));
  const size_t all = output_.waiting();
  Output::Written written = output_.writeTo(socket_);
  EXPECT_TRUE(written.any);
  ASSERT_GT(output_.waiting(), 0U);
  EXPECT_FALSE(written.ended);
  EXPECT_FALSE(output_.writeTo(socket_).any) << "no room, and nobody has read";
  size_t got = 0;
  while (got < all) {
    got += readAll().size();
    (void)output_.writeTo(socket_);
  }
  EXPECT_EQ(got, all);
}

TEST_F(ClientOutput, SaysThatTheConnectionHasEnded) {
  close(peer_);
  peer_ = -1;
  ASSERT_TRUE(output_.message({1, 1, 0, {}}));
  const Output::Written written = output_.writeTo(socket_);
  EXPECT_TRUE(written.ended);
  EXPECT_FALSE(written.any);
}

}  // namespace
}  // namespace kyt::client
