#include "platform/linux/url/RequestEnds.h"

#include <algorithm>
#include <cerrno>
#include <memory>

#include "platform/linux/url/URLRequests.h"

namespace kyt {
namespace {

// A connection may break at once each time; then the failure is the caller's.
constexpr uint8_t kMostRepeats = 3;
// How long an acknowledgement may take before a request on a connection without a way to its server goes back: the
// network may be gone for a moment only, and the server may have what it got just before.
constexpr Duration kLostPatience = std::chrono::seconds(2);
// The network may come back between an attempt and the question why it failed; then it is tried again at
// once, but not for ever: a router may claim what the route table denies.
constexpr uint8_t kImmediateRetries = 3;

// Of an attempt of which not a byte was sent.
bool mayComeOfBeingOffline(CURLcode code) {
  switch (code) {
    case CURLE_COULDNT_CONNECT:
    case CURLE_COULDNT_RESOLVE_HOST:
    case CURLE_OPERATION_TIMEDOUT:
    case CURLE_SSL_CONNECT_ERROR:
    case CURLE_SEND_ERROR:
    case CURLE_RECV_ERROR:
      return true;
    default:
      return false;
  }
}

bool saysNoRoute(long systemError) {
  return systemError == ENETUNREACH || systemError == EHOSTUNREACH || systemError == ENETDOWN;
}

bool mayWait(const URLTransfer& transfer) {
  return transfer.session->configuration.waitsForConnectivity && !transfer.request.neverWaits;
}

}  // namespace

void RequestEnds::deadlinePassed(URLTransfer& transfer) {
  const bool active = transfer.phase == URLTransfer::Phase::active;
  if (transfer.request.timeout && tools_.now >= transfer.started + *transfer.request.timeout) {
    if (active) pools_.retirePoolOf(transfer);
    requests_.fail(transfer, CURLE_OPERATION_TIMEDOUT, "The request timed out");
  } else if (active && tools_.now >= transfer.attempt.latestEnd) {
    pools_.retirePoolOf(transfer);
    requests_.fail(transfer, CURLE_OPERATION_TIMEDOUT, "The request took too long");
  } else if (active && tools_.now >= transfer.attempt.lastProgress + tools_.options.noProgressTimeout) {
    stuck(transfer);
  } else if (active && tools_.now >= transfer.attempt.lostLook) {
    lookAtLostConnection(transfer);
  } else {
    requests_.armDeadline(transfer);
  }
}

void RequestEnds::attemptEnded(URLTransfer& transfer, CURLcode code) {
  long status = 0, systemError = 0, version = 0;
  tools_.curl->easyGetInfo(transfer.handle, CURLINFO_RESPONSE_CODE, &status);
  tools_.curl->easyGetInfo(transfer.handle, CURLINFO_OS_ERRNO, &systemError);
  tools_.curl->easyGetInfo(transfer.handle, CURLINFO_HTTP_VERSION, &version);
  const std::shared_ptr<URLConnection> connection = transfer.attempt.connection;
  if (connection && version == CURL_HTTP_VERSION_1_1) connection->isSilent = true;
  if (transfer.attempt.foundEndedConnection) {
    if (!connection->transfers.empty()) pools_.retirePoolOf(transfer);  // others may still read from it
    requests_.withdraw(transfer);
    if (connection->transfers.empty()) connection->letGo();
    requests_.activateAgain(transfer);
    return;
  }
  if (code != CURLE_OK) {
    endedWithout(transfer, code, systemError);
  } else {
    requests_.succeed(transfer, static_cast<int>(status));
  }
  if (connection) endOthersThatMay(*connection);
}

// One that the server does not have may go again only when nothing of it can arrive any more, so when its connection is
// broken off. That waits for the answers to others.
void RequestEnds::endedWithout(URLTransfer& transfer, CURLcode code, long systemError) {
  const bool unheard = transfer.attempt.hasBegun && transfer.isUnheard();
  if (unheard && transfer.sharesItsConnection()) {
    transfer.attempt.endedWith = code;
    connectionLost(transfer);
    return;
  }
  const std::shared_ptr<URLConnection> connection = transfer.attempt.connection;
  requests_.withdraw(transfer);
  if (unheard) connection->abortWhatIsLeft();
  if (unheard ? goAgainOrWait(transfer)
              : !transfer.attempt.hasBegun && retryOrWait(transfer, code, systemError))
    return;
  failWith(transfer, code);
}

void RequestEnds::endOthersThatMay(const URLConnection& connection) {
  for (URLTransfer* other : connection.transfers) {
    if (!other->attempt.endedWith) continue;
    other->attempt.lostLook = tools_.now;
    requests_.armDeadline(*other);
  }
}

void RequestEnds::failWith(URLTransfer& transfer, CURLcode code) {
  if (code == CURLE_WRITE_ERROR && transfer.attempt.replyTooLong) code = CURLE_FILESIZE_EXCEEDED;
  if (transfer.attempt.onlyCellularRoutes) {
    requests_.fail(transfer, code,
                   "The request may not use cellular interfaces, and no other leads to the server");
  } else if (transfer.attempt.wasToBeRepeated) {
    requests_.fail(transfer, CURLE_GOT_NOTHING, "The connection ended without an answer");
  } else {
    requests_.fail(
        transfer, code,
        transfer.attempt.errorText[0] != 0 ? transfer.attempt.errorText : tools_.curl->easyErrorText(code));
  }
}

// The server may have other addresses than the connection's, so whether there is a way is seen by going.
bool RequestEnds::goAgainOrWait(URLTransfer& transfer) {
  if (transfer.immediateRetries < kMostRepeats) {
    ++transfer.immediateRetries;
    requests_.activateAgain(transfer);
    return true;
  }
  if (!mayWait(transfer) || requests_.canLeave(transfer)) return false;
  requests_.setAside(transfer);
  return true;
}

// The connection may be dead, so nothing more begins on it.
void RequestEnds::stuck(URLTransfer& transfer) {
  const bool unheard = transfer.attempt.hasBegun && transfer.isUnheard() && !transfer.sharesItsConnection();
  const std::shared_ptr<URLConnection> connection = transfer.attempt.connection;
  pools_.retirePoolOf(transfer);
  if (unheard) connection->abort();
  requests_.withdraw(transfer);
  if (unheard ? goAgainOrWait(transfer)
              : !transfer.attempt.hasBegun && retryOrWait(transfer, CURLE_OPERATION_TIMEDOUT, 0))
    return;
  requests_.fail(transfer, CURLE_OPERATION_TIMEDOUT, "The request made no progress");
}

void RequestEnds::connectionLost(URLTransfer& transfer) {
  transfer.attempt.lostLook = tools_.now + kLostPatience;
  requests_.armDeadline(transfer);
}

// Others on the same connection of which the server has something would lose their answers: those have until they are
// stuck, in case the way comes back.
void RequestEnds::lookAtLostConnection(URLTransfer& transfer) {
  if (transfer.attempt.endedWith) {
    endedWithout(transfer, *transfer.attempt.endedWith, 0);
    return;
  }
  const std::shared_ptr<URLConnection> connection = transfer.attempt.connection;
  const bool isLost = connection && connection->lostSince;
  const bool goesBack = isLost && std::all_of(connection->transfers.begin(), connection->transfers.end(),
                                              [](URLTransfer* other) { return other->isUnheard(); });
  if (!goesBack) {
    transfer.attempt.lostLook = isLost ? tools_.now + kLostPatience : MonotonicTime::max();
    requests_.armDeadline(transfer);
    return;
  }
  connection->abort();
  requests_.withdraw(transfer);
  if (!goAgainOrWait(transfer))
    requests_.fail(transfer, CURLE_RECV_ERROR, "No way leads from the connection to the server any more");
}

bool RequestEnds::retryOrWait(URLTransfer& transfer, CURLcode code, long systemError) {
  if (!mayWait(transfer)) return false;
  if (!mayComeOfBeingOffline(code)) return false;
  if (code == CURLE_COULDNT_RESOLVE_HOST) transfer.attempt.addresses.clear();
  if (!requests_.canLeave(transfer)) {
    requests_.setAside(transfer);
    return true;
  }
  bool wasOffline = saysNoRoute(systemError);
  if (code == CURLE_COULDNT_RESOLVE_HOST) wasOffline = transfer.immediateRetries == 0;
  // What had been tried from an address that is no more, or over another way, says nothing of now.
  if (transfer.attempt.routes != routes_.changes() && systemError != ECONNREFUSED) wasOffline = true;
  if (!wasOffline || transfer.immediateRetries >= kImmediateRetries) return false;
  ++transfer.immediateRetries;
  requests_.activateAgain(transfer);
  return true;
}

}  // namespace kyt
