// Every kind of call, cut off anywhere and corrupted anywhere: the right outcome, and never a crash.
#include "platform/ipc/MessageReader.h"

#include <gtest/gtest.h>

#include <string>
#include <tuple>
#include <vector>

#include "WireTestSupport.h"
#include "platform/ipc/BodyReader.h"
#include "platform/ipc/BodyValidator.h"

namespace kyt {
namespace {

using test::everyCall;
using test::frame;

// Reads the arguments as the session's interface would, whatever they are by their own signature.
BodyStatus readArguments(const Message& message) {
  BodyReader reader(message);
  std::string_view types = message.signature;
  Dictionary dictionary;
  std::optional<Dictionary> optionalDictionary;
  Value value;
  Array array;
  String string;
  Data data;
  std::vector<uint32_t> descriptors;
  while (!types.empty()) {
    const std::string_view type = types.substr(0, wire::firstTypeLength(types));
    types.remove_prefix(type.size());
    bool flag = false;
    uint16_t small = 0;
    int32_t number = 0;
    if (type == "a{sv}") {
      reader.readDictionary(dictionary);
    } else if (type == "aa{sv}") {
      reader.readOptionalDictionary(optionalDictionary);
    } else if (type == "av" && message.member == "UploadLogData") {
      reader.readArray(array);
    } else if (type == "av") {
      reader.readOptionalValue(value);
    } else if (type == "b") {
      reader.readBoolean(flag);
    } else if (type == "q") {
      reader.readUInt16(small);
    } else if (type == "i") {
      reader.readInt32(number);
    } else if (type == "s") {
      reader.readString(string);
    } else if (type == "ay") {
      reader.readData(data);
    } else if (type == "ah") {
      reader.readDescriptorIndexes(descriptors);
    } else {
      reader.hasSignature("none of ours");
      break;
    }
  }
  return reader.finish();
}

TEST(MessageReader, EveryTruncationIsIncompleteAndAsksForEnough) {
  for (const std::string& bytes : everyCall()) {
    for (const std::string& form : {bytes, test::ByteOrderSwapper::swapped(bytes)}) {
      for (size_t length = 0; length < form.size(); ++length) {
        Message message;
        const std::string cut = form.substr(0, length);  // its own block, so that reading past it is seen
        const Frame read = frame(cut, message);
        ASSERT_EQ(read.status, FrameStatus::incomplete) << length;
        ASSERT_GT(read.size, length);
        ASSERT_LE(read.size, form.size());
      }
      Message message;
      EXPECT_EQ(frame(form, message).status, FrameStatus::complete);
      EXPECT_EQ(readArguments(message), BodyStatus::ok);
    }
  }
}

TEST(MessageReader, EveryCorruptedByteHasTheOutcomeThatTheValidatorSays) {
  size_t malformed = 0, complete = 0;
  for (const std::string& bytes : everyCall()) {
    for (size_t at = 0; at < bytes.size(); ++at) {
      for (const int change : {0x01, 0x02, 0x10, 0x20, 0x80, 0xFF}) {
        std::string form = bytes;
        form[at] = static_cast<char>(form[at] ^ change);
        Message message;
        const Frame read = frame(form, message);
        if (read.status != FrameStatus::complete) {
          malformed += read.status == FrameStatus::malformed ? 1 : 0;
          continue;
        }
        ++complete;
        const bool valid = validateBody(message);
        const BodyStatus status = readArguments(message);
        ASSERT_EQ(status == BodyStatus::malformed, !valid)
            << message.member << " byte " << at << " ^ " << change;
      }
    }
  }
  EXPECT_GT(malformed, 1000u);
  EXPECT_GT(complete, 1000u);
}

std::string plainCall() {
  return everyCall()[1];
}

FrameStatus statusWith(std::string bytes, size_t at, std::string_view replacement) {
  bytes.replace(at, replacement.size(), replacement);
  Message message;
  return frame(bytes, message).status;
}

// What two readings of the same bytes must agree about.
auto whatWasRead(const Frame& frame, const Message& m) {
  const bool whole = frame.status == FrameStatus::complete;
  const std::string_view problem = frame.problem != nullptr ? frame.problem : "";
  return std::tuple(
      frame.status, frame.size, problem,
      !whole
          ? std::tuple<uint8_t, bool, uint32_t, uint32_t, uint32_t, const std::byte*, size_t>()
          : std::tuple(m.flags, m.swapped, m.serial, m.replySerial, m.unixFds, m.body.data(), m.body.size()),
      !whole ? std::tuple<std::string_view, std::string_view, std::string_view, std::string_view>()
             : std::tuple(m.path, m.interface, m.member, m.signature));
}

void expectTheSame(HeaderMemory& memory, std::string_view bytes, const std::string& what) {
  Message plain, remembered;
  const Frame expected = frame(bytes, plain);
  const Frame read = readMessage(test::bytesOf(bytes), test::kLimit, remembered, &memory);
  EXPECT_EQ(whatWasRead(read, remembered), whatWasRead(expected, plain)) << what;
}

TEST(MessageReader, ReadsTheSameWhateverTheHeaderBeforeWas) {
  std::vector<std::string> messages = everyCall();
  const size_t calls = messages.size();
  for (size_t i = 0; i < calls; ++i) messages.push_back(test::ByteOrderSwapper::swapped(messages[i]));
  messages.push_back(messages[0]);
  messages.back()[2] = 1;   // expects no reply
  messages.back()[8] = 99;  // has another serial
  for (size_t first = 0; first < messages.size(); ++first) {
    for (size_t second = 0; second < messages.size(); ++second) {
      HeaderMemory memory;
      const std::string what = std::to_string(first) + ", " + std::to_string(second);
      for (const size_t i : {first, first, second, first}) expectTheSame(memory, messages[i], what);
    }
  }
}

TEST(MessageReader, ChecksAHeaderThatDiffersFromTheOneBeforeInAnyByte) {
  const std::string good = everyCall().front();
  HeaderMemory memory;
  for (size_t at = 0; at < 160; ++at) {
    for (const char change : {char(1), char(0x20), char(0x80)}) {
      std::string other = good;
      other[at] = static_cast<char>(other[at] ^ change);
      const std::string what = "byte " + std::to_string(at);
      for (const std::string& bytes : {good, other, other, good}) expectTheSame(memory, bytes, what);
    }
  }
}

TEST(MessageReader, ReadsAHeaderThatIsTooLongToBeRemembered) {
  std::string longer;
  MessageWriter writer(longer);
  const std::string member(255, 'm');
  writer.beginCall(1, {.member = member, .signature = ""});
  ASSERT_TRUE(writer.end());
  HeaderMemory memory;
  for (const std::string& bytes : {everyCall().front(), longer, longer, everyCall().front()})
    expectTheSame(memory, bytes, "long");
}

TEST(MessageReader, RefusesWhatTheFixedHeaderMayNotHold) {
  using namespace std::string_view_literals;
  EXPECT_EQ(statusWith(plainCall(), 0, "x"), FrameStatus::malformed);
  EXPECT_EQ(statusWith(plainCall(), 1, "\0"sv), FrameStatus::malformed);
  EXPECT_EQ(statusWith(plainCall(), 3, "\2"), FrameStatus::malformed);
  EXPECT_EQ(statusWith(plainCall(), 8, "\0\0\0\0"sv), FrameStatus::malformed) << "serial 0";
}

TEST(MessageReader, PassesOverMessagesOfUnknownTypes) {
  std::string bytes = plainCall();
  bytes[1] = 5;
  Message message;
  const Frame read = frame(bytes, message);
  EXPECT_EQ(read.status, FrameStatus::skip);
  EXPECT_EQ(read.size, bytes.size());
}

TEST(MessageReader, RefusesHugeLengthsAtOnce) {
  using namespace std::string_view_literals;
  const std::string start = plainCall().substr(0, 16);
  EXPECT_EQ(statusWith(start, 4, "\x00\x00\x40\x06"sv), FrameStatus::tooLong) << "a body of 100 MiB";
  EXPECT_EQ(statusWith(start, 12, "\x00\x00\x40\x06"sv), FrameStatus::tooLong) << "fields of 100 MiB";
  EXPECT_EQ(statusWith(start, 4, "\xFF\xFF\xFF\xFF\1\0\0\0\xFF\xFF\xFF\xFF"sv), FrameStatus::tooLong);
}

TEST(MessageReader, TakesAMessageOfExactlyTheLimit) {
  const std::string bytes = plainCall();
  Message message;
  EXPECT_EQ(readMessage(test::bytesOf(bytes), bytes.size(), message).status, FrameStatus::complete);
  EXPECT_EQ(readMessage(test::bytesOf(bytes), bytes.size() - 1, message).status, FrameStatus::tooLong);
}

// A header of the given fields, as little-endian bytes.
FrameStatus headerStatus(uint8_t type, const std::vector<std::string>& fields, std::string_view body = {}) {
  std::string bytes("l\0\0\1\0\0\0\0\1\0\0\0\0\0\0\0", 16);
  bytes[1] = static_cast<char>(type);
  bytes[4] = static_cast<char>(body.size());
  for (const std::string& field : fields) {
    bytes.resize((bytes.size() + 7) / 8 * 8);
    bytes += field;
  }
  bytes[12] = static_cast<char>(bytes.size() - 16);
  bytes.resize((bytes.size() + 7) / 8 * 8);
  bytes += body;
  Message message;
  return frame(bytes, message).status;
}

std::string textField(char code, char type, std::string_view text) {
  std::string field{code, 1, type, 0, static_cast<char>(text.size()), 0, 0, 0};
  return field.append(text) + std::string(1, '\0');
}
std::string numberField(char code, char value) {
  return {code, 1, 'u', 0, value, 0, 0, 0};
}
std::string signatureField(std::string_view text) {
  std::string field{8, 1, 'g', 0, static_cast<char>(text.size())};
  return field.append(text) + std::string(1, '\0');
}

TEST(MessageReader, ChecksTheFieldsOfAHeader) {
  const std::string path = textField(1, 'o', "/a"), member = textField(3, 's', "M"),
                    interface = textField(2, 's', "a.b");
  const std::string reply = numberField(5, 1), error = textField(4, 's', "a.b");
  EXPECT_EQ(headerStatus(1, {path, member}), FrameStatus::complete);
  EXPECT_EQ(headerStatus(1, {path, member, signatureField("")}), FrameStatus::complete)
      << "six bytes, the last";
  EXPECT_EQ(headerStatus(2, {reply}), FrameStatus::complete);
  EXPECT_EQ(headerStatus(3, {reply, error}), FrameStatus::complete);
  EXPECT_EQ(headerStatus(4, {path, interface, member}), FrameStatus::complete);
  EXPECT_EQ(headerStatus(1, {path, member, signatureField("y")}, "x"), FrameStatus::complete);

  EXPECT_EQ(headerStatus(1, {path}), FrameStatus::malformed);
  EXPECT_EQ(headerStatus(1, {member}), FrameStatus::malformed);
  EXPECT_EQ(headerStatus(2, {path, member}), FrameStatus::malformed);
  EXPECT_EQ(headerStatus(3, {reply}), FrameStatus::malformed);
  EXPECT_EQ(headerStatus(3, {error}), FrameStatus::malformed);
  EXPECT_EQ(headerStatus(4, {path, member}), FrameStatus::malformed);
  EXPECT_EQ(headerStatus(1, {path, member, member}), FrameStatus::malformed) << "twice";
  EXPECT_EQ(headerStatus(1, {path, member}, "x"), FrameStatus::malformed) << "a body without a signature";
  EXPECT_EQ(headerStatus(2, {numberField(5, 0)}), FrameStatus::malformed) << "reply serial 0";
  EXPECT_EQ(headerStatus(1, {path, member, numberField(7, 1)}), FrameStatus::malformed)
      << "a sender that is a number";
  EXPECT_EQ(headerStatus(1, {textField(1, 's', "/a"), member}), FrameStatus::malformed)
      << "a path that is a string";
  EXPECT_EQ(headerStatus(1, {path, textField(3, 's', "a.b")}), FrameStatus::malformed);
  EXPECT_EQ(headerStatus(1, {path, member, textField(2, 's', "a")}), FrameStatus::malformed);
  EXPECT_EQ(headerStatus(1, {path, member, textField(6, 's', "a")}), FrameStatus::malformed);
  EXPECT_EQ(headerStatus(1, {path, member, signatureField("a")}), FrameStatus::malformed);
  EXPECT_EQ(headerStatus(1, {path, member, numberField(0, 1)}), FrameStatus::malformed) << "field 0";
}

TEST(MessageReader, ChecksFieldsThatItDoesNotKnowAndIgnoresThem) {
  const std::string path = textField(1, 'o', "/a"), member = textField(3, 's', "M");
  EXPECT_EQ(headerStatus(1, {numberField(77, 5), path, member}), FrameStatus::complete);
  EXPECT_EQ(headerStatus(1, {textField(77, 's', "x"), textField(77, 's', "y"), path, member}),
            FrameStatus::complete);
  EXPECT_EQ(headerStatus(1, {textField(77, 's', "\xFF"), path, member}), FrameStatus::malformed);
  EXPECT_EQ(headerStatus(1, {textField(77, 'z', "x"), path, member}), FrameStatus::malformed);
}

}  // namespace
}  // namespace kyt
