// What a session has to tell the daemon besides plain messages, with the completion that waits for the
// answer. Made by the public operations on any thread, handled on the library's thread.
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <vector>

#include "kytreporting/KYTReporting.h"

namespace kyt::client {

struct Command {
  enum class Kind : uint8_t {
    messageWithReply,
    startConfiguration,
    fetchStates,
    fetchDisplayURL,
    flush,
    updateSharedData,
    updateSharedDataForKey,
    setDigestKey,
    uploadFile,
    uploadLogData,
    finish,
    singleMessage,
    ping  // the library's own: its answer says that the daemon took everything before it
  };

  explicit Command(Kind what) : kind(what) {}
  ~Command();
  Command(const Command&) = delete;
  Command& operator=(const Command&) = delete;

  Kind kind;
  bool replayed = false;  // the library's own, to a daemon that came back
  bool given = true;      // false: its completion was told that it is not sent any more
  // Until when its completion waits for a daemon; none: for ever.
  std::optional<std::chrono::steady_clock::time_point> deadline;
  uint16_t category = 0, type = 0;
  uint32_t flag = 0;
  int32_t algorithm = 0;
  std::optional<Dictionary> dictionary;  // payload, user information or shared data
  String text;                           // shared data's key, file URL
  Value value;
  Data data;
  Array array;
  std::vector<int> descriptors;  // owned

  KYTReporting::StatesCompletion statesCompletion;
  KYTReporting::ObjectCompletion objectCompletion;
  KYTReporting::TextCompletion textCompletion;
  KYTReporting::SuccessCompletion successCompletion;

  [[nodiscard]] bool hasCompletion() const;
  // Whether the daemon gets it even if nobody waits for the answer any more: it says what the session is.
  [[nodiscard]] bool staysGiven() const;
  // A command of the same kind with this one's completions, which this one has no more.
  [[nodiscard]] std::unique_ptr<Command> takeCompletions();
  // Runs whichever completion is set, once.
  void fail(ClientError code, const std::string& text);
};

// What is wrong with a message of which one of the two is more than 65535.
[[nodiscard]] std::string outOfRange(uint32_t category, uint32_t type);
[[nodiscard]] Error clientError(ClientError code, std::string text);

}  // namespace kyt::client
