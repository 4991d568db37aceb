#include "backends/dashboard/DashboardBackend.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <new>
#include <string>
#include <vector>

#include "config/ClientTypes.h"
#include "platform/Platform.h"
#include "platform/base/Counters.h"
#include "platform/base/InternetAddress.h"
#include "platform/queues/Log.h"

namespace kyt {

namespace {

constexpr Duration kDefaultPeriod = std::chrono::milliseconds(500);
constexpr int32_t kShortestPeriod = 10;  // milliseconds; a shorter one would only keep the daemon awake
constexpr Duration kLeeway = std::chrono::milliseconds(100);
constexpr size_t kMaxAddressText = 16;
constexpr int kMostThatCameEarlier = 1024;  // more than a socket holds

std::optional<String> entryOf(const std::optional<Dictionary>& profile, const char* key) {
  const String* text = profile ? profile->string(key) : nullptr;
  return text != nullptr ? std::optional(*text) : std::nullopt;
}

bool has(const Dictionary& profile, const char* key) {
  const Value* value = profile.find(key);
  return value != nullptr && !value->isNull();
}

uint16_t portOf(const Dictionary& profile) {
  return static_cast<uint16_t>(profile.integer("port"));
}

// A text that is no address becomes one that no connect() accepts.
uint32_t addressOf(const String& text) {
  return ipv4Address(text.view().substr(0, kMaxAddressText));
}

}  // namespace

std::shared_ptr<DashboardBackend> DashboardBackend::initWithName(Platform& platform, const String& name,
                                                                 const std::optional<Dictionary>& profile,
                                                                 const SharedSessionFacts& facts) {
  std::optional<String> serverIP;
  uint16_t serverPort = 0;
  if (profile) {
    if (const String* ip = profile->string("ip")) serverIP = *ip;
    serverPort = portOf(*profile);
  }
  return initWithName(platform, name, profile, serverIP, serverPort, facts);
}

std::shared_ptr<DashboardBackend> DashboardBackend::initWithName(Platform& platform, const String& name,
                                                                 const std::optional<String>& serverIP,
                                                                 uint16_t serverPort,
                                                                 const SharedSessionFacts& facts) {
  if (!serverIP) return nullptr;
  return initWithName(platform, name, std::nullopt, serverIP, serverPort, facts);
}

std::shared_ptr<DashboardBackend> DashboardBackend::initWithName(Platform& platform, const String& name,
                                                                 const std::optional<Dictionary>& profile,
                                                                 const std::optional<String>& serverIP,
                                                                 uint16_t serverPort,
                                                                 const SharedSessionFacts& facts) {
  if (profile && profile->string("ip") == nullptr) {
    platform.log.error("DashboardBackend(initWithName): can't resolve server IP");
    return nullptr;
  }
  if (profile && !has(*profile, "port")) {
    platform.log.error("DashboardBackend(initWithName): can't resolve server port");
    return nullptr;
  }
  auto opened = platform.udpSockets.open();
  if (const int* number = std::get_if<int>(&opened)) {
    platform.log.error("DashboardBackend(initWithName): socket() failed (%d)", *number);
    return nullptr;
  }
  auto backend = std::make_shared<DashboardBackend>(Making(), platform, name, profile, facts,
                                                    std::get<std::unique_ptr<UDPSocket>>(std::move(opened)));
  // On the network queue: a datagram that comes from anywhere before all is in place waits there until it is.
  const bool started = backend->networkProcQueue_->sync([&] {
    backend->networkProcQueue_->assertCurrent();
    return backend->start(profile, serverIP, serverPort);
  });
  // What was made so far ends with the object: the sources, the queue, the socket.
  if (!started) return nullptr;
  return backend;
}

DashboardBackend::DashboardBackend(Making making, Platform& platform, String name,
                                   const std::optional<Dictionary>& profile, SharedSessionFacts facts,
                                   std::unique_ptr<UDPSocket> socket)
    : KYTReportingBackend(making, platform, std::move(name), profile.value_or(Dictionary()),
                          std::move(facts)),
      networkProcQueue_(SerialQueue::create("com.vantu.KYTReporting.networkProc", platform.executor)),
      postURL_(entryOf(profile, "post_url")),
      period_(kDefaultPeriod),
      socket_(std::move(socket)) {
  if (std::optional<String> url = entryOf(profile, "display_url")) setDisplayURL(std::move(url));
}

DashboardBackend::~DashboardBackend() {
  // What was handed over runs with a reference, so nobody else is here any more.
  platform().counters.add(Reason::datagramGivenUp, messageQueue_.size());
}

bool DashboardBackend::start(const std::optional<Dictionary>& profile, const std::optional<String>& serverIP,
                             uint16_t serverPort) {
  socket_->suppressBrokenPipeSignal();
  uint32_t address = kNoIPv4Address;
  uint16_t port = serverPort;
  if (profile) {
    address = addressOf(*profile->string("ip"));
    port = portOf(*profile);
    readProfile(*profile);
  } else if (serverIP) {
    address = addressOf(*serverIP);
    useReliableUDP();
  } else {
    platform().log.error("DashboardBackend(initWithName): initWitName with all null params.");
    return false;
  }
  if (socket_->connect(address, port) != 0) {
    platform().log.error("DashboardBackend(initWithName): socket connect() failed.");
    return false;
  }
  forgetWhatCameEarlier();
  if (startTimer()) return true;
  platform().log.error("DashboardBackend(initWithName): can't create timer source.");
  return false;
}

// What came to the port before it was connected may be anybody's, and name events that are yet to be sent.
void DashboardBackend::forgetWhatCameEarlier() {
  if (!reliableUDP_) return;
  std::array<std::byte, DashboardDatagram::kSize> buffer;
  for (int i = 0; i < kMostThatCameEarlier && socket_->receive(buffer) >= 0; ++i) {
  }
}

void DashboardBackend::readProfile(const Dictionary& profile) {
  usingProfile_ = true;
  if (!has(profile, "reliable")) return;
  useReliableUDP();
  period_ = std::chrono::milliseconds(std::max(profile.find("reliable")->intValue(), kShortestPeriod));
}

bool DashboardBackend::startTimer() {
  std::weak_ptr<KYTReportingBackend> weak = weak_from_this();
  // More leeway than half a short period would lose ticks.
  timer_ = platform().timers.every(
      period_, std::min(kLeeway, period_ / 2), networkProcQueue_, [weak = std::move(weak)] {
        const auto self = std::static_pointer_cast<DashboardBackend>(weak.lock());
        if (self == nullptr) return;
        self->networkProcQueue_->assertCurrent();
        self->myPeriodicTask();
      });
  return static_cast<bool>(timer_);
}

String DashboardBackend::descriptionForObject(const Value& object) {
  if (const String* text = object.string()) return *text;
  return object.isNumber() ? String(description(object)) : String("null");
}

String DashboardBackend::sanitize(const String& text) {
  std::string out;
  out.reserve(text.size());
  for (const char c : text.view()) {
    if (c == '\n') continue;
    if (c == '\\' || c == '=') out += '\\';
    out += c;
  }
  return out.empty() ? String("empty") : String(out);
}

DashboardDatagram::Header DashboardBackend::headerFor(const TimeValue& timestamp, uint16_t method,
                                                      uint16_t respCode, EventID eventID) const {
  DashboardDatagram::Header header;
  header.selfVersionMajor = facts().selfVersion[0];
  header.clientType = static_cast<uint8_t>(facts().compType);
  header.time = timestamp;
  header.sessionID = facts().sessionID;
  header.clientVersion = facts().clientVersion;
  header.method = method;
  header.respCode = respCode;
  header.eventID = static_cast<uint16_t>(eventID);
  header.flags = static_cast<uint16_t>((reliableUDP_ ? DashboardDatagram::kFlagReliable : 0) |
                                       (usingProfile_ ? 0 : DashboardDatagram::kFlagWithoutProfile));
  if (facts().udid) header.udid = facts().udid->c_str();
  return header;
}

// Shortest values first, so that a long one costs no others when the text is cut.
void DashboardBackend::appendPairs(const Dictionary& message, DashboardDatagram& datagram) {
  struct Pair {
    const String* key;
    String text;
    size_t length;
  };
  std::vector<Pair> pairs;
  pairs.reserve(message.size());
  for (const DictionaryEntry& entry : message) {
    String text = descriptionForObject(entry.value);
    const size_t length = text.utf16Length();
    pairs.push_back({&entry.key, std::move(text), length});
  }
  std::stable_sort(pairs.begin(), pairs.end(),
                   [](const Pair& a, const Pair& b) { return a.length < b.length; });
  for (const Pair& pair : pairs) datagram.appendPair(pair.key->c_str(), sanitize(pair.text).c_str());
}

Value DashboardBackend::sendMessage(const Dictionary& message, const TimeValue& timestamp, uint16_t method,
                                    uint16_t respCode, EventID eventID) {
  std::unique_ptr<DashboardDatagram> datagram(new (std::nothrow) DashboardDatagram);
  if (datagram == nullptr) {
    platform().log.error("DashboardBackend(sendMessage): can't malloc.");
    platform().counters.add(Reason::datagramGivenUp);
    return {};
  }
  datagram->fill(headerFor(timestamp, method, respCode, eventID));
  appendPairs(message, *datagram);
  datagram->finish();

  Value line = writeLocalLog(*datagram);
  networkProcQueue_->async([self = std::static_pointer_cast<DashboardBackend>(shared_from_this()),
                            datagram = std::move(datagram), eventID] {
    self->networkProcQueue_->assertCurrent();
    self->tryToSendMsg(*datagram, eventID);
  });
  return line;
}

String DashboardBackend::writeLocalLog(const DashboardDatagram& datagram) {
  const DashboardDatagram::Header header = datagram.header();
  const std::string udid(header.udid);
  char line[1152];
  std::snprintf(line, sizeof line, "%u.%03d %s 127.0.0.1 %s %5u %5u %5u %5u %5u %s",
                static_cast<uint32_t>(header.time.seconds), header.time.microseconds / 1000, udid.c_str(),
                clientTypeShortCode(header.clientType), header.clientVersion, header.sessionID,
                header.eventID, header.method, header.respCode, datagram.text());
  return line;
}

}  // namespace kyt
