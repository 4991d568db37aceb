// What `kytctl` is told through the daemon's administration socket, by whoever listens there. The first byte says what is asked
// and whether a good handshake comes before the input; then the stream ends. What is checked besides memory: each question
// comes back, a text of an error is not empty, and what watching tells ends with the stream.
#include <sys/socket.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>

#include "platform/linux/base/Descriptors.h"
#include "tools/kytctl/WindowClient.h"

namespace kyt {
namespace {

constexpr size_t kMostBytes = 65536;  // fits in a socket's buffer
constexpr size_t kQuestionsAtATime = 3;
constexpr std::string_view kGreeting = "OK 0123456789abcdef0123456789abcdef\r\nAGREE_UNIX_FD\r\n";

void require(bool condition) {
  if (!condition) std::abort();
}

template <typename... Results>
bool isAnswer(const std::variant<Results...>& result) {
  const auto* error = std::get_if<Error>(&result);
  require(error == nullptr || !error->localizedDescription.empty());
  return error == nullptr;
}

bool isAnswer(const std::optional<Error>& error) {
  require(!error || !error->localizedDescription.empty());
  return !error;
}

bool ask(tools::WindowClient& client, unsigned question) {
  switch (question) {
    case 0:
      return isAnswer(client.dictionary("Status"));
    case 1:
      return isAnswer(client.dictionaries("Books"));
    case 2:
      return isAnswer(client.text("Metrics"));
    case 3:
      return isAnswer(client.texts("Reload"));
    case 4:
      return isAnswer(client.tell("SetLogLevel", "debug"));
    case 5:
      return isAnswer(client.order("FlushOutbox"));
    case 6:
      return isAnswer(client.number("DropOutbox", Dictionary{{"user", 1000}}));
    default:
      if (!isAnswer(client.watch(Dictionary{{"bodies", true}}))) return false;
      while (isAnswer(client.nextPassed())) {
      }
      return false;
  }
}

void talk(unsigned choice, std::string_view bytes) {
  int ends[2];
  require(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) == 0);
  const Descriptor daemon = ownDescriptor(ends[0]);
  Descriptor socket = ownDescriptor(ends[1]);
  std::string told((choice & 8) != 0 ? kGreeting : std::string_view());
  told += bytes.substr(0, kMostBytes);
  require(::send(daemon.get(), told.data(), told.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(told.size()));
  require(::shutdown(daemon.get(), SHUT_WR) == 0);
  auto connected = tools::WindowClient::over(std::move(socket));
  if (!isAnswer(connected)) return;
  auto& client = std::get<tools::WindowClient>(connected);
  for (size_t i = 0; i < kQuestionsAtATime && ask(client, choice & 7); ++i) {
  }
}

}  // namespace
}  // namespace kyt

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  kyt::talk(data[0], {reinterpret_cast<const char*>(data) + 1, size - 1});
  return 0;
}
