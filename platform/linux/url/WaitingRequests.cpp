#include "platform/linux/url/WaitingRequests.h"

#include <algorithm>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/base/Books.h"
#include "platform/linux/url/URLSessionState.h"

namespace kyt {
namespace {

// What a waiting request counts at least: the request itself costs memory too, however small its body.
constexpr size_t kLeastCharge = 1024;

}  // namespace

void WaitingRequests::add(URLTransfer& transfer) {
  transfer.phase = URLTransfer::Phase::waiting;
  // Headers may be large too: they carry names that clients choose.
  transfer.waitingCharge = std::max(transfer.request.body.size() + transfer.headerSize(), kLeastCharge);
  WaitingLine& line = transfer.session->waiting[&transfer.user];
  line.transfers.append(transfer);
  line.bytes += transfer.waitingCharge;
  ++count_;
  if (transfer.request.events) transfer.request.events->beginWaiting();
  tools_.figures.add(&URLFigures::waiting);
  tools_.figures.add(&URLFigures::waitingBytes, transfer.request.body.size());
  const std::shared_ptr<URLSessionState> kept = transfer.session;  // displacing may end its last request
  // The line ends with its last request, which one that is larger than the limit is too.
  const size_t most = transfer.user.mostWaiting();
  while (line.bytes > most) {
    URLTransfer& oldest = *line.transfers.first();
    const bool last = &oldest == &transfer;
    callbacks_.displaced(oldest);
    if (last) break;
  }
}

void WaitingRequests::remove(URLTransfer& transfer) {
  const auto line = transfer.session->waiting.find(&transfer.user);
  line->second.transfers.remove(transfer);
  line->second.bytes -= std::exchange(transfer.waitingCharge, 0);
  if (line->second.transfers.empty()) transfer.session->waiting.erase(line);
  --count_;
  if (transfer.request.events) transfer.request.events->endWaiting();
  tools_.figures.subtract(&URLFigures::waiting);
  tools_.figures.subtract(&URLFigures::waitingBytes, transfer.request.body.size());
}

class WaitingRequests::Answers {
 public:
  explicit Answers(Function<bool(const URLTransfer&)>& canLeave) : ask_(canLeave) {}
  bool canLeave(const URLTransfer& transfer) {
    if (transfer.attempt.addresses.empty()) {
      if (!std::exchange(namesAsked_, true)) namesCanBeKnown_ = ask_(transfer);
      return namesCanBeKnown_;
    }
    const auto bytes = [](const URLTransfer& one) {
      return std::string_view(reinterpret_cast<const char*>(one.attempt.addresses.data()),
                              one.attempt.addresses.size() * sizeof one.attempt.addresses[0]);
    };
    const bool cellular = transfer.request.allowsCellularAccess;
    for (const Known& known : known_)
      if (known.cellular == cellular && known.addresses == bytes(transfer)) return known.canLeave;
    const bool answer = ask_(transfer);
    if (known_.size() < kMostKnown) known_.push_back({std::string(bytes(transfer)), cellular, answer});
    return answer;
  }

 private:
  static constexpr size_t kMostKnown = 16;
  struct Known {
    std::string addresses;
    bool cellular, canLeave;
  };
  Function<bool(const URLTransfer&)>& ask_;
  bool namesAsked_ = false, namesCanBeKnown_ = false;
  std::vector<Known> known_;
};

void WaitingRequests::retry(const LinkedList<URLSessionState>& sessions, bool evenIfNamesSeemUnknowable) {
  Answers answers(callbacks_.canLeave);
  for (URLSessionState* session = sessions.first(); session != nullptr;) {
    URLSessionState* nextSession = session->links.next;
    const std::shared_ptr<URLSessionState> kept =
        session->transfers.empty() ? nullptr : session->transfers.first()->session;
    for (URLTransfer* transfer = session->transfers.first(); transfer != nullptr;) {
      URLTransfer* next = transfer->links.next;
      const bool unknown = evenIfNamesSeemUnknowable && transfer->attempt.addresses.empty();
      if (transfer->phase == URLTransfer::Phase::waiting && (unknown || answers.canLeave(*transfer)))
        callbacks_.goAgain(*transfer);
      transfer = next;
    }
    session = nextSession;
  }
}

}  // namespace kyt
