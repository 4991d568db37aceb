// What one batched event costs without sockets and system calls, from the bytes of its call into the batch
// (Pipeline.h), and with the end of its record: the blocks of one batch are those of the last one, as in a
// daemon that runs for long. The reference is the decoding of the same calls alone. Both print the processor
// time of one event.

#include <span>

#include "bench/Corpus.h"
#include "bench/Measure.h"
#include "bench/Pipeline.h"
#include "platform/ipc/BodyReader.h"
#include "platform/ipc/MessageReader.h"

namespace kyt::bench {
namespace {

void fillBatches(Rounds& rounds, Pipeline& pipeline) {
  if (!pipeline.isLive()) return rounds.fail("no back end is live");
  size_t events = 0;
  while (rounds.more()) {
    pipeline.fillBatch();
    pipeline.discardBatch();
    events += Pipeline::kEvents;
  }
  pipeline.fillBatch();
  if (pipeline.batchedBytes() < Pipeline::kEvents * 100) rounds.fail("the events did not arrive");
  rounds.setItems(events);
}

void socketlessEventToBatch(Rounds& rounds) {
  Pipeline pipeline;
  fillBatches(rounds, pipeline);
}
KYT_MEASURE(socketlessEventToBatch);

// The same without the books: what is left is what they cost.
void eventThatNobodyBooks(Rounds& rounds) {
  Pipeline pipeline;
  pipeline.stopBooking();
  fillBatches(rounds, pipeline);
}
KYT_MEASURE(eventThatNobodyBooks);

// The same while somebody watches and reads nothing. The batch is given up, so every event is one to be told.
void eventBesideADeafWatcher(Rounds& rounds) {
  Pipeline pipeline;
  const std::unique_ptr<Watcher> deaf = pipeline.watch();
  fillBatches(rounds, pipeline);
}
KYT_MEASURE(eventBesideADeafWatcher);

void decodeAlone(Rounds& rounds) {
  std::vector<std::string> calls;
  for (const Dictionary& payload : corpusPayloads(Pipeline::kEvents))
    appendEventCall(calls.emplace_back(), 1000, 7, payload);
  size_t events = 0;
  while (rounds.more()) {
    for (const std::string& call : calls) {
      Message message;
      const Frame frame = readMessage(std::as_bytes(std::span(call)), 1048576, message);
      BodyReader reader(message);
      Dictionary dictionary;
      if (frame.status != FrameStatus::complete || !reader.readDictionary(dictionary))
        rounds.fail("the call was not decoded");
      keep(dictionary);
    }
    events += calls.size();
  }
  rounds.setItems(events);
}
KYT_MEASURE(decodeAlone);

}  // namespace
}  // namespace kyt::bench
