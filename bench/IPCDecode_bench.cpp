// Decoding of one SendMessageWithDictionary call, as the server does it: framing, header, body, all checks,
// into objects. The reference decodes the same bytes with the same checks into one flat reserved array, in
// two forms: of the same strings and values as objects, without the dictionaries around them (what the goal
// of 1.3 is measured against), and of views into the buffer, which own nothing.

#include <cstring>
#include <string>
#include <vector>

#include "bench/Corpus.h"
#include "bench/Measure.h"
#include "platform/Entitlements.h"
#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/base/UserBudget.h"
#include "platform/fake/ManualClock.h"
#include "platform/fake/ManualExecutor.h"
#include "platform/fake/ManualTimers.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/fake/MemoryStream.h"
#include "platform/ipc/BodyReader.h"
#include "platform/ipc/ClientSessionInterface.h"
#include "platform/ipc/DBusServer.h"
#include "platform/ipc/Handshake.h"
#include "platform/ipc/MessageReader.h"
#include "platform/ipc/MessageWriter.h"
#include "platform/ipc/WireText.h"
#include "platform/objects/Value.h"
#include "platform/queues/Log.h"

namespace {

using namespace kyt;

const std::vector<std::string>& calls() {
  static const std::vector<std::string> all = [] {
    std::vector<std::string> made;
    for (const Dictionary& payload : bench::corpusPayloads(256)) {
      std::string& bytes = made.emplace_back();
      bench::appendEventCall(bytes, static_cast<uint32_t>(made.size()), 3, payload);
    }
    return made;
  }();
  return all;
}

// The flat decoder: little-endian, entries of a{sv} in the order of the bytes, nested ones too.
template <typename Sink>
class FlatDecoder {
 public:
  FlatDecoder(const Message& message, Sink& sink)
      : begin_(reinterpret_cast<const uint8_t*>(message.body.data())),
        at_(begin_),
        end_(begin_ + message.body.size()),
        sink_(sink) {}
  bool decode() { return entries(0) && at_ == end_; }

 private:
  bool align(size_t n) {
    while ((static_cast<size_t>(at_ - begin_) & (n - 1)) != 0) {
      if (at_ == end_ || *at_++ != 0) return false;
    }
    return true;
  }
  template <typename T>
  bool number(T& out) {
    if (!align(sizeof(T)) || static_cast<size_t>(end_ - at_) < sizeof(T)) return false;
    std::memcpy(&out, at_, sizeof(T));
    at_ += sizeof(T);
    return true;
  }
  bool text(std::string_view& out) {
    uint32_t length = 0;
    if (!number(length) || static_cast<size_t>(end_ - at_) <= length) return false;
    out = {reinterpret_cast<const char*>(at_), length};
    if (at_[length] != 0 || !wire::isValidText(out)) return false;
    at_ += length + 1;
    return true;
  }
  bool entries(int depth) {
    uint32_t length = 0;
    if (depth > 20 || !number(length) || !align(8) || static_cast<size_t>(end_ - at_) < length) return false;
    const uint8_t* const end = at_ + length;
    while (at_ < end) {
      std::string_view key;
      if (!align(8) || !text(key) || !variant(key, depth)) return false;
    }
    return at_ == end;
  }
  bool variant(std::string_view key, int depth) {
    if (end_ - at_ < 3) return false;
    const size_t length = *at_;
    if (static_cast<size_t>(end_ - at_) < length + 2 || at_[length + 1] != 0) return false;
    const std::string_view type(reinterpret_cast<const char*>(at_ + 1), length);
    at_ += length + 2;
    if (type == "a{sv}") return entries(depth + 1);
    if (!wire::isValidSingleSignature(type)) return false;
    switch (type[0]) {
      case 's': {
        std::string_view value;
        if (!text(value)) return false;
        sink_.add(key, value);
        return true;
      }
      case 'x': {
        int64_t value = 0;
        if (!number(value)) return false;
        sink_.add(key, value);
        return true;
      }
      case 't': {
        uint64_t value = 0;
        if (!number(value)) return false;
        sink_.add(key, value);
        return true;
      }
      case 'd': {
        double value = 0;
        if (!number(value)) return false;
        sink_.add(key, value);
        return true;
      }
      case 'b': {
        uint32_t value = 0;
        if (!number(value) || value > 1) return false;
        sink_.add(key, value == 1);
        return true;
      }
      default:
        return false;
    }
  }
  const uint8_t *begin_, *at_, *end_;
  Sink& sink_;
};

struct ObjectSink {
  ObjectSink() { entries.reserve(16); }
  template <typename T>
  void add(std::string_view key, T value) {
    entries.push_back({String(key), Value(value)});
  }
  std::vector<DictionaryEntry> entries;
};

struct ViewSink {
  struct Entry {
    std::string_view key, text;
    uint64_t bits;
    char type;
  };
  ViewSink() { entries.reserve(16); }
  void add(std::string_view key, std::string_view text) { entries.push_back({key, text, 0, 's'}); }
  void add(std::string_view key, int64_t v) { entries.push_back({key, {}, static_cast<uint64_t>(v), 'x'}); }
  void add(std::string_view key, uint64_t v) { entries.push_back({key, {}, v, 't'}); }
  void add(std::string_view key, bool v) { entries.push_back({key, {}, v, 'b'}); }
  void add(std::string_view key, double v) {
    uint64_t bits = 0;
    std::memcpy(&bits, &v, 8);
    entries.push_back({key, {}, bits, 'd'});
  }
  std::vector<Entry> entries;
};

void DecodeEventCall(bench::Rounds& rounds) {
  size_t next = 0;
  while (rounds.more()) {
    const std::string& bytes = calls()[next++ % calls().size()];
    Message message;
    const Frame frame = readMessage(std::as_bytes(std::span(bytes)), 1048576, message);
    BodyReader reader(message);
    Dictionary dictionary;
    const bool read = frame.status == FrameStatus::complete && reader.hasSignature("a{sv}") &&
                      reader.readDictionary(dictionary) && reader.finish() == BodyStatus::ok;
    if (!read || dictionary.size() < 3) rounds.fail("the call was not decoded");
    bench::keep(dictionary);
  }
}
KYT_MEASURE(DecodeEventCall);

template <typename Sink>
void FlatDecodeOfEventCall(bench::Rounds& rounds) {
  size_t next = 0;
  while (rounds.more()) {
    const std::string& bytes = calls()[next++ % calls().size()];
    Message message;
    const Frame frame = readMessage(std::as_bytes(std::span(bytes)), 1048576, message);
    Sink sink;
    const bool read = frame.status == FrameStatus::complete && message.signature == "a{sv}" &&
                      FlatDecoder<Sink>(message, sink).decode();
    if (!read || sink.entries.size() < 12) rounds.fail("the call was not decoded");
    bench::keep(sink);
  }
}
KYT_MEASURE(FlatDecodeOfEventCall<ObjectSink>);
KYT_MEASURE(FlatDecodeOfEventCall<ViewSink>);

// The server's whole turn on a stream in memory, for each call: everything but the system's reads.
class CountingSession final : public ClientSessionInterface {
 public:
  void setSessionInfo(Dictionary, std::optional<Dictionary>, Value, bool) override {}
  void startConfigWithCompletionHandler(StatesReply) override {}
  void fetchStatesWithUserInfo(std::optional<Dictionary>, StatesReply) override {}
  void fetchDisplayURL(StringReply) override {}
  void sendMessageWithDictionary(Dictionary message, ObjectReply) override { entries += message.size(); }
  void flushMessagesWithCompletion(ResultReply) override {}
  void finishSessionGracefully() override {}
  void uploadFileAtPath(String, String, std::optional<FileExtension>, SuccessReply) override {}
  void uploadLogData(Value, SuccessErrorReply) override {}
  void sendMessageWithSessionInfo(Dictionary, std::optional<Dictionary>, uint16_t, uint16_t,
                                  std::optional<Dictionary>, StringReply) override {}
  void updateSharedDataWithDictionary(Dictionary) override {}
  void updateSharedDataForKey(String, Value) override {}
  void setDigestKey(Data, int32_t) override {}
  size_t entries = 0;
};

class NoEntitlements final : public Entitlements {
 public:
  Value valueFor(const PeerCredentials&, std::string_view) override { return {}; }
};

class Delegate final : public ListenerDelegate {
 public:
  bool listenerShouldAcceptNewConnection(Listener&, const std::shared_ptr<Connection>& connection) override {
    connection->setExportedObject(session);
    connection->resume();
    return true;
  }
  std::shared_ptr<CountingSession> session = std::make_shared<CountingSession>();
};

void ServeEventCall(bench::Rounds& rounds) {
  const Limits limits;
  UserBudget budget(UserShares::of(limits, uint64_t{1} << 30, 65536));
  Counters counters;
  MemoryLogSink sink;
  Log log(sink);
  ManualClock clock;
  ManualTimers timers(clock);
  ManualExecutor executor;
  ManualReactor reactor;
  NoEntitlements entitlements;
  Delegate delegate;
  auto pipe = std::make_shared<MemoryPipe>();
  auto acceptor = std::make_unique<MemoryAcceptor>();
  acceptor->waiting.push_back(std::make_unique<MemoryStream>(pipe, 7));
  DBusServer server(
      {limits, counters, log, clock, timers, executor, reactor, entitlements, budget, std::string(32, 'f')},
      std::move(acceptor));
  server.setDelegate(delegate);
  server.resume();
  reactor.report(MemoryAcceptor::kDescriptor, ready::readable);
  executor.runAll();
  pipe->toServer = ClientHandshake::opening(0);
  reactor.report(7, ready::readable);
  executor.runAll();
  std::string batch;
  constexpr int kBatch = 128;
  for (int i = 0; i < kBatch; ++i) batch += calls()[static_cast<size_t>(i)];
  int left = 0;
  while (rounds.more()) {
    if (left-- == 0) {
      left = kBatch - 1;
      pipe->toServer = batch;
      reactor.report(7, ready::readable);
      executor.runAll();
    }
  }
  if (delegate.session->entries == 0) rounds.fail("nothing was served");
}
KYT_MEASURE(ServeEventCall);

void ReadHeaderOfEventCall(bench::Rounds& rounds) {
  size_t next = 0;
  while (rounds.more()) {
    const std::string& bytes = calls()[next++ % calls().size()];
    Message message;
    bench::keep(readMessage(std::as_bytes(std::span(bytes)), 1048576, message));
    bench::keep(message);
  }
}
KYT_MEASURE(ReadHeaderOfEventCall);

void EncodeEventCall(bench::Rounds& rounds) {
  const std::vector<Dictionary> payloads = bench::corpusPayloads(256);
  std::string bytes;
  size_t next = 0;
  while (rounds.more()) {
    bytes.clear();
    bench::appendEventCall(bytes, 1, 3, payloads[next++ % payloads.size()]);
    bench::keep(bytes);
  }
}
KYT_MEASURE(EncodeEventCall);

}  // namespace
