// The road of one event in one process, without sockets: the bytes of calls go through a real connection, the
// session and the HTTPS back end with the benchmarks' storebag, and end in its batch. Used by the benchmarks
// of a batched event, of its allocations, and of the fields of wide ones. Everything runs on the calling thread; fakes stand in for the
// clock, the user defaults and the network.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "backends/BackendTable.h"
#include "platform/fake/MemoryStream.h"
#include "platform/ipc/DBusServer.h"
#include "tests/session/SessionFixture.h"

namespace kyt::bench {

class Pipeline final : private ListenerDelegate {
 public:
  static constexpr size_t kEvents = 48;  // of one batch, which none of them flushes

  Pipeline();
  // A batch is made of events of these payloads.
  explicit Pipeline(const std::vector<Dictionary>& payloads);
  ~Pipeline() override;
  Pipeline(const Pipeline&) = delete;
  Pipeline& operator=(const Pipeline&) = delete;

  [[nodiscard]] bool isLive() const { return live_; }
  // One batch's events reach the daemon with one read.
  void fillBatch();
  // Posts the batch as it is, since there is no compressor. The bytes of the message's text.
  [[nodiscard]] size_t postBatch();
  // Gives the batch up.
  void discardBatch();
  // From now on events are counted and not booked.
  void stopBooking();
  // Somebody who watches all events, and reads none but by himself.
  [[nodiscard]] std::unique_ptr<Watcher> watch() { return test_.books.watchers()->watch({}); }
  // What the events in the batch take by the health report's estimate.
  [[nodiscard]] uint64_t batchedBytes() const { return session_->batchedEventsSize(); }

 private:
  class AnyEntitlement final : public Entitlements {
   public:
    Value valueFor(const PeerCredentials&, std::string_view) override { return {true}; }
  };
  bool listenerShouldAcceptNewConnection(Listener&, const std::shared_ptr<Connection>& connection) override;
  void receive();

  TestPlatform test_;
  DefaultBackendFactory factory_{test_.configuration, backendTable(test_.configuration)};
  RecordingMessageLog messageLog_;
  ReportingdSessionClass class_{test_.configuration, factory_, messageLog_};
  FakeSessionDelegate delegate_;
  AnyEntitlement entitlements_;
  std::shared_ptr<MemoryPipe> pipe_ = std::make_shared<MemoryPipe>();
  std::unique_ptr<DBusServer> server_;
  std::shared_ptr<ReportingdSession> session_;
  std::string calls_;
  bool live_ = false;
};

}  // namespace kyt::bench
