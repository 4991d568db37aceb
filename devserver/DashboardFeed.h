// The dashboard's end of the UDP feed: reads every datagram, keeps what it says, and acknowledges it if it
// asks for that, unless a rule says otherwise. One thread, "kyt-feed".
#pragma once

#include <netinet/in.h>

#include <atomic>
#include <chrono>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <thread>

#include "devserver/AcknowledgementRules.h"
#include "devserver/Store.h"

namespace kyt::devserver {

class DashboardFeed {
 public:
  // Null, with a text for people, on failure.
  [[nodiscard]] static std::unique_ptr<DashboardFeed> start(const std::string& address, uint16_t port,
                                                            Store& store, AcknowledgementRules& rules,
                                                            std::string& error);
  ~DashboardFeed();  // ends the thread; acknowledgements that are delayed are not sent
  DashboardFeed(const DashboardFeed&) = delete;
  DashboardFeed& operator=(const DashboardFeed&) = delete;

  [[nodiscard]] uint16_t port() const { return port_; }

 private:
  using Time = std::chrono::steady_clock::time_point;
  struct Delayed {
    sockaddr_in to;
    std::string bytes;
  };
  DashboardFeed(int socket, int wake, uint16_t port, Store& store, AcknowledgementRules& rules);
  void run();
  void receiveAll();
  void take(std::string_view bytes, const sockaddr_in& sender);
  // What was done, for people.
  std::string acknowledge(std::string_view bytes, uint16_t event, const sockaddr_in& sender);
  void send(const std::string& bytes, const sockaddr_in& to) const;
  [[nodiscard]] int sendDue();  // milliseconds until the next is due, or -1

  const int socket_, wake_;
  const uint16_t port_;
  Store& store_;
  AcknowledgementRules& rules_;
  std::atomic<bool> stopping_{false};
  std::multimap<Time, Delayed> delayed_;  // the thread's alone
  std::thread thread_;
};

}  // namespace kyt::devserver
