// nginx as a child process that ends with this object, speaking HTTP/2 over TLS. Its listening socket is made here and
// handed over, so that no port is guessed; it belongs to the network of the thread that makes this object.
//
// Without another server behind it, it answers for a second server of its own, through a socket in the folder, since a
// proxy reads a request's body before it passes it on: nginx answers by itself before it has read the body, which ends
// the stream under the client that still sends.
#pragma once

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <fstream>
#include <sstream>
#include <string>

#include "tests/support/TestCertificates.h"

namespace kyt {

class HTTP2Nginx {
 public:
  static bool isHere() { return access("/usr/sbin/nginx", X_OK) == 0; }

  // `behind`: the server that it passes requests on to ("http://127.0.0.1:80"); `settings`: of its own.
  HTTP2Nginx(const std::string& folder, const TestCertificate& certificate, const std::string& behind = {},
             const std::string& address = "127.0.0.1", const std::string& settings = {})
      : address_(address) {
    std::ofstream(folder + "/server.pem") << certificate.certificatePEM << certificate.keyPEM;
    const int listening = listenOnAFreePort();
    const std::string file = folder + "/nginx.conf";
    std::ofstream(file) << configuration(folder, behind, settings);
    const std::string inherited = std::to_string(listening) + ";", errors = folder + "/error.log";
    pid_ = fork();
    if (pid_ == 0) {
      setenv("NGINX", inherited.c_str(), 1);
      execl("/usr/sbin/nginx", "nginx", "-c", file.c_str(), "-p", folder.c_str(), "-e", errors.c_str(),
            nullptr);
      _exit(127);
    }
    close(listening);
  }
  ~HTTP2Nginx() {
    kill(pid_, SIGTERM);
    waitpid(pid_, nullptr, 0);
  }
  HTTP2Nginx(const HTTP2Nginx&) = delete;
  HTTP2Nginx& operator=(const HTTP2Nginx&) = delete;

  [[nodiscard]] std::string url() const { return "https://" + address_ + ":" + std::to_string(port_) + "/"; }
  // Its worker ends at once, with all connections; another one starts. False when there is none.
  [[nodiscard]] bool killWorker() const {
    const std::string master = std::to_string(pid_);
    std::ifstream children("/proc/" + master + "/task/" + master + "/children");
    pid_t worker = 0;
    return children >> worker && kill(worker, SIGKILL) == 0;
  }

 private:
  [[nodiscard]] std::string configuration(const std::string& folder, const std::string& behind,
                                          const std::string& settings) const {
    // With a socket handed over nginx needs its master process; its worker would leave root otherwise.
    std::ostringstream text;
    text << (geteuid() == 0 ? "user root;\n" : "") << "daemon off;\nworker_processes 1;\npid " << folder
         << "/pid;\nerror_log " << folder << "/error.log;\nevents {}\nhttp {\naccess_log off;\n"
         << "proxy_next_upstream off;\n";
    for (const char* kind : {"client_body", "proxy", "fastcgi", "uwsgi", "scgi"})
      text << kind << "_temp_path " << folder << "/" << kind << ";\n";
    text << "server {\nlisten " << address_ << ":" << port_ << " ssl http2;\nssl_certificate " << folder
         << "/server.pem;\nssl_certificate_key " << folder << "/server.pem;\n"
         << settings << "location / {\n";
    if (!behind.empty()) {
      text << "proxy_pass " << behind << ";\n}\n}\n}\n";
      return text.str();
    }
    text
        << "proxy_pass http://unix:" << folder
        << "/socket;\nproxy_pass_request_body off;\nproxy_set_header Content-Length \"\";\n"
           "proxy_set_header X-Protocol $server_protocol;\nproxy_set_header X-Connection $connection;\n}\n}\n"
           "server {\nlisten unix:"
        << folder
        << "/socket;\nlocation / { add_header Last-Modified then always; "
           "return 200 \"$http_x_protocol $http_x_connection $http_x_kyt_source_application\"; }\n}\n}\n";
    return text.str();
  }
  int listenOnAFreePort() {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    inet_pton(AF_INET, address_.c_str(), &address.sin_addr);
    socklen_t size = sizeof address;
    const int made = socket(AF_INET, SOCK_STREAM, 0);
    EXPECT_EQ(bind(made, reinterpret_cast<sockaddr*>(&address), size), 0);
    EXPECT_EQ(listen(made, 64), 0);
    EXPECT_EQ(getsockname(made, reinterpret_cast<sockaddr*>(&address), &size), 0);
    port_ = ntohs(address.sin_port);
    return made;
  }
  const std::string address_;
  uint16_t port_ = 0;
  pid_t pid_ = -1;
};

}  // namespace kyt
