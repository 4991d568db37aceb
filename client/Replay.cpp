#include "client/Replay.h"

#include <utility>

#include "client/WireSize.h"

namespace kyt::client {

namespace {

constexpr size_t kPieceBytes = 256 * 1024;  // of shared data: well below what a message may have

class Replay {
 public:
  Replay(const KeptState& kept, Function<bool(Call)> send) : kept_(kept), send_(std::move(send)) {}

  Replayed run() {
    if (!identity()) return {false, 0};
    if (kept_.isConfigured()) (void)send_({Method::startConfigWithCompletionHandler});
    sharedData();
    if (kept_.digestKey()) count(send_({Method::setDigestKey, *kept_.digestKey()}));
    return {true, failed_};
  }

 private:
  void count(bool sent) { failed_ += sent ? 0 : 1; }

  bool identity() {
    if (send_({Method::setSessionInfo, kept_.identity()})) return true;
    // Too large together?
    IdentityArguments alone = kept_.identity();
    UserInfoArguments userInfo{std::exchange(alone.userInfo, std::nullopt)};
    if (!send_({Method::setSessionInfo, std::move(alone)})) return false;
    count(send_({Method::fetchStatesWithUserInfo, std::move(userInfo)}));
    return true;
  }

  void sharedData() {
    Dictionary piece;
    size_t bytes = 0;
    for (const DictionaryEntry& entry : kept_.sharedData()) {
      const size_t more = entryBytes(entry);
      if (bytes > 0 && bytes + more > kPieceBytes) {
        entries(std::exchange(piece, Dictionary()));
        bytes = 0;
      }
      piece.append(entry.key, entry.value);
      bytes += more;
    }
    if (!piece.empty()) entries(piece);
  }

  void entries(const Dictionary& piece) {
    if (send_({Method::updateSharedDataWithDictionary, SharedDataArguments{piece}})) return;
    // Larger than the estimate, or a value that only its own call has room for.
    for (const DictionaryEntry& entry : piece)
      count(send_({Method::updateSharedDataForKey, SharedDataForKeyArguments{entry.key, entry.value}}));
  }

  const KeptState& kept_;
  Function<bool(Call)> send_;
  uint64_t failed_ = 0;
};

}  // namespace

Replayed replay(const KeptState& kept, Function<bool(Call)> send) {
  return Replay(kept, std::move(send)).run();
}

}  // namespace kyt::client
