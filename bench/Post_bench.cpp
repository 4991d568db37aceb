// What a post costs: processor time of this process for posts of 8 KiB to a server in another process, over
// plain HTTP on loopback and a connection that is kept alive. The reference is libcurl's own blocking loop on
// one thread doing the same in the same run. "One at a time" starts a post when the one before has completed;
// "bursts" starts 50 and then waits for them, as a flush of many sessions does. Prints microseconds for each
// post, and the growth of resident memory by the first session beside that of a program that only initialises
// libcurl.
#include <arpa/inet.h>
#include <curl/curl.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>
#include <thread>

#include "platform/base/Counters.h"
#include "platform/base/Semaphore.h"
#include "platform/linux/url/CurlURLSession.h"
#include "platform/queues/Log.h"

namespace {

constexpr int kPosts = 20000;
constexpr size_t kBody = 8192;

double processorSeconds() {
  rusage usage{};
  getrusage(RUSAGE_SELF, &usage);
  const auto seconds = [](timeval time) { return static_cast<double>(time.tv_sec) + time.tv_usec / 1e6; };
  return seconds(usage.ru_utime) + seconds(usage.ru_stime);
}

long residentKiB() {
  std::ifstream statm("/proc/self/statm");
  long total = 0, resident = 0;
  statm >> total >> resident;
  return resident * (sysconf(_SC_PAGESIZE) / 1024);
}

void serve(int connection) {
  constexpr char reply[] = "HTTP/1.1 200 OK\r\nServer: bench\r\nContent-Length: 2\r\n\r\n{}";
  std::string buffer;
  char bytes[65536];
  for (ssize_t count; (count = recv(connection, bytes, sizeof bytes, 0)) > 0;) {
    buffer.append(bytes, static_cast<size_t>(count));
    for (size_t end; (end = buffer.find("\r\n\r\n")) != std::string::npos;) {
      const size_t length = buffer.find("Content-Length: ");
      const size_t whole = end + 4 + (length < end ? std::stoul(buffer.substr(length + 16, 12)) : 0);
      if (buffer.size() < whole) break;
      buffer.erase(0, whole);
      if (send(connection, reply, sizeof reply - 1, MSG_NOSIGNAL) < 0) break;
    }
  }
  close(connection);
}

// A server process on a free port; it ends with this process.
uint16_t startServer() {
  const int listener = socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t size = sizeof address;
  if (bind(listener, reinterpret_cast<sockaddr*>(&address), size) != 0 || listen(listener, 64) != 0)
    std::abort();
  getsockname(listener, reinterpret_cast<sockaddr*>(&address), &size);
  if (fork() == 0) {
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    for (;;) {
      const int connection = accept(listener, nullptr, nullptr);
      const int on = 1;
      setsockopt(connection, IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
      std::thread(serve, connection).detach();
    }
  }
  close(listener);
  return ntohs(address.sin_port);
}

size_t discard(char*, size_t size, size_t count, void*) {
  return size * count;
}

double reference(const std::string& url, const std::string& body) {
  CURL* handle = curl_easy_init();
  curl_slist* headers = curl_slist_append(nullptr, "Content-Type: application/json");
  headers = curl_slist_append(headers, "Expect:");
  curl_easy_setopt(handle, CURLOPT_URL, url.c_str());
  curl_easy_setopt(handle, CURLOPT_HTTPHEADER, headers);
  curl_easy_setopt(handle, CURLOPT_POSTFIELDSIZE, static_cast<long>(body.size()));
  curl_easy_setopt(handle, CURLOPT_POSTFIELDS, body.data());
  curl_easy_setopt(handle, CURLOPT_WRITEFUNCTION, discard);
  const double before = processorSeconds();
  for (int i = 0; i < kPosts; ++i)
    if (curl_easy_perform(handle) != CURLE_OK) std::abort();
  const double used = processorSeconds() - before;
  curl_slist_free_all(headers);
  curl_easy_cleanup(handle);
  return used / kPosts * 1e6;
}

kyt::URLRequest makePost(const std::string& url, const kyt::Data& body) {
  kyt::URLRequest request;
  request.method = "POST";
  request.url = url;
  request.headers = {{"Content-Type", "application/json"}};
  request.body = body;
  return request;
}

double measured(kyt::URLSession& session, const std::string& url, const kyt::Data& body, int burst) {
  kyt::Semaphore done;
  const double before = processorSeconds();
  for (int i = 0; i < kPosts; i += burst) {
    for (int j = 0; j < burst; ++j) {
      session.start(makePost(url, body), [&](auto, auto response, auto) {
        if (!response || response->status != 200) std::abort();
        done.signal();
      });
    }
    for (int j = 0; j < burst; ++j) done.wait();
  }
  return (processorSeconds() - before) / kPosts * 1e6;
}

class NoSink final : public kyt::LogSink {
 public:
  void write(kyt::LogLevel, std::string_view) override {}
};

}  // namespace

int main() {
  const std::string url = "http://127.0.0.1:" + std::to_string(startServer()) + "/events";
  const std::string text(kBody, 'x');
  const long bare = residentKiB();
  curl_global_init(CURL_GLOBAL_DEFAULT);
  const long initialised = residentKiB();

  NoSink sink;
  kyt::Log log(sink);
  kyt::Counters counters;
  kyt::CurlURLSessionFactory factory({}, log, counters);
  const auto session = factory.create({"com.vantu.system.diagnostics", true});
  const kyt::Data body{std::string_view(text)};
  kyt::Semaphore first;
  session->start(makePost(url, body), [&](auto, auto, auto) { first.signal(); });
  first.wait();
  const long afterFirst = residentKiB();

  const double one = measured(*session, url, body, 1);
  const double bursts = measured(*session, url, body, 50);
  const double plain = reference(url, text);
  std::printf("%-44s %8.2f us\n", "libcurl's blocking loop", plain);
  std::printf("%-44s %8.2f us  %.2f of it\n", "URL session, one at a time", one, one / plain);
  std::printf("%-44s %8.2f us  %.2f of it\n", "URL session, bursts of 50", bursts, bursts / plain);
  std::printf("%-44s %8ld KiB\n", "resident: libcurl initialised", initialised - bare);
  std::printf("%-44s %8ld KiB more\n", "resident: after the first request", afterFirst - initialised);
  return 0;
}
