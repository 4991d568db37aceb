// What a daemon is told first on each new connection. What does not fit into one message goes in pieces; what
// cannot be sent is counted.
#include <utility>

#include "client/Session.h"
#include "client/WireSize.h"

namespace kyt::client {

namespace {

using Kind = Command::Kind;

constexpr size_t kPieceBytes = 256 * 1024;  // of shared data: well below what a message may have

}  // namespace

void Session::replay() {
  if (single_ || !replayIdentity()) return;
  if (kept_.configured) (void)sendAgain(std::make_unique<Command>(Kind::startConfiguration));
  replaySharedData();
  if (!kept_.digestKey) return;
  auto command = std::make_unique<Command>(Kind::setDigestKey);
  command->data = *kept_.digestKey;
  command->algorithm = kept_.digestAlgorithm;
  if (!sendAgain(std::move(command))) replayFailed_.fetch_add(1);
}

// False when the daemon cannot be told who the session is: then nothing else may be sent, since the rules for
// what it sends would not be known.
bool Session::replayIdentity() {
  if (encodeSessionInfo(kept_.userInfo)) return true;
  if (!encodeSessionInfo(std::nullopt)) {
    const std::string reason =
        "the session's information cannot be sent: larger than a megabyte, or nested too deeply";
    standing_.become(KYTReporting::State::refused, reason);
    end(ClientError::invalid, reason);
    return false;
  }
  // Too large together.
  auto command = std::make_unique<Command>(Kind::fetchStates);
  command->dictionary = kept_.userInfo;
  if (!sendAgain(std::move(command))) replayFailed_.fetch_add(1);
  return true;
}

bool Session::sendAgain(std::unique_ptr<Command> command) {
  command->replayed = true;
  const uint32_t serial = ++serial_;
  if (!encodeCommand(*command, serial)) return false;
  pending_.push_back({serial, std::move(command)});
  return true;
}

void Session::replaySharedData() {
  Dictionary piece;
  size_t bytes = 0;
  for (const DictionaryEntry& entry : kept_.sharedData) {
    const size_t more = entryBytes(entry);
    if (bytes > 0 && bytes + more > kPieceBytes) {
      replayEntries(std::exchange(piece, Dictionary()));
      bytes = 0;
    }
    piece.append(entry.key, entry.value);
    bytes += more;
  }
  if (!piece.empty()) replayEntries(piece);
}

void Session::replayEntries(const Dictionary& entries) {
  auto all = std::make_unique<Command>(Kind::updateSharedData);
  all->dictionary = entries;
  if (sendAgain(std::move(all))) return;
  // Larger than the estimate, or a value that only its own call has room for.
  for (const DictionaryEntry& entry : entries) {
    auto one = std::make_unique<Command>(Kind::updateSharedDataForKey);
    one->text = entry.key;
    one->value = entry.value;
    if (!sendAgain(std::move(one))) replayFailed_.fetch_add(1);
  }
}

}  // namespace kyt::client
