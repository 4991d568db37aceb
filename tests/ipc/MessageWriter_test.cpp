// What the writer writes, the reader reads back, in both byte orders.
#include "platform/ipc/MessageWriter.h"

#include <gtest/gtest.h>

#include "WireTestSupport.h"
#include "platform/ipc/BodyReader.h"
#include "platform/ipc/BodyValidator.h"

namespace kyt {
namespace {

using test::frame;

std::string call(std::string_view signature, auto&& body) {
  std::string bytes;
  MessageWriter writer(bytes);
  writer.beginCall(7, {.member = "M", .signature = signature});
  body(writer);
  EXPECT_TRUE(writer.end());
  return bytes;
}

TEST(MessageWriter, WritesTheHeaderOfACall) {
  std::string bytes;
  MessageWriter writer(bytes);
  writer.beginCall(42, {.member = "SetDigestKey",
                        .destination = "a.b",
                        .signature = "ayi",
                        .expectsReply = false,
                        .unixFds = 3});
  writer.writeData({});
  writer.writeInt32(1);
  ASSERT_TRUE(writer.end());
  Message message;
  const Frame read = frame(bytes, message);
  ASSERT_EQ(read.status, FrameStatus::complete) << read.problem;
  EXPECT_EQ(read.size, bytes.size());
  EXPECT_EQ(message.type, wire::MessageType::methodCall);
  EXPECT_FALSE(message.expectsReply());
  EXPECT_EQ(message.serial, 42u);
  EXPECT_EQ(message.path, "/com/vantu/kytreportingd");
  EXPECT_EQ(message.interface, "com.vantu.kytreportingd.ClientSessionInterface");
  EXPECT_EQ(message.member, "SetDigestKey");
  EXPECT_EQ(message.destination, "a.b");
  EXPECT_EQ(message.signature, "ayi");
  EXPECT_EQ(message.unixFds, 3u);
}

TEST(MessageWriter, BeginsAPreparedCallLikeAnyOther) {
  const MessageWriter::Call header{.member = "Send", .signature = "a{sv}", .expectsReply = false};
  const Dictionary dictionary{{"a", 1}};
  std::string bytes, prepared;
  for (const uint32_t serial : {7U, 8U}) {
    MessageWriter writer(bytes);
    writer.beginCall(serial, header);
    writer.writeDictionary(dictionary);
    ASSERT_TRUE(writer.end());
    MessageWriter other(prepared);
    other.beginCall(serial, MessageWriter::prepare(header));
    other.writeDictionary(std::span(dictionary.begin(), dictionary.end()));
    ASSERT_TRUE(other.end());
  }
  EXPECT_EQ(prepared, bytes);
  MessageWriter writer(prepared, 100);
  writer.beginCall(9, MessageWriter::prepare(header));
  writer.writeDictionary(Dictionary{{"a", std::string(200, 'x')}});
  EXPECT_FALSE(writer.end());
  EXPECT_EQ(prepared, bytes) << "what does not fit leaves nothing behind";
}

// Short entries are put together and long ones written part by part: at every offset, and on both sides of the border.
TEST(MessageWriter, WritesEntriesOfEveryLengthAtEveryOffset) {
  for (size_t key = 0; key <= 52; ++key)
    for (const size_t text : {0, 1, 2, 3, 4, 5, 6, 7, 47, 48, 49, 200}) {
      const std::string name(key, 'k');
      Dictionary given;
      given.set(name, std::string(text, 't'));
      given.set(name + "1", true);
      given.set(name + "2", -5);
      given.set(name + "3", 5U);
      given.set(name + "4", 0.5);
      given.set(name + "5", Date{1.5});
      given.set(name + "6", Array{"x", 1});
      given.set(name + "7", "\xc3\xa4" + name);
      given.set(name + "8", Data("data"));
      given.set(name + "9", Dictionary{{name, name}});
      const std::string bytes = call("a{sv}", [&](MessageWriter& writer) { writer.writeDictionary(given); });
      Message message;
      ASSERT_EQ(frame(bytes, message).status, FrameStatus::complete);
      BodyReader reader(message);
      Dictionary read;
      ASSERT_TRUE(reader.hasSignature("a{sv}") && reader.readDictionary(read)) << key << " " << text;
      ASSERT_EQ(reader.finish(), BodyStatus::ok);
      ASSERT_EQ(read, given) << key << " " << text;
    }
}

TEST(MessageWriter, MendsShortTextThatIsMalformed) {
  const std::string bytes = call("a{sv}", [](MessageWriter& writer) {
    writer.writeDictionary(Dictionary{{std::string_view("k\0", 2), "a\xff"}});
  });
  Message message;
  ASSERT_EQ(frame(bytes, message).status, FrameStatus::complete);
  BodyReader reader(message);
  Dictionary read;
  ASSERT_TRUE(reader.hasSignature("a{sv}") && reader.readDictionary(read));
  EXPECT_EQ(read, (Dictionary{{"k\xef\xbf\xbd", "a\xef\xbf\xbd"}}));
}

TEST(MessageWriter, RefusesAShortEntryThatIsNestedTooDeeply) {
  Dictionary deepest{{"a", 1}};
  size_t depth = 1;
  for (; depth < 100; ++depth) {
    std::string bytes;
    MessageWriter writer(bytes);
    writer.beginCall(1, {.member = "M", .signature = "a{sv}"});
    writer.writeDictionary(deepest);
    if (!writer.end()) break;
    Message message;
    ASSERT_EQ(frame(bytes, message).status, FrameStatus::complete);
    BodyReader reader(message);
    Dictionary read;
    ASSERT_TRUE(reader.hasSignature("a{sv}") && reader.readDictionary(read)) << "written, but not to be read";
    deepest = Dictionary{{"d", deepest}};
  }
  EXPECT_LT(depth, 100U);
}

TEST(MessageWriter, WritesRepliesAndErrors) {
  std::string bytes;
  MessageWriter writer(bytes);
  writer.beginReply(1, 9, "s", ":1.5", "a.b");
  writer.writeString("x");
  ASSERT_TRUE(writer.end());
  const size_t first = bytes.size();
  ASSERT_TRUE(writer.writeError(2, 10, wire::kErrorFailed, "no"));

  Message message;
  ASSERT_EQ(frame(bytes, message).size, first);
  EXPECT_EQ(message.type, wire::MessageType::methodReturn);
  EXPECT_EQ(message.replySerial, 9u);
  EXPECT_EQ(message.destination, ":1.5");
  EXPECT_EQ(message.sender, "a.b");
  const std::string rest = bytes.substr(first);  // the message refers to it
  ASSERT_EQ(frame(rest, message).status, FrameStatus::complete);
  EXPECT_EQ(message.type, wire::MessageType::error);
  EXPECT_EQ(message.errorName, "org.freedesktop.DBus.Error.Failed");
  BodyReader reader(message);
  std::string_view text;
  ASSERT_TRUE(reader.readStringView(text));
  EXPECT_EQ(text, "no");
  EXPECT_EQ(reader.finish(), BodyStatus::ok);
}

TEST(MessageWriter, WritesSignals) {
  std::string bytes;
  MessageWriter writer(bytes);
  writer.beginSignal(5, "/a/b", "c.d", "Passed", "a{sv}");
  writer.writeDictionary(test::samplePayload());
  ASSERT_TRUE(writer.end());
  for (const std::string& form : {bytes, test::ByteOrderSwapper::swapped(bytes)}) {
    Message message;
    const Frame read = frame(form, message);
    ASSERT_EQ(read.status, FrameStatus::complete) << read.problem;
    EXPECT_EQ(read.size, form.size());
    EXPECT_EQ(message.type, wire::MessageType::signal);
    EXPECT_FALSE(message.expectsReply());
    EXPECT_EQ(message.serial, 5U);
    EXPECT_EQ(message.path, "/a/b");
    EXPECT_EQ(message.interface, "c.d");
    EXPECT_EQ(message.member, "Passed");
    EXPECT_EQ(message.signature, "a{sv}");
    EXPECT_TRUE(validateBody(message));
    BodyReader reader(message);
    Dictionary passed;
    ASSERT_TRUE(reader.readDictionary(passed));
    EXPECT_EQ(reader.finish(), BodyStatus::ok);
    EXPECT_EQ(passed, test::samplePayload());
  }
}

TEST(MessageWriter, ObjectsReadBackTheSameInBothByteOrders) {
  const Dictionary payload = test::samplePayload();
  const std::string bytes = call("a{sv}", [&](MessageWriter& w) { w.writeDictionary(payload); });
  for (const std::string& form : {bytes, test::ByteOrderSwapper::swapped(bytes)}) {
    Message message;
    const Frame read = frame(form, message);
    ASSERT_EQ(read.status, FrameStatus::complete) << read.problem;
    BodyReader reader(message);
    Dictionary dictionary;
    ASSERT_TRUE(reader.readDictionary(dictionary)) << reader.problem();
    EXPECT_EQ(reader.finish(), BodyStatus::ok);
    EXPECT_EQ(dictionary, payload);
    EXPECT_EQ(dictionary.find("count")->kind(), Value::Kind::integer);
    EXPECT_EQ(dictionary.find("size")->kind(), Value::Kind::unsignedInteger);
    EXPECT_EQ(dictionary.find("ratio")->kind(), Value::Kind::real);
    EXPECT_EQ(dictionary.find("on")->kind(), Value::Kind::boolean);
    EXPECT_EQ(dictionary.find("when")->kind(), Value::Kind::date);
    EXPECT_EQ(dictionary.find("blob")->kind(), Value::Kind::data);
    EXPECT_EQ(dictionary.begin()->key, "name");
  }
}

TEST(MessageWriter, EveryArgumentThatMayBeNoneReadsBackInBothByteOrders) {
  for (const bool present : {false, true}) {
    const auto body = [&](MessageWriter& w) {
      w.writeOptionalDictionary(present ? std::optional(Dictionary{{"a", 1}}) : std::nullopt);
      w.writeOptionalValue(present ? Value("x") : Value());
      w.writeOptionalStrings(present ? std::optional(Array{"one", 2, "three"}) : std::nullopt);
      w.writeOptionalError(present ? std::optional(Error{"d", -3, "why"}) : std::nullopt);
      w.writeArray({});
      w.writeDescriptorIndexes(present ? 2 : 0);
      w.writeDouble(1.5);
    };
    const std::string bytes = call("aa{sv}avaasa(sis)avahd", body);
    for (const std::string& form : {bytes, test::ByteOrderSwapper::swapped(bytes)}) {
      Message message;
      ASSERT_EQ(frame(form, message).status, FrameStatus::complete);
      EXPECT_TRUE(validateBody(message));
      BodyReader reader(message);
      std::optional<Dictionary> dictionary;
      Value value;
      std::optional<Array> strings;
      std::optional<Error> error;
      Array array;
      std::vector<uint32_t> descriptors;
      double number = 0;
      ASSERT_TRUE(reader.hasSignature("aa{sv}avaasa(sis)avahd"));
      EXPECT_TRUE(reader.readOptionalDictionary(dictionary));
      EXPECT_TRUE(reader.readOptionalValue(value));
      EXPECT_TRUE(reader.readOptionalStrings(strings));
      EXPECT_TRUE(reader.readOptionalError(error));
      EXPECT_TRUE(reader.readArray(array));
      EXPECT_TRUE(reader.readDescriptorIndexes(descriptors));
      EXPECT_TRUE(reader.readDouble(number));
      ASSERT_EQ(reader.finish(), BodyStatus::ok) << reader.problem();
      EXPECT_EQ(dictionary.has_value(), present);
      EXPECT_EQ(value.isNull(), !present);
      EXPECT_EQ(strings, present ? std::optional(Array{"one", "three"}) : std::nullopt);
      EXPECT_EQ(error, present ? std::optional(Error{"d", -3, "why"}) : std::nullopt);
      EXPECT_EQ(descriptors, present ? (std::vector<uint32_t>{0, 1}) : std::vector<uint32_t>{});
      EXPECT_EQ(number, 1.5);
    }
  }
}

TEST(MessageWriter, LeavesOutNullEntriesAndElements) {
  const std::string bytes = call("a{sv}av", [](MessageWriter& w) {
    w.writeDictionary({{"none", nullptr}, {"some", 1}});
    w.writeArray({nullptr, 2});
  });
  Message message;
  ASSERT_EQ(frame(bytes, message).status, FrameStatus::complete);
  BodyReader reader(message);
  Dictionary dictionary;
  Array array;
  ASSERT_TRUE(reader.readDictionary(dictionary) && reader.readArray(array));
  EXPECT_EQ(dictionary, (Dictionary{{"some", 1}}));
  EXPECT_EQ(array, Array{2});
}

TEST(MessageWriter, ReplacesWhatIsNoUTF8) {
  const std::string bytes =
      call("s", [](MessageWriter& w) { w.writeString(std::string_view("a\xFF\0b\xC3", 5)); });
  Message message;
  ASSERT_EQ(frame(bytes, message).status, FrameStatus::complete);
  EXPECT_TRUE(validateBody(message));
  BodyReader reader(message);
  std::string_view text;
  ASSERT_TRUE(reader.readStringView(text));
  EXPECT_EQ(text,
            "a\xEF\xBF\xBD\xEF\xBF\xBD"
            "b\xEF\xBF\xBD");
}

TEST(MessageWriter, GivesUpAMessageThatIsTooLongAndRestoresTheBuffer) {
  std::string bytes = "before";
  MessageWriter writer(bytes, 512);
  writer.beginCall(1, {.member = "M", .signature = "s"});
  writer.writeString(std::string(600, 'x'));
  EXPECT_FALSE(writer.end());
  EXPECT_EQ(bytes, "before");
}

TEST(MessageWriter, GivesUpAMessageThatIsNestedTooDeeply) {
  for (const auto& [levels, fits] : {std::pair(31, true), std::pair(32, false)}) {
    Value value = "leaf";
    for (int i = 0; i < levels; ++i) value = Array{value};
    std::string bytes;
    MessageWriter writer(bytes);
    writer.beginCall(1, {.member = "M", .signature = "av"});
    writer.writeOptionalValue(value);
    EXPECT_EQ(writer.end(), fits);
    if (!fits) continue;
    Message message;
    ASSERT_EQ(frame(bytes, message).status, FrameStatus::complete);
    EXPECT_TRUE(validateBody(message));
    BodyReader reader(message);
    Value read;
    EXPECT_TRUE(reader.readOptionalValue(read));
    EXPECT_EQ(read, value);
  }
}

TEST(MessageWriter, ManyMessagesShareOneBufferAtAnyAddress) {
  std::string bytes;
  for (const std::string& each : test::everyCall()) bytes += "x" + each;
  size_t at = 0;
  for (const std::string& each : test::everyCall()) {
    ++at;
    Message message;
    const Frame read = frame(std::string_view(bytes).substr(at), message);
    ASSERT_EQ(read.status, FrameStatus::complete) << read.problem;
    EXPECT_EQ(read.size, each.size());
    EXPECT_TRUE(validateBody(message));
    at += read.size;
  }
}

}  // namespace
}  // namespace kyt
