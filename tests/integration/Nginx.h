// A real nginx that serves storebags over TLS and HTTP/2, in the foreground, with its own configuration in a
// folder of its own. Its listening socket is made here on a free port and handed over, so that no port is
// ever guessed and none needs to be waited for.
#pragma once

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <sstream>
#include <string>
#include <vector>

#include "tests/support/Eventually.h"
#include "tests/support/Programs.h"
#include "tests/support/TemporaryFolder.h"
#include "tests/support/TestCertificates.h"

namespace kyt {

class Nginx {
 public:
  static bool isHere() { return isInstalled("nginx"); }

  // The lifetimes: "brisca" 0 seconds, "emrit" 1 second, all others an hour. "fosska" drips. `locations` joins what
  // the server answers.
  explicit Nginx(const TestCertificate& certificate, const std::string& locations = {}) {
    folder_.write("certificate.pem", certificate.certificatePEM);
    folder_.write("key.pem", certificate.keyPEM, 0600);
    std::filesystem::create_directories(storebags());
    const int listening = ::socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t size = sizeof address;
    if (::bind(listening, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
        ::listen(listening, 64) != 0 ||
        ::getsockname(listening, reinterpret_cast<sockaddr*>(&address), &size) != 0)
      std::abort();
    port_ = ntohs(address.sin_port);
    folder_.write("nginx.conf", configuration(locations));
    tools::ChildProcess::Options how;
    how.outputFile = folder_ / "output";
    how.environment = {{"NGINX", std::to_string(listening) + ";"},
                       {"PATH", std::string(std::getenv("PATH")) + ":/usr/sbin"}};
    auto started = tools::ChildProcess::start(
        std::filesystem::exists("/usr/sbin/nginx") ? "/usr/sbin/nginx" : "nginx",
        {"-p", folder_.path(), "-c", folder_ / "nginx.conf", "-e", folder_ / "error.log"}, how);
    ::close(listening);
    if (started) process_ = std::move(*started);
  }

  [[nodiscard]] std::string base() const { return "https://127.0.0.1:" + std::to_string(port_); }
  // Puts the document in place; the older ones are `minutes` older.
  void put(const std::string& name, const std::string& document, int minutesOld) const {
    const std::string file = folder_.write("new", document);
    std::filesystem::last_write_time(
        file, std::filesystem::file_time_type::clock::now() - std::chrono::minutes(minutesOld));
    std::filesystem::rename(file, storebags() + "/" + name);
  }
  // One line for each request that was answered: method, path, status, protocol, If-Modified-Since.
  [[nodiscard]] std::vector<std::string> accesses() const {
    std::istringstream lines(folder_.read("access.log"));
    std::vector<std::string> out;
    for (std::string line; std::getline(lines, line);) out.push_back(line);
    return out;
  }
  // nginx writes the line after the client has the answer.
  [[nodiscard]] bool waitForAccesses(size_t count) const {
    return eventually([&] { return accesses().size() >= count; });
  }
  [[nodiscard]] std::string errors() const { return folder_.read("error.log") + folder_.read("output"); }
  // At once: what is being answered is cut.
  void kill() {
    process_.signal(SIGTERM);
    static_cast<void>(process_.wait(kTestDeadline));
  }

 private:
  [[nodiscard]] std::string storebags() const { return folder_ / "www/storebags/tolvar"; }
  [[nodiscard]] std::string configuration(const std::string& locations) const {
    // With a socket handed over nginx needs its master process; its worker would leave root otherwise.
    std::string text = ::geteuid() == 0 ? "user root;\n" : "";
    text +=
        "daemon off;\nworker_processes 1;\npid FOLDER/nginx.pid;\nerror_log FOLDER/error.log debug;\n"
        "events { worker_connections 256; }\n"
        "http {\n"
        "  log_format kyt '$request_method $uri $status $server_protocol since=\"$http_if_modified_since\"';\n"
        "  access_log FOLDER/access.log kyt;\n"
        "  client_body_temp_path FOLDER/body;\n  proxy_temp_path FOLDER/proxy;\n"
        "  fastcgi_temp_path FOLDER/fastcgi;\n  uwsgi_temp_path FOLDER/uwsgi;\n  scgi_temp_path FOLDER/scgi;\n"
        "  default_type application/xml;\n"
        "  map $uri $age { default max-age=3600; ~/brisca$ max-age=0; ~/emrit$ max-age=1; }\n"
        "  add_header Cache-Control $age;\n"
        "  server {\n"
        "    listen 127.0.0.1:PORT ssl http2;\n"
        "    ssl_certificate FOLDER/certificate.pem;\n    ssl_certificate_key FOLDER/key.pem;\n"
        "    root FOLDER/www;\n"
        "    location ~ /fosska$ { limit_rate 100; }\n" +
        locations + "  }\n}\n";
    const auto replaceAll = [&text](const std::string& what, const std::string& by) {
      for (size_t at = 0; (at = text.find(what, at)) != std::string::npos; at += by.size())
        text.replace(at, what.size(), by);
    };
    replaceAll("FOLDER", folder_.path());
    replaceAll("PORT", std::to_string(port_));
    return text;
  }

  TemporaryFolder folder_;
  uint16_t port_ = 0;
  tools::ChildProcess process_;  // ends before its folder goes
};

}  // namespace kyt
