// Runs the built server as a process of its own on ports of its own, and speaks to it: through libcurl where
// HTTP is only the means, through bare sockets where the test is about what HTTP clients do wrong. For the
// tests of this folder.
#pragma once

#include <rapidjson/document.h>
#include <sys/types.h>

#include <chrono>
#include <filesystem>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

namespace kyt::devserver::test {

// A folder that goes with the test.
class TemporaryFolder {
 public:
  TemporaryFolder();
  ~TemporaryFolder();
  TemporaryFolder(const TemporaryFolder&) = delete;
  TemporaryFolder& operator=(const TemporaryFolder&) = delete;
  [[nodiscard]] const std::filesystem::path& path() const { return path_; }
  void write(const std::string& name, std::string_view content) const;
  [[nodiscard]] std::string read(const std::string& name) const;

 private:
  std::filesystem::path path_;
};

struct Response {
  int error = 0;  // of libcurl
  long status = 0;
  std::map<std::string, std::string> headers;  // names in lower case
  std::string body;

  [[nodiscard]] std::string header(const std::string& name) const;
  [[nodiscard]] rapidjson::Document json() const;
};

struct Call {
  std::string method = "GET";
  std::vector<std::string> headers;  // "Name: value"
  std::string body;
  std::string ca;  // a file; empty: the server's
  std::chrono::milliseconds timeout{20000};
  long tlsAtMost = 0;  // a CURL_SSLVERSION_MAX_…
};

class ServerProcess {
 public:
  // Starts with `--state FOLDER`, free ports and these options, and waits until the ports are open.
  explicit ServerProcess(const std::filesystem::path& state, std::vector<std::string> options = {},
                         uint16_t httpPort = 0);
  ~ServerProcess();  // stop(); an end other than in order (a sanitizer's finding) fails the test
  ServerProcess(const ServerProcess&) = delete;
  ServerProcess& operator=(const ServerProcess&) = delete;

  [[nodiscard]] bool isReady() const { return httpPort_ != 0; }
  [[nodiscard]] uint16_t httpsPort() const { return httpsPort_; }
  [[nodiscard]] uint16_t httpPort() const { return httpPort_; }
  [[nodiscard]] uint16_t udpPort() const { return udpPort_; }  // 0: without --udp-port
  [[nodiscard]] std::string caFile() const { return (state_ / "ca.pem").string(); }
  [[nodiscard]] const std::string& errors() const { return errors_; }  // complete after the end

  [[nodiscard]] Response https(const std::string& path, const Call& call = {}) const;
  [[nodiscard]] Response http(const std::string& path, const Call& call = {}) const;
  [[nodiscard]] Response post(const std::string& path, const std::string& body,
                              std::vector<std::string> headers = {}) const;
  [[nodiscard]] rapidjson::Document get(const std::string& path) const;  // of the plain port

  // Sends SIGTERM and waits for the end; the exit status, or -1 when it had to be killed or was ended by a
  // signal.
  int stop();

 private:
  std::filesystem::path state_;
  pid_t pid_ = -1;
  int output_ = -1, errorsFile_ = -1;
  uint16_t httpsPort_ = 0, httpPort_ = 0, udpPort_ = 0;
  int status_ = -1;
  std::string errors_;
};

// A TCP connection to the plain port.
class Connection {
 public:
  explicit Connection(uint16_t port);
  ~Connection();
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;
  void send(std::string_view bytes) const;
  // What arrives until `text` is among it, the peer closes, or the time is over.
  std::string receiveUntil(std::string_view text,
                           std::chrono::milliseconds timeout = std::chrono::seconds(20));
  [[nodiscard]] bool closedByPeer() const { return closed_; }
  void close();

 private:
  int descriptor_ = -1;
  bool closed_ = false;
  std::string received_;
};

[[nodiscard]] std::string gzip(std::string_view text);
[[nodiscard]] Response perform(const std::string& url, const Call& call);

// {"postTime":…,"clientId":"device","events":[…]}
[[nodiscard]] std::string message(const std::string& events);

}  // namespace kyt::devserver::test
