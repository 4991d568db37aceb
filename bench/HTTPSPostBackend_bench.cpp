// The HTTPS back end's share of the road of one event: from the envelope into the batch, and from a batch of
// 50 to the request. The reference of the second is the same work without the back end: the writer and zlib
// alone, over the same records. Fakes stand in for the clock, the user defaults and the poster.
#include <zlib.h>

#include "backends/https/HTTPSPostBackend.h"
#include "bench/Corpus.h"
#include "bench/Measure.h"
#include "platform/objects/Keys.h"
#include "platform/queues/SerialQueue.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

constexpr int kBatch = 50;

class CountingPoster final : public ReportingSessionConnectivityInterface {
 public:
  void postURLRequestWithCompletionHandler(URLRequest request, URLCompletion) override {
    bytes += request.body.size();
    ++requests;
  }
  size_t bytes = 0, requests = 0;
};

// A session that requires user information, without consent, ten filters, as the daemon's own benchmark has
// it.
struct Stage {
  Stage() {
    platform.log.setLevel(LogLevel::error);
    platform.deviceProperties.setCountryCode("US");
    Array filters;
    for (int i = 0; i < 10; ++i)
      filters.append(Value(Dictionary{{"key", "filteredKey" + std::to_string(i)}, {"action", "remove"}}));
    const Dictionary entry{{"override_dnu", 1},          {"locale_whitelist", Array{"US"}},
                           {"filters", filters},         {"sampling_threshold", 1.0},
                           {"event_threshold", 1 << 30}, {"post_url", "https://post.example.org/"}};
    SessionFacts facts;
    facts.compType = 6;
    facts.requireUserInfo = true;
    facts.batchEvents = true;
    facts.productVersion = String("17.4.1");
    facts.buildVersion = String("21E236");
    facts.hardwareType = String("Model14,2");
    facts.productFamily = String("Phone");
    backend = HTTPSPostBackend::initWithName(platform.configuration, String(kKYTReportingBackendHTTPPost),
                                             Dictionary{{"clients", Array{entry}}},
                                             std::make_shared<SessionFacts>(facts));
    backend->setUserInfoDict(Dictionary{{kKYTReportingUserInfoClientName, "a"}});
    backend->setReportingSessionConnectivityDelegate(poster);
    backend->updateState();
    for (Dictionary& payload : bench::corpusPayloads(512))
      envelopes.push_back({{kKYTReportingMessageBlobClientData, std::move(payload)}});
  }
  void send(size_t i) {
    backend->sendMessage(envelopes[i % envelopes.size()], TimeValue{1769860800, 250000}, 5, 2,
                         MessageFlag{0});
  }

  TestPlatform platform;
  std::shared_ptr<CountingPoster> poster = std::make_shared<CountingPoster>();
  std::shared_ptr<HTTPSPostBackend> backend;
  std::vector<Dictionary> envelopes;
};

void envelopeToBatch(bench::Rounds& rounds) {
  Stage stage;
  size_t i = 0;
  while (rounds.more()) {
    Turn turn;
    for (int n = 0; n < kBatch; ++n) stage.send(i++);
    rounds.pause();
    stage.backend->setState(kBackendStateHeld);
    stage.backend->flushMessagesWithCompletion(nullptr);  // gives the batch up
    stage.backend->setState(kBackendStateEnabled);
    rounds.goOn();
  }
  rounds.setItems(rounds.count() * kBatch);
}
KYT_MEASURE(envelopeToBatch);

void batchToRequest(bench::Rounds& rounds) {
  Stage stage;
  size_t i = 0;
  while (rounds.more()) {
    rounds.pause();
    for (int n = 0; n < kBatch; ++n) stage.send(i++);
    stage.platform.executor.runAll();
    rounds.goOn();
    stage.backend->flushMessagesWithCompletion(nullptr);
  }
  rounds.setItems(rounds.count() * kBatch);
  rounds.addFigure("bytesPerRequest",
                   static_cast<double>(stage.poster->bytes) / static_cast<double>(stage.poster->requests));
}
KYT_MEASURE(batchToRequest);

void referenceWriterAndDeflate(bench::Rounds& rounds) {
  Stage stage;
  // As many batches as the back end posts different ones, so that no branch predictor learns one by heart.
  std::vector<Value> messages;
  for (size_t i = 0; i + kBatch <= stage.envelopes.size(); i += kBatch) {
    Array records;
    for (size_t n = i; n < i + kBatch; ++n) {
      Dictionary record = stage.backend->newEventDictfromPayload(
          *stage.envelopes[n].find(kKYTReportingMessageBlobClientData)->dictionary(), {1769860800, 250000}, 5,
          2, EventID{});
      stage.backend->prepareEventForMessage(record, nullptr);
      record.set("_eventNumber", n);
      records.append(Value(std::move(record)));
    }
    messages.emplace_back(std::move(records));
  }
  size_t next = 0;
  std::string json;
  std::string out(1 << 20, '\0');
  size_t bytes = 0;
  while (rounds.more()) {
    json.clear();
    stage.platform.json.writeCompact(messages[next++ % messages.size()], json);
    z_stream stream{};
    if (deflateInit2(&stream, -1, 8, 31, 8, 0) != Z_OK) return rounds.fail("deflateInit2");
    stream.next_in = reinterpret_cast<Bytef*>(json.data());
    stream.avail_in = static_cast<uInt>(json.size());
    stream.next_out = reinterpret_cast<Bytef*>(out.data());
    stream.avail_out = static_cast<uInt>(out.size());
    bench::keep(deflate(&stream, Z_FINISH));
    bytes = stream.total_out;
    deflateEnd(&stream);
  }
  rounds.setItems(rounds.count() * kBatch);
  rounds.addFigure("bytesPerRequest", static_cast<double>(bytes));
  rounds.addFigure("jsonBytes", static_cast<double>(json.size()));
}
KYT_MEASURE(referenceWriterAndDeflate);

}  // namespace
}  // namespace kyt
