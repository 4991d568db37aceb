// A server over TCP alone that says one thing at one moment, whatever it is told, and keeps what it reads.
#pragma once

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <mutex>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

namespace kyt {

class RudeServer {
 public:
  enum class When { atOnce, afterSome, afterAll };
  enum class Then { close, reset, stay, begAgain };  // the last: goes on, and says it to each request
  struct Manner {
    When when = When::afterAll;
    Then then = Then::close;
    std::string says;
    bool firstIsGood = false;  // the first request of each connection is answered well
  };

  explicit RudeServer(Manner manner) : manner_(std::move(manner)) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t size = sizeof address;
    listener_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    EXPECT_EQ(bind(listener_, reinterpret_cast<sockaddr*>(&address), size), 0);
    EXPECT_EQ(listen(listener_, 64), 0);
    getsockname(listener_, reinterpret_cast<sockaddr*>(&address), &size);
    port_ = ntohs(address.sin_port);
    thread_ = std::thread([this] { run(); });
  }
  ~RudeServer() {
    stopping_ = true;
    shutdown(listener_, SHUT_RDWR);
    thread_.join();
    close(listener_);
  }
  RudeServer(const RudeServer&) = delete;
  RudeServer& operator=(const RudeServer&) = delete;
  [[nodiscard]] std::string url(const std::string& scheme = "http") const {
    return scheme + "://127.0.0.1:" + std::to_string(port_) + "/";
  }
  // Once nothing is sent any more.
  [[nodiscard]] size_t times(const std::string& text) {
    std::lock_guard lock(mutex_);
    size_t count = 0;
    for (const std::string& one : read_)
      for (size_t at = one.find(text); at != one.npos; at = one.find(text, at + 1)) ++count;
    return count;
  }

 private:
  struct Served {
    int socket;
    size_t number;          // of its text in read_
    int answered = 0;       // requests
    size_t from = 0;        // where the next request begins
    bool isSilent = false;  // it has said it all
  };

  void run() {
    std::vector<Served> all;
    while (!stopping_) {
      std::vector<pollfd> polled{{listener_, POLLIN, 0}};
      for (const Served& one : all) polled.push_back({one.socket, POLLIN, 0});
      poll(polled.data(), polled.size(), 100);
      for (size_t i = all.size(); i > 0; --i) {
        if (polled[i].revents == 0) continue;
        if (!hear(all[i - 1])) {
          close(all[i - 1].socket);
          all.erase(all.begin() + static_cast<long>(i - 1));
        }
      }
      if ((polled[0].revents & POLLIN) == 0) continue;
      Served one{accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK), 0};
      if (one.socket < 0) continue;
      {
        std::lock_guard lock(mutex_);
        one.number = read_.size();
        read_.emplace_back();
      }
      if (manner_.when == When::atOnce && !speak(one)) {
        close(one.socket);
      } else {
        all.push_back(one);
      }
    }
    for (const Served& one : all) close(one.socket);
  }

  // Whether the connection goes on.
  bool hear(Served& one) {
    char bytes[65536];
    const ssize_t count = recv(one.socket, bytes, sizeof bytes, 0);
    if (count <= 0) return count < 0 && errno == EAGAIN;
    std::string text;
    {
      std::lock_guard lock(mutex_);
      text = read_[one.number].append(bytes, static_cast<size_t>(count));
    }
    if (one.isSilent) return true;
    const size_t head = text.find("\r\n\r\n", one.from);
    const bool isWhole = head != text.npos && text.find("\n", head + 4) != text.npos;  // the body's end
    if (manner_.when == When::afterAll && !isWhole) return true;
    if (manner_.firstIsGood && one.answered == 0) {
      if (!isWhole) return true;
      ++one.answered;
      one.from = text.size();
      return put(one, "HTTP/1.1 200 OK\r\nContent-Length: 2\r\n\r\nok");
    }
    one.from = isWhole ? text.size() : one.from;
    return speak(one);
  }

  bool speak(Served& one) {
    one.isSilent = manner_.then != Then::begAgain;
    const bool all = put(one, manner_.says);
    if (!all || manner_.then == Then::close) return false;
    if (manner_.then == Then::reset) {
      sockaddr none{};
      none.sa_family = AF_UNSPEC;
      connect(one.socket, &none, sizeof none);
      return false;
    }
    return true;
  }

  static bool put(const Served& one, std::string_view bytes) {
    while (!bytes.empty()) {
      pollfd room{one.socket, POLLOUT, 0};
      if (poll(&room, 1, 2000) <= 0) return false;
      const ssize_t count = send(one.socket, bytes.data(), bytes.size(), MSG_NOSIGNAL);
      if (count <= 0 && errno != EAGAIN) return false;
      if (count > 0) bytes.remove_prefix(static_cast<size_t>(count));
    }
    return true;
  }

  const Manner manner_;
  int listener_ = -1;
  uint16_t port_ = 0;
  std::atomic<bool> stopping_{false};
  std::mutex mutex_;
  std::vector<std::string> read_;
  std::thread thread_;
};

}  // namespace kyt
