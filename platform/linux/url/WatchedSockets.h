// What the network thread's event loop knows about libcurl's sockets, by number: which pool each belongs to
// and what the kernel watches it for. A connection that idles stays watched for input, which is what its next
// request begins with, so that watching costs a request on a connection that exists no system call.
//
// Where an HTTP/2 server gives no window, or no stream, libcurl asks to be told when it can write and then writes nothing,
// as often as it is told. Such a socket is let rest: until it can be read from, where the window comes from, or for a
// moment. Network thread only.
#pragma once

#include <cstdint>
#include <vector>

namespace kyt {

class URLConnectionPool;

class WatchedSockets {
 public:
  void setEpoll(int descriptor) { epoll_ = descriptor; }
  // After each wait for events, before they are handled.
  void beginTurn() { ++turn_; }
  // A socket of ours: its end will be told.
  void opened(int socket);
  void closed(int socket);
  // As libcurl's socket callback says: CURL_POLL_IN, …_OUT, …_INOUT, …_REMOVE.
  void watch(URLConnectionPool& pool, int socket, int what);
  // The pool that waits for an event of that socket, or null; then the socket is no longer watched, now or at its
  // next event.
  [[nodiscard]] URLConnectionPool* poolOf(int socket);
  // Whether the kernel has refused to watch a socket; watchRefused() asks it again. libcurl would not hear of that
  // socket otherwise.
  [[nodiscard]] bool areSomeRefused() const { return !refused_.empty(); }
  void watchRefused();
  // After an event of that socket has been handled. Whether it is let rest from now on.
  [[nodiscard]] bool restsAfter(int socket, uint32_t events);
  // All that rest.
  void wake();

 private:
  struct Watched {
    URLConnectionPool* pool = nullptr;  // null: nobody waits for it at the moment
    uint32_t events = 0;                // that the kernel watches; 0: none, or it is not known
    uint32_t left = 0;                  // the turn in which it was closed, or nobody waited for it any more
    uint32_t refused = 0;               // what the kernel was asked to watch it for, and did not
    bool ours = false;
    bool rests = false;
    uint8_t inVain = 0;    // events that it can be written to, since `written` was looked at
    uint64_t written = 0;  // bytes
  };
  void wakeOne(int socket, Watched& watched);
  Watched& at(int socket);
  bool tell(Watched& watched, int socket, uint32_t wanted);
  int epoll_ = -1;
  uint32_t turn_ = 1;
  std::vector<Watched> sockets_;
  std::vector<int> refused_;
  std::vector<int> resting_;  // and some that do no more
};

}  // namespace kyt
