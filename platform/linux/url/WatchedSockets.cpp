#include "platform/linux/url/WatchedSockets.h"

#include <curl/curl.h>
#include <sys/epoll.h>

#include <cerrno>
#include <optional>
#include <utility>

#include "platform/linux/url/URLConnection.h"

namespace kyt {
namespace {

constexpr uint8_t kMostInVain = 8;

}  // namespace

WatchedSockets::Watched& WatchedSockets::at(int socket) {
  const auto index = static_cast<size_t>(socket);
  if (sockets_.size() <= index) sockets_.resize(index + 1);
  return sockets_[index];
}

void WatchedSockets::opened(int socket) {
  at(socket) = {nullptr, 0, turn_, 0, true, false, 0, 0};
}

void WatchedSockets::closed(int socket) {
  at(socket) = {nullptr, 0, turn_, 0, false, false, 0, 0};
}

URLConnectionPool* WatchedSockets::poolOf(int socket) {
  Watched& watched = at(socket);
  if (watched.pool != nullptr) return watched.pool;
  // Of a socket that was left after the wait, this event may be the last sign: its number is not touched.
  if (watched.left == turn_) return nullptr;
  // It is open, then. The server closed an idle connection, which libcurl finds out when it looks at the
  // connection again; or libcurl left it while more than input was watched.
  epoll_ctl(epoll_, EPOLL_CTL_DEL, socket, nullptr);
  watched.events = 0;
  return nullptr;
}

void WatchedSockets::watch(URLConnectionPool& pool, int socket, int what) {
  Watched& watched = at(socket);
  watched.refused = 0;
  if (what == CURL_POLL_REMOVE) {
    watched.pool = nullptr;
    watched.left = turn_;
    if (watched.ours && watched.events == EPOLLIN) return;
    // libcurl has closed a socket that was still connecting before it says so here, and tells nothing else of its
    // end: the number may be another thread's by now. The kernel forgets a closed socket by itself, and an open
    // one is seen to at its next event.
    watched.events = 0;
    watched.ours = false;
    watched.rests = false;
    return;
  }
  const uint32_t wanted = ((what & CURL_POLL_IN) != 0 ? uint32_t{EPOLLIN} : 0) |
                          ((what & CURL_POLL_OUT) != 0 ? uint32_t{EPOLLOUT} : 0);
  watched.pool = &pool;
  if (watched.events == wanted) return;
  watched.rests = false;
  watched.inVain = 0;
  if (tell(watched, socket, wanted)) return;
  watched.refused = wanted;
  refused_.push_back(socket);
}

void WatchedSockets::watchRefused() {
  for (const int socket : std::exchange(refused_, {})) {
    Watched& watched = at(socket);
    if (watched.refused == 0 || tell(watched, socket, watched.refused)) continue;
    refused_.push_back(socket);
  }
}

// Whether the kernel watches the socket for that from now on.
bool WatchedSockets::tell(Watched& watched, int socket, uint32_t wanted) {
  epoll_event event{};
  event.events = wanted;
  event.data.u64 = static_cast<uint64_t>(socket);
  const int operation = watched.events == 0 ? EPOLL_CTL_ADD : EPOLL_CTL_MOD;
  if (epoll_ctl(epoll_, operation, socket, &event) != 0) {
    // What was left open, or a number that the resolver used again without telling: the kernel knows better.
    const int other = errno == EEXIST ? EPOLL_CTL_MOD : EPOLL_CTL_ADD;
    if (epoll_ctl(epoll_, other, socket, &event) != 0) return false;
  }
  watched.events = wanted;
  watched.refused = 0;
  return true;
}

bool WatchedSockets::restsAfter(int socket, uint32_t events) {
  Watched& watched = at(socket);
  if (events != EPOLLOUT || watched.pool == nullptr || (watched.events & EPOLLOUT) == 0) {
    watched.inVain = 0;
    wakeOne(socket, watched);
    return false;
  }
  if (++watched.inVain < kMostInVain) return false;
  watched.inVain = 0;
  const std::optional<uint64_t> written = bytesWritten(socket);
  if (!written || *written != watched.written) {
    watched.written = written.value_or(0);
    return false;
  }
  epoll_event event{};
  event.events = watched.events & ~uint32_t{EPOLLOUT};
  event.data.u64 = static_cast<uint64_t>(socket);
  if (epoll_ctl(epoll_, EPOLL_CTL_MOD, socket, &event) != 0) return false;
  watched.rests = true;
  resting_.push_back(socket);
  return true;
}

void WatchedSockets::wakeOne(int socket, Watched& watched) {
  if (!std::exchange(watched.rests, false) || watched.events == 0) return;
  epoll_event event{};
  event.events = watched.events;
  event.data.u64 = static_cast<uint64_t>(socket);
  if (epoll_ctl(epoll_, EPOLL_CTL_MOD, socket, &event) == 0) return;
  watched.refused = std::exchange(watched.events, 0);
  refused_.push_back(socket);
}

void WatchedSockets::wake() {
  for (const int socket : resting_) wakeOne(socket, at(socket));
  resting_.clear();
}

}  // namespace kyt
