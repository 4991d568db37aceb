// The other end of the administration socket: asks the daemon how it stands. One call at a time, on the caller's thread,
// which waits for the answer.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/base/Descriptor.h"
#include "platform/base/Error.h"
#include "platform/ipc/BodyReader.h"
#include "platform/ipc/MessageReader.h"
#include "platform/objects/Value.h"

namespace kyt::tools {

class WindowClient {
 public:
  // Beneath the root. An error's code is kNoDaemon when nobody listens there; its text says whether a socket waits for the
  // first client, which is looked up and not tried, since that would start the daemon.
  static constexpr int32_t kNoDaemon = 3;
  [[nodiscard]] static std::variant<WindowClient, Error> connect(const std::string& root);

  // Over a connected stream socket.
  [[nodiscard]] static std::variant<WindowClient, Error> over(Descriptor socket);

  // With one text as argument, or with none.
  [[nodiscard]] std::variant<Dictionary, Error> dictionary(
      std::string_view member, const std::optional<std::string_view>& argument = std::nullopt);      // a{sv}
  [[nodiscard]] std::variant<std::vector<Dictionary>, Error> dictionaries(std::string_view member);  // aa{sv}
  [[nodiscard]] std::variant<std::string, Error> text(std::string_view member);                      // s
  [[nodiscard]] std::variant<std::vector<std::string>, Error> texts(std::string_view member);        // as
  // With one text as argument, without an answer but that it was done.
  [[nodiscard]] std::optional<Error> tell(std::string_view member, std::string_view argument);

  // Without argument and answer.
  [[nodiscard]] std::optional<Error> order(std::string_view member);
  // With a filter as argument: a{sv} in, t out.
  [[nodiscard]] std::variant<uint64_t, Error> number(std::string_view member, const Dictionary& filter);

  // Lets the daemon tell of events from now on; nextPassed() then waits for each, for ever.
  [[nodiscard]] std::optional<Error> watch(const Dictionary& filter);
  [[nodiscard]] std::variant<Dictionary, Error> nextPassed();

 private:
  explicit WindowClient(Descriptor socket) : socket_(std::move(socket)) {}
  [[nodiscard]] std::optional<Error> shakeHands();
  [[nodiscard]] std::optional<Error> send(std::string_view bytes) const;
  [[nodiscard]] std::optional<Error> receive();
  // The next message, which lies in received_ until the next call.
  [[nodiscard]] std::variant<Message, Error> next();
  [[nodiscard]] std::variant<Message, Error> call(std::string_view member,
                                                  const std::optional<std::string_view>& argument);
  [[nodiscard]] std::variant<Message, Error> callWith(std::string_view member, const Dictionary& filter);
  [[nodiscard]] std::variant<Message, Error> answerTo(const std::string& question);

  Descriptor socket_;
  std::string received_;
  size_t used_ = 0;  // of it
  uint32_t serial_ = 0;
};

}  // namespace kyt::tools
