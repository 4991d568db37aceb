// Reads a message's body straight from the stream's buffer into objects. Used by the server for the calls of
// ClientSessionInterface and by the client library for replies and for sendMessageToClient.
//
// The caller compares the message's signature with the one it expects first (`hasSignature`), then reads the
// arguments in order, each with the function for its type, then asks `finish()`. Reading stops at the first
// failure: every later read returns false and leaves its target as it was.
//
// Objects inside variants: b boolean; y q u t unsigned; n i x signed; d double; s o g strings; ay data; (d) a
// date; a{s*} a dictionary; any other array an array. Of equal keys the last wins. What the protocol admits
// but objects cannot hold (an `h` inside a variant, a struct that is no date, keys that are no strings, two
// elements where none or one is meant) are invalid arguments, not a malformed message: finish() tells the two
// apart exactly, checking the rest of the body where reading stopped.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string_view>
#include <vector>

#include "platform/base/Error.h"
#include "platform/ipc/MessageReader.h"
#include "platform/ipc/WireCursor.h"
#include "platform/objects/Value.h"

namespace kyt {

class BodyReader {
 public:
  explicit BodyReader(const Message& message);

  // False (and invalid arguments, or malformed) when the message's signature is another one.
  bool hasSignature(std::string_view expected);

  bool readBoolean(bool& out);                                  // b
  bool readUInt16(uint16_t& out);                               // q
  bool readInt32(int32_t& out);                                 // i
  bool readUInt32(uint32_t& out);                               // u
  bool readUInt64(uint64_t& out);                               // t
  bool readDouble(double& out);                                 // d
  bool readString(String& out);                                 // s
  bool readStringView(std::string_view& out);                   // s, in place
  bool readData(Data& out);                                     // ay
  bool readDictionary(Dictionary& out);                         // a{sv}
  bool readOptionalDictionary(std::optional<Dictionary>& out);  // aa{sv}, none or one
  bool readDictionaries(std::vector<Dictionary>& out);          // aa{sv}, of any length
  bool readStrings(std::vector<std::string>& out);              // as, of any length
  bool readOptionalValue(Value& out);                           // av, none or one; null: none
  bool readArray(Array& out);                                   // av, of any length
  bool readOptionalStrings(std::optional<Array>& out);          // aas, none or one
  bool readOptionalError(std::optional<Error>& out);            // a(sis), none or one
  bool readDescriptorIndexes(std::vector<uint32_t>& out);       // ah

  // The caller's own objection to arguments that are whole.
  void refuse(const char* problem);

  // Everything was read, and nothing is left over. Otherwise whose fault it is.
  [[nodiscard]] BodyStatus finish();
  // After a status other than ok: what was wrong, for the error reply and the log.
  [[nodiscard]] const char* problem() const { return cursor_.problem; }

 private:
  [[nodiscard]] bool good() const { return cursor_.status == BodyStatus::ok; }
  bool endOfOptional(const uint8_t* end);

  const Message& message_;
  WireCursor cursor_;
};

}  // namespace kyt
