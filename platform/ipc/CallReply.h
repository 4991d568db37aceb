// The one reply to one call. Replies are handed to a session or window as functions that own a CallReply; whoever drops
// such a function uncalled answers the client "Failed". Only the dispatchers use this.
#pragma once

#include <cstdint>
#include <memory>
#include <string_view>
#include <utility>

#include "platform/ipc/ConnectionOutput.h"
#include "platform/ipc/MessageReader.h"

namespace kyt {

class CallReply {
 public:
  CallReply(const Message& call, std::shared_ptr<ConnectionOutput> output)
      : output_(call.expectsReply() ? std::move(output) : nullptr), serial_(call.serial) {}
  CallReply(CallReply&& other) noexcept = default;
  CallReply& operator=(CallReply&&) = delete;
  ~CallReply() {
    if (output_) error(wire::kErrorFailed, "The call was not answered");
  }

  // The body is written by `body(MessageWriter&)`. A second answer to the same call is ignored.
  template <typename Body>
  void answer(std::string_view signature, Body&& body) {
    const std::shared_ptr<ConnectionOutput> output = std::exchange(output_, nullptr);
    if (!output) return;
    const uint32_t replySerial = serial_;
    const auto sent = output->send([&](MessageWriter& writer, uint32_t serial) {
      writer.beginReply(serial, replySerial, signature);
      body(writer);
      return writer.end();
    });
    if (sent == ConnectionOutput::Sent::refused) {
      sendError(*output, wire::kErrorFailed, "The answer is too large for a message");
    }
  }
  // The same for an answer that may be larger than what may wait for the client: where it is, nothing is answered yet, and
  // false is returned.
  template <typename Body>
  [[nodiscard]] bool answerIfItFits(std::string_view signature, Body&& body) {
    if (!output_) return true;
    const auto sent = output_->send(
        [&](MessageWriter& writer, uint32_t serial) {
          writer.beginReply(serial, serial_, signature);
          body(writer);
          return writer.end();
        },
        ConnectionOutput::Kind::bounded);
    if (sent == ConnectionOutput::Sent::refused || sent == ConnectionOutput::Sent::queueFull) return false;
    output_.reset();
    return true;
  }
  void answerNothing() {
    answer({}, [](MessageWriter&) {});
  }
  void error(std::string_view name, std::string_view text) {
    if (const auto output = std::exchange(output_, nullptr)) sendError(*output, name, text);
  }
  // Nothing is answered: the connection ends.
  void forget() { output_.reset(); }

 private:
  void sendError(ConnectionOutput& output, std::string_view name, std::string_view text) const {
    output.send([&](MessageWriter& writer, uint32_t serial) {
      return writer.writeError(serial, serial_, name, text);
    });
  }

  std::shared_ptr<ConnectionOutput> output_;
  uint32_t serial_;
};

}  // namespace kyt
