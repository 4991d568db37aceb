// The back end that sends each event as one UDP datagram to a dashboard server, and renders it as a line for
// the local message log. Delivery is plain (a datagram that could not be sent is sent again until it goes
// out) or reliable (also one that the server does not acknowledge, up to four times). It takes clients' log
// data too, which it posts over HTTP. Made by the factory, owned by one session.
//
// The class is told in three files: DashboardBackend.cpp (its making, and the sending of an event),
// …Delivery.cpp (what happens on the network queue), …LogData.cpp (the upload of log data).
//
// Routed events never reach it, deliberately: this class has the send without a flag and leaves the send with
// one, by which a session delivers, to the base, which does nothing. Overriding that one too would send to
// dashboards what they were never sent, and put lines into message logs that were never there.
//
// Threads: called on its session's queue. The socket, the queue of packets and the clean-up state belong to
// the network queue, where the timer and the reading of acknowledgements run; so there is no lock. While it
// cleans up, with packets that are not known to be delivered, the object keeps itself alive; otherwise the
// work of its timer and its socket holds it weakly.
#pragma once

#include <cstdint>
#include <deque>
#include <memory>
#include <optional>

#include "backend/KYTReportingBackend.h"
#include "backends/dashboard/DashboardDatagram.h"
#include "backends/dashboard/UDPPacketToSend.h"
#include "platform/Reactor.h"
#include "platform/UDPSocket.h"
#include "platform/queues/SerialQueue.h"
#include "platform/queues/Timer.h"

namespace kyt {

class DashboardBackend : public KYTReportingBackend {
 public:
  static constexpr size_t kMaxPackets = 50;  // one more, and the oldest is dropped

  // Null when the profile lacks "ip" or "port", or the socket cannot be used; no descriptor and no queue is
  // left then. Without a profile (null, not empty) delivery is always reliable.
  static std::shared_ptr<DashboardBackend> initWithName(Platform& platform, const String& name,
                                                        const std::optional<Dictionary>& profile,
                                                        const SharedSessionFacts& facts);
  static std::shared_ptr<DashboardBackend> initWithName(Platform& platform, const String& name,
                                                        const std::optional<String>& serverIP,
                                                        uint16_t serverPort, const SharedSessionFacts& facts);
  static std::shared_ptr<DashboardBackend> initWithName(Platform& platform, const String& name,
                                                        const std::optional<Dictionary>& profile,
                                                        const std::optional<String>& serverIP,
                                                        uint16_t serverPort, const SharedSessionFacts& facts);
  DashboardBackend(Making, Platform& platform, String name, const std::optional<Dictionary>& profile,
                   SharedSessionFacts facts, std::unique_ptr<UDPSocket> socket);
  ~DashboardBackend() override;

  using KYTReportingBackend::sendMessage;
  // Deliberately this one alone; see above. The line for the local log, or null.
  Value sendMessage(const Dictionary& message, const TimeValue& timestamp, uint16_t method, uint16_t respCode,
                    EventID eventID) override;
  void cleanup() override;
  // Blocks until the server has answered. Not on the queue on which the poster calls completions.
  [[nodiscard]] bool uploadLogData(const Value& logData) override;

  // A string's own text, a number's decimal text, "null" for anything else.
  [[nodiscard]] static String descriptionForObject(const Value& object);
  // Without line feeds, backslashes doubled, a backslash before each equals sign; "empty" when nothing is
  // left.
  [[nodiscard]] static String sanitize(const String& text);
  // `datagram` is a whole one, its text terminated.
  [[nodiscard]] static String writeLocalLog(const DashboardDatagram& datagram);

  [[nodiscard]] SerialQueue& networkProcQueue() const RETURN_CAPABILITY(*networkProcQueue_) {
    return *networkProcQueue_;
  }
  void tryToSendMsg(const DashboardDatagram& datagram, EventID eventNumber) REQUIRES(networkProcQueue());
  void processSocketRead() REQUIRES(networkProcQueue());
  void myPeriodicTask() REQUIRES(networkProcQueue());
  void cleanupSources() REQUIRES(networkProcQueue());

  // For tests, while nothing runs on the network queue; so they are not analysed. -1 once closed.
  [[nodiscard]] int32_t socketDescriptor() const NO_THREAD_SAFETY_ANALYSIS {
    return socket_ ? socket_->descriptor() : -1;
  }
  [[nodiscard]] const std::deque<std::unique_ptr<UDPPacketToSend>>& messageQueue() const
      NO_THREAD_SAFETY_ANALYSIS {
    return messageQueue_;
  }
  [[nodiscard]] int32_t cleanupState() const NO_THREAD_SAFETY_ANALYSIS { return cleanupState_; }

  [[nodiscard]] bool reliableUDP() const { return reliableUDP_; }
  [[nodiscard]] bool usingProfile() const { return usingProfile_; }
  [[nodiscard]] const std::optional<String>& postURL() const { return postURL_; }

 private:
  // The making after the socket is open, on the network queue; false after a failure, which is logged.
  [[nodiscard]] bool start(const std::optional<Dictionary>& profile, const std::optional<String>& serverIP,
                           uint16_t serverPort) REQUIRES(networkProcQueue());
  void forgetWhatCameEarlier() REQUIRES(networkProcQueue());
  void readProfile(const Dictionary& profile) REQUIRES(networkProcQueue());
  void useReliableUDP() REQUIRES(networkProcQueue());
  [[nodiscard]] DashboardDatagram::Header headerFor(const TimeValue& timestamp, uint16_t method,
                                                    uint16_t respCode, EventID eventID) const;
  static void appendPairs(const Dictionary& message, DashboardDatagram& datagram);
  [[nodiscard]] bool startTimer() REQUIRES(networkProcQueue());
  // A datagram went out in full.
  [[nodiscard]] bool send(std::span<const std::byte> datagram) REQUIRES(networkProcQueue());
  // Each returns whether the record is done with.
  [[nodiscard]] bool checkWaiting(UDPPacketToSend& packet) REQUIRES(networkProcQueue());
  [[nodiscard]] bool checkUnsent(UDPPacketToSend& packet) REQUIRES(networkProcQueue());
  void scheduleLastResort() REQUIRES(networkProcQueue());
  [[nodiscard]] bool finishUpload(const std::optional<Data>& reply, const std::optional<Error>& error);

  // Constant after the making.
  const std::shared_ptr<SerialQueue> networkProcQueue_;
  const std::optional<String> postURL_;
  bool reliableUDP_ = false;
  bool usingProfile_ = false;
  Duration period_;
  // The sources end before the socket.
  std::unique_ptr<UDPSocket> socket_ GUARDED_BY(*networkProcQueue_);
  std::deque<std::unique_ptr<UDPPacketToSend>> messageQueue_ GUARDED_BY(*networkProcQueue_);
  int32_t cleanupState_ GUARDED_BY(*networkProcQueue_) = 0;
  Watch readSource_ GUARDED_BY(*networkProcQueue_);
  TimerHandle timer_ GUARDED_BY(*networkProcQueue_), lastResort_ GUARDED_BY(*networkProcQueue_);
  // From a clean-up with packets to its end.
  std::shared_ptr<DashboardBackend> keptAlive_ GUARDED_BY(*networkProcQueue_);
};

}  // namespace kyt
