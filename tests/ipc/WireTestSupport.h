// What the codec's tests share: messages of every kind of call, a plain re-writing of a message into the
// other byte order, and hexadecimal texts.
#pragma once

#include <cstddef>
#include <cstring>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/ipc/MessageReader.h"
#include "platform/ipc/MessageWriter.h"
#include "platform/ipc/WireText.h"

namespace kyt::test {

inline std::span<const std::byte> bytesOf(std::string_view text) {
  return std::as_bytes(std::span(text));
}

inline constexpr uint64_t kLimit = 1048576;

inline Frame frame(std::string_view bytes, Message& message) {
  return readMessage(bytesOf(bytes), kLimit, message);
}

inline Dictionary samplePayload() {
  return {{"name", "a name that is longer than fifteen bytes"},
          {"count", int64_t{-5}},
          {"size", uint64_t{1} << 63},
          {"ratio", 0.25},
          {"on", true},
          {"when", Date{1769860800.5}},
          {"blob", Data("\x01\x02\x03")},
          {"list", Array{1, "two", 3.0, Array{}}},
          {"inner", Dictionary{{"k", "v"}, {"\xC3\xA4", "\xE2\x82\xAC"}}},
          {"empty", Dictionary{}}};
}

// One well-formed message for each method of the session's interface.
inline std::vector<std::string> everyCall() {
  std::vector<std::string> calls;
  const auto add = [&](std::string_view member, std::string_view signature, auto&& body, uint32_t fds = 0) {
    std::string bytes;
    MessageWriter writer(bytes);
    writer.beginCall(static_cast<uint32_t>(calls.size() + 1),
                     {.member = member, .signature = signature, .unixFds = fds});
    body(writer);
    if (writer.end()) calls.push_back(bytes);
  };
  const auto none = [](MessageWriter&) {};
  const Dictionary info{{"SessionID", uint64_t{1}}, {"ClientType", 7}};
  add("SetSessionInfo", "a{sv}aa{sv}avb", [&](MessageWriter& w) {
    w.writeDictionary(info);
    w.writeOptionalDictionary(Dictionary{{"ClientName", "a"}});
    w.writeOptionalValue(Array{"UIKit"});
    w.writeBoolean(true);
  });
  add("StartConfigWithCompletionHandler", "", none);
  add("FetchStatesWithUserInfo", "aa{sv}",
      [&](MessageWriter& w) { w.writeOptionalDictionary(std::nullopt); });
  add("FetchDisplayURL", "", none);
  add("SendMessageWithDictionary", "a{sv}", [&](MessageWriter& w) {
    w.writeDictionary({{"Category", 3}, {"Type", 4}, {"Payload", samplePayload()}});
  });
  add("FlushMessagesWithCompletion", "", none);
  add("FinishSessionGracefully", "", none);
  add(
      "UploadFileAtPath", "ssah",
      [&](MessageWriter& w) {
        w.writeString("file:///tmp/x");
        w.writeString("token");
        w.writeDescriptorIndexes(2);
      },
      2);
  add("UploadLogData", "av", [&](MessageWriter& w) { w.writeArray({1, "line"}); });
  add("SendMessageWithSessionInfo", "a{sv}aa{sv}qqaa{sv}", [&](MessageWriter& w) {
    w.writeDictionary(info);
    w.writeOptionalDictionary(std::nullopt);
    w.writeUInt16(5);
    w.writeUInt16(6);
    w.writeOptionalDictionary(samplePayload());
  });
  add("UpdateSharedDataWithDictionary", "a{sv}",
      [&](MessageWriter& w) { w.writeDictionary(samplePayload()); });
  add("UpdateSharedDataForKey", "sav", [&](MessageWriter& w) {
    w.writeString("key");
    w.writeOptionalValue("value");
  });
  add("SetDigestKey", "ayi", [&](MessageWriter& w) {
    w.writeData(bytesOf("secret"));
    w.writeInt32(-1);
  });
  return calls;
}

// Turns the numbers of a message round, walking it by its own types: written apart from the codec on purpose.
class ByteOrderSwapper {
 public:
  static std::string swapped(std::string message) {
    ByteOrderSwapper s(message);
    s.header();
    return message;
  }

 private:
  explicit ByteOrderSwapper(std::string& bytes) : bytes_(bytes) {}
  void header() {
    bytes_[0] = bytes_[0] == 'l' ? 'B' : 'l';
    std::string signature;
    at_ = 4;
    const size_t bodyLength = number(4);
    number(4);
    const size_t fieldsEnd = number(4) + 16;
    while (at_ < fieldsEnd) {
      align(8);
      const char code = bytes_[at_++];
      const size_t before = at_;
      value("v");
      if (code == 8) signature = bytes_.substr(before + 4, static_cast<unsigned char>(bytes_[before + 3]));
    }
    align(8);
    base_ = at_;
    if (bodyLength != 0) values(signature);
  }
  void align(size_t n) {
    while ((at_ - base_) % n != 0) ++at_;
  }
  uint64_t number(size_t size) {
    align(size);
    uint64_t value = 0;
    std::memcpy(&value, bytes_.data() + at_, size);
    std::string reversed(bytes_.rbegin() + static_cast<long>(bytes_.size() - at_ - size),
                         bytes_.rbegin() + static_cast<long>(bytes_.size() - at_));
    bytes_.replace(at_, size, reversed);
    at_ += size;
    return value;
  }
  void values(std::string_view types) {
    while (!types.empty()) {
      const size_t length = wire::firstTypeLength(types);
      value(types.substr(0, length));
      types.remove_prefix(length);
    }
  }
  void value(std::string_view type) {
    switch (type[0]) {
      case 'y':
        ++at_;
        break;
      case 'n':
      case 'q':
        number(2);
        break;
      case 'b':
      case 'i':
      case 'u':
      case 'h':
        number(4);
        break;
      case 'x':
      case 't':
      case 'd':
        number(8);
        break;
      case 's':
      case 'o':
        at_ += number(4) + 1;
        break;
      case 'g':
        at_ += static_cast<unsigned char>(bytes_[at_]) + 2u;
        break;
      case 'v': {
        const std::string inner = bytes_.substr(at_ + 1, static_cast<unsigned char>(bytes_[at_]));
        at_ += inner.size() + 2;
        value(inner);
        break;
      }
      case 'a': {
        const size_t length = number(4);
        align(wire::alignmentOf(type[1]));
        for (const size_t end = at_ + length; at_ < end;) value(type.substr(1));
        break;
      }
      default:
        align(8);
        values(type.substr(1, type.size() - 2));
    }
  }
  std::string& bytes_;
  size_t at_ = 0, base_ = 0;
};

inline std::string fromHex(std::string_view text) {
  std::string out;
  int high = -1;
  for (char c : text) {
    const int digit = c >= '0' && c <= '9' ? c - '0' : c >= 'a' && c <= 'f' ? c - 'a' + 10 : -1;
    if (digit < 0) continue;
    if (high < 0) {
      high = digit;
    } else {
      out.push_back(static_cast<char>(high * 16 + digit));
      high = -1;
    }
  }
  return out;
}

}  // namespace kyt::test
