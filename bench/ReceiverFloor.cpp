// What a receiver cannot do without, and nothing else: reads posts, hashes them, publishes them, and answers with the log's
// acknowledgement. The receiver's processor time is compared with this program's (ReceiverBench.cpp).
//
//   kyt_bench_receiver_floor NATS-URL     prints its port, serves until its standard input ends
#include <nats/nats.h>
#include <netinet/in.h>
#include <openssl/sha.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <string>
#include <string_view>
#include <thread>

#include "platform/base/Hex.h"

namespace {

constexpr std::string_view kOK = "HTTP/1.1 200 OK\r\nContent-Length: 0\r\n\r\n";

struct Floor {
  natsConnection* connection = nullptr;
  natsSubscription* subscription = nullptr;
  std::string inbox;
  std::map<int, std::string> received;

  // The reply subject ends with the descriptor of the device.
  static void onAcknowledgement(natsConnection*, natsSubscription*, natsMsg* message, void*) {
    const char* subject = natsMsg_GetSubject(message);
    const int descriptor = std::atoi(std::strrchr(subject, '.') + 1);
    natsMsg_Destroy(message);
    if (::send(descriptor, kOK.data(), kOK.size(), MSG_NOSIGNAL) < 0) ::close(descriptor);
  }

  void publish(int descriptor, std::string_view body) const {
    unsigned char digest[SHA256_DIGEST_LENGTH];
    SHA256(reinterpret_cast<const unsigned char*>(body.data()), body.size(), digest);
    std::string id;
    for (const unsigned char byte : digest) kyt::appendHexByte(byte, id);
    natsMsg* message = nullptr;
    natsMsg_Create(&message, "kyt.events.0", (inbox + std::to_string(descriptor)).c_str(), body.data(),
                   static_cast<int>(body.size()));
    natsMsgHeader_Set(message, "Nats-Msg-Id", id.c_str());
    natsConnection_PublishMsg(connection, message);
    natsMsg_Destroy(message);
  }

  void read(int descriptor) {
    char block[65536];
    const ssize_t count = ::recv(descriptor, block, sizeof block, 0);
    std::string& text = received[descriptor];
    if (count <= 0) {
      received.erase(descriptor);
      ::close(descriptor);
      return;
    }
    text.append(block, static_cast<size_t>(count));
    const size_t end = text.find("\r\n\r\n");
    if (end == std::string::npos) return;
    const size_t at = text.find("Content-Length: ");
    const size_t length = static_cast<size_t>(std::atol(text.c_str() + at + 16));
    if (text.size() < end + 4 + length) return;
    publish(descriptor, std::string_view(text).substr(end + 4, length));
    text.erase(0, end + 4 + length);
  }
};

}  // namespace

int main(int argc, char** argv) {
  Floor floor;
  natsInbox* inbox = nullptr;
  if (argc != 2 || natsConnection_ConnectTo(&floor.connection, argv[1]) != NATS_OK ||
      natsInbox_Create(&inbox) != NATS_OK)
    return 1;
  floor.inbox = std::string(inbox) + ".";
  if (natsConnection_Subscribe(&floor.subscription, floor.connection, (floor.inbox + "*").c_str(),
                               &Floor::onAcknowledgement, nullptr) != NATS_OK)
    return 1;
  const int listener = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t size = sizeof address;
  if (::bind(listener, reinterpret_cast<sockaddr*>(&address), size) != 0 || ::listen(listener, 1024) != 0 ||
      ::getsockname(listener, reinterpret_cast<sockaddr*>(&address), &size) != 0)
    return 1;
  std::printf("%u\n", unsigned{ntohs(address.sin_port)});
  std::fflush(stdout);
  const int epoll = ::epoll_create1(EPOLL_CLOEXEC);
  epoll_event wanted{EPOLLIN, {.fd = listener}};
  ::epoll_ctl(epoll, EPOLL_CTL_ADD, listener, &wanted);
  wanted.data.fd = STDIN_FILENO;
  ::epoll_ctl(epoll, EPOLL_CTL_ADD, STDIN_FILENO, &wanted);
  for (;;) {
    epoll_event events[64];
    const int count = ::epoll_wait(epoll, events, 64, -1);
    for (int i = 0; i < count; ++i) {
      const int ready = events[i].data.fd;
      if (ready == STDIN_FILENO) return 0;
      if (ready == listener) {
        wanted.data.fd = ::accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
        ::epoll_ctl(epoll, EPOLL_CTL_ADD, wanted.data.fd, &wanted);
      } else {
        floor.read(ready);
      }
    }
  }
}
