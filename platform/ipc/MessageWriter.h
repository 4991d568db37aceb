// Writes messages in this machine's byte order at the end of a buffer that the caller owns, so that many
// calls or replies leave in one write. Used by the server for replies and by the client library for calls.
//
// One message at a time: begin…(), the body's arguments in the signature's order, end(). Any thread, one
// object each; no allocation but the buffer's growth.
//
// Objects inside variants take the shortest type that keeps their kind: boolean b, signed x, unsigned t,
// double d, date (d), string s, data ay, dictionary a{sv}, array av. Null has no type on the wire: entries
// and elements that are null are left out. Text that is no UTF-8 is written with U+FFFD in place of what is
// malformed.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/base/Error.h"
#include "platform/ipc/Wire.h"
#include "platform/objects/Value.h"

namespace kyt {

class MessageWriter {
 public:
  // Messages are appended to `out`, which must live as long as the writer. `maxMessageBytes`: what the
  // receiver takes.
  explicit MessageWriter(std::string& out, uint64_t maxMessageBytes = wire::kMaxMessageBytes)
      : out_(out), maxMessageBytes_(maxMessageBytes) {}

  struct Call {
    std::string_view path = wire::kSessionPath;
    std::string_view interface = wire::kSessionInterface;
    std::string_view member = {};
    std::string_view destination = {};  // empty: none; peer to peer needs none
    std::string_view signature = {};    // empty: no arguments
    bool expectsReply = true;
    uint32_t unixFds = 0;  // how many descriptors travel with the message's first byte
  };
  void beginCall(uint32_t serial, const Call& call);
  // The header of a call as bytes, for those that differ in nothing but their serials and bodies.
  [[nodiscard]] static std::string prepare(const Call& call);
  void beginCall(uint32_t serial, std::string_view prepared);
  void beginReply(uint32_t serial, uint32_t replySerial, std::string_view signature,
                  std::string_view destination = {}, std::string_view sender = {});
  void beginSignal(uint32_t serial, std::string_view path, std::string_view interface,
                   std::string_view member, std::string_view signature);
  // The body is one string, the error's text; complete, end() included.
  bool writeError(uint32_t serial, uint32_t replySerial, std::string_view errorName, std::string_view text,
                  std::string_view destination = {}, std::string_view sender = {});

  void writeBoolean(bool value);                                         // b
  void writeUInt16(uint16_t value);                                      // q
  void writeInt32(int32_t value);                                        // i
  void writeUInt32(uint32_t value);                                      // u
  void writeUInt64(uint64_t value);                                      // t
  void writeDouble(double value);                                        // d
  void writeString(std::string_view text);                               // s
  void writeData(std::span<const std::byte> bytes);                      // ay
  void writeDictionary(const Dictionary& dictionary);                    // a{sv}
  void writeDictionary(std::span<const DictionaryEntry> entries);        // a{sv}, in that order
  void writeEmptyDictionary();                                           // a{sv}
  void writeOptionalDictionary(const std::optional<Dictionary>& value);  // aa{sv}
  void writeDictionaries(std::span<const Dictionary> dictionaries);      // aa{sv}, of any length
  void writeStrings(std::span<const std::string> strings);               // as
  void writeOptionalValue(const Value& value);                           // av; null: none
  void writeArray(const Array& array);                                   // av, of any length
  void writeOptionalStrings(const std::optional<Array>& strings);        // aas; what is no string is left out
  void writeOptionalError(const std::optional<Error>& error);            // a(sis)
  void writeDescriptorIndexes(uint32_t count);                           // ah: 0 … count-1

  // Completes the message. False when it is longer than the receiver takes or nested too deeply: then the
  // buffer is as it was before begin…().
  [[nodiscard]] bool end();

 private:
  struct ArrayMark {
    size_t lengthAt, firstElement;
  };
  void begin(wire::MessageType type, uint8_t flags, uint32_t serial);
  void endHeader();
  void fieldText(wire::Field field, char type, std::string_view text);
  void fieldNumber(wire::Field field, uint32_t value);
  void align(size_t alignment);
  void put32(uint32_t value);
  void put64(uint64_t value);
  void putSignature(std::string_view signature);
  [[nodiscard]] ArrayMark beginArray(size_t elementAlignment);
  void endArray(const ArrayMark& mark);
  void writeVariant(const Value& value, int depth);
  void writeEntries(std::span<const DictionaryEntry> entries, int depth);
  [[nodiscard]] bool writeShortEntry(const DictionaryEntry& entry, int depth);
  void writeElements(const Array& array, int depth);

  std::string& out_;
  uint64_t maxMessageBytes_;
  size_t start_ = 0, fieldsStart_ = 0, bodyStart_ = 0;
  bool failed_ = false;
};

}  // namespace kyt
