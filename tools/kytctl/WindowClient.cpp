#include "tools/kytctl/WindowClient.h"

#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <span>

#include "platform/base/Paths.h"
#include "platform/ipc/AdministrationDispatcher.h"
#include "platform/ipc/Handshake.h"
#include "platform/ipc/MessageWriter.h"
#include "platform/linux/base/Descriptors.h"
#include "platform/linux/device/DepartureFile.h"

namespace kyt::tools {

namespace {

// The daemon answers at once, however many sessions there are.
constexpr timeval kPatience{30, 0};

Error failure(std::string text, int32_t code = 1) {
  return Error{"KYTToolsErrorDomain", code, std::move(text)};
}

Error systemFailure(const std::string& what) {
  return failure(what + ": " + std::strerror(errno));
}

void setPatience(const Descriptor& socket) {
  ::setsockopt(socket.get(), SOL_SOCKET, SO_RCVTIMEO, &kPatience, sizeof kPatience);
  ::setsockopt(socket.get(), SOL_SOCKET, SO_SNDTIMEO, &kPatience, sizeof kPatience);
}

// The kernel's list of Unix sockets has a row for each with its flags, of which one says that it listens, and its path.
bool isListeningAt(const std::string& path) {
  std::ifstream rows("/proc/net/unix");
  for (std::string row; std::getline(rows, row);)
    if (row.ends_with(" " + path) && row.find(" 00010000 ") != std::string::npos) return true;
  return false;
}

Error noDaemon(const Paths& paths) {
  if (const pid_t daemon = DaemonLock::holder(paths.userDefaults()); daemon > 0)
    return failure("the daemon runs, as process " + std::to_string(daemon) +
                   ", and has no administration socket at " + paths.administration());
  return failure(isListeningAt(paths.socket())
                     ? "the daemon does not run; its socket waits for the first client"
                     : "the daemon does not run, and no socket waits for clients at " + paths.socket(),
                 WindowClient::kNoDaemon);
}

}  // namespace

std::variant<WindowClient, Error> WindowClient::connect(const std::string& root) {
  const Paths paths = Paths::of(root, {});
  const std::string path = paths.administration();
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) return failure(path + ": " + std::strerror(ENAMETOOLONG));
  std::memcpy(address.sun_path, path.data(), path.size());
  Descriptor socket = ownDescriptor(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (socket.get() < 0) return systemFailure("Cannot make a socket");
  setPatience(socket);
  if (::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
    if (errno == ENOENT || errno == ECONNREFUSED || errno == ENOTDIR) return noDaemon(paths);
    if (errno == EACCES)
      return failure(path +
                     ": only root, the daemon's user and the group in admin.group may look at the daemon");
    return systemFailure(path);
  }
  return over(std::move(socket));
}

std::variant<WindowClient, Error> WindowClient::over(Descriptor socket) {
  WindowClient client(std::move(socket));
  if (auto error = client.shakeHands()) return std::move(*error);
  return client;
}

std::optional<Error> WindowClient::send(std::string_view bytes) const {
  while (!bytes.empty()) {
    const ssize_t sent = ::send(socket_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
    if (sent < 0 && errno == EINTR) continue;
    if (sent < 0) return systemFailure("Cannot ask the daemon");
    bytes.remove_prefix(static_cast<size_t>(sent));
  }
  return std::nullopt;
}

std::optional<Error> WindowClient::receive() {
  received_.erase(0, std::exchange(used_, 0));
  char buffer[65536];
  ssize_t count = 0;
  do {
    count = ::recv(socket_.get(), buffer, sizeof buffer, 0);
  } while (count < 0 && errno == EINTR);
  if (count < 0)
    return errno == EAGAIN ? failure("the daemon does not answer") : systemFailure("Cannot hear the daemon");
  if (count == 0) return failure("the daemon has ended the connection");
  received_.append(buffer, static_cast<size_t>(count));
  return std::nullopt;
}

std::optional<Error> WindowClient::shakeHands() {
  if (auto error = send(ClientHandshake::opening(::geteuid()))) return error;
  ClientHandshake handshake;
  for (;;) {
    if (auto error = receive()) return error;
    size_t consumed = 0;
    const auto status = handshake.feed(std::as_bytes(std::span(received_)), consumed);
    used_ = consumed;
    if (status == ClientHandshake::Status::done) return std::nullopt;
    if (status == ClientHandshake::Status::failed) return failure(handshake.problem());
  }
}

std::variant<Message, Error> WindowClient::next() {
  for (;;) {
    Message message;
    const auto bytes = std::as_bytes(std::span(received_)).subspan(used_);
    const Frame frame = readMessage(bytes, wire::kMaxMessageBytes, message);
    if (frame.status == FrameStatus::complete || frame.status == FrameStatus::skip) {
      used_ += frame.size;
      if (frame.status == FrameStatus::complete) return message;
      continue;
    }
    if (frame.status != FrameStatus::incomplete) return failure("the daemon's answer is malformed");
    if (auto error = receive()) return std::move(*error);
  }
}

std::variant<Message, Error> WindowClient::call(std::string_view member,
                                                const std::optional<std::string_view>& argument) {
  std::string bytes;
  MessageWriter writer(bytes);
  writer.beginCall(++serial_, {.interface = wire::kAdministrationInterface,
                               .member = member,
                               .signature = argument ? std::string_view("s") : std::string_view()});
  if (argument) writer.writeString(*argument);
  if (!writer.end()) return failure("the question is too long");
  return answerTo(bytes);
}

std::variant<Message, Error> WindowClient::answerTo(const std::string& question) {
  if (auto error = send(question)) return std::move(*error);
  for (;;) {
    auto message = next();
    const auto* answer = std::get_if<Message>(&message);
    if (answer == nullptr ||
        (answer->replySerial == serial_ && answer->type == wire::MessageType::methodReturn))
      return message;
    if (answer->replySerial != serial_) continue;
    BodyReader in(*answer);
    std::string_view text;
    in.readStringView(text);
    return failure(text.empty() ? std::string(answer->errorName) : std::string(text));
  }
}

std::variant<Dictionary, Error> WindowClient::dictionary(std::string_view member,
                                                         const std::optional<std::string_view>& argument) {
  auto answer = call(member, argument);
  if (auto* error = std::get_if<Error>(&answer)) return std::move(*error);
  BodyReader in(std::get<Message>(answer));
  Dictionary result;
  if (in.hasSignature("a{sv}")) in.readDictionary(result);
  if (in.finish() != BodyStatus::ok) return failure("the daemon's answer is of another form");
  return result;
}

std::variant<std::vector<Dictionary>, Error> WindowClient::dictionaries(std::string_view member) {
  auto answer = call(member, std::nullopt);
  if (auto* error = std::get_if<Error>(&answer)) return std::move(*error);
  BodyReader in(std::get<Message>(answer));
  std::vector<Dictionary> result;
  if (in.hasSignature("aa{sv}")) in.readDictionaries(result);
  if (in.finish() != BodyStatus::ok) return failure("the daemon's answer is of another form");
  return result;
}

std::variant<std::string, Error> WindowClient::text(std::string_view member) {
  auto answer = call(member, std::nullopt);
  if (auto* error = std::get_if<Error>(&answer)) return std::move(*error);
  BodyReader in(std::get<Message>(answer));
  std::string_view result;
  if (in.hasSignature("s")) in.readStringView(result);
  if (in.finish() != BodyStatus::ok) return failure("the daemon's answer is of another form");
  return std::string(result);
}

std::variant<std::vector<std::string>, Error> WindowClient::texts(std::string_view member) {
  auto answer = call(member, std::nullopt);
  if (auto* error = std::get_if<Error>(&answer)) return std::move(*error);
  BodyReader in(std::get<Message>(answer));
  std::vector<std::string> result;
  if (in.hasSignature("as")) in.readStrings(result);
  if (in.finish() != BodyStatus::ok) return failure("the daemon's answer is of another form");
  return result;
}

std::optional<Error> WindowClient::tell(std::string_view member, std::string_view argument) {
  auto answer = call(member, argument);
  if (auto* error = std::get_if<Error>(&answer)) return std::move(*error);
  return std::nullopt;
}

std::optional<Error> WindowClient::order(std::string_view member) {
  auto answer = call(member, std::nullopt);
  if (auto* error = std::get_if<Error>(&answer)) return std::move(*error);
  return std::nullopt;
}

std::variant<uint64_t, Error> WindowClient::number(std::string_view member, const Dictionary& filter) {
  auto answer = callWith(member, filter);
  if (auto* error = std::get_if<Error>(&answer)) return std::move(*error);
  BodyReader in(std::get<Message>(answer));
  uint64_t result = 0;
  if (in.hasSignature("t")) in.readUInt64(result);
  if (in.finish() != BodyStatus::ok) return failure("the daemon's answer is of another form");
  return result;
}

std::variant<Message, Error> WindowClient::callWith(std::string_view member, const Dictionary& filter) {
  std::string bytes;
  MessageWriter writer(bytes);
  writer.beginCall(++serial_,
                   {.interface = wire::kAdministrationInterface, .member = member, .signature = "a{sv}"});
  writer.writeDictionary(filter);
  if (!writer.end()) return failure("the question is too long");
  return answerTo(bytes);
}

std::optional<Error> WindowClient::watch(const Dictionary& filter) {
  auto answer = callWith("Watch", filter);
  if (auto* error = std::get_if<Error>(&answer)) return std::move(*error);
  constexpr timeval kForEver{0, 0};
  ::setsockopt(socket_.get(), SOL_SOCKET, SO_RCVTIMEO, &kForEver, sizeof kForEver);
  return std::nullopt;
}

std::variant<Dictionary, Error> WindowClient::nextPassed() {
  for (;;) {
    auto message = next();
    if (auto* error = std::get_if<Error>(&message)) return std::move(*error);
    const auto& signal = std::get<Message>(message);
    if (signal.type != wire::MessageType::signal || signal.member != kPassedSignal) continue;
    BodyReader in(signal);
    Dictionary passed;
    if (in.hasSignature(kPassedSignature)) in.readDictionary(passed);
    if (in.finish() != BodyStatus::ok) return failure("the daemon's signal is of another form");
    return passed;
  }
}

}  // namespace kyt::tools
