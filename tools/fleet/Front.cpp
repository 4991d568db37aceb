#include "tools/fleet/Front.h"

#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "tools/StorebagFile.h"
#include "tools/demo/Ports.h"

namespace kyt::tools {

namespace {

constexpr int kAttempts = 5;
constexpr std::chrono::seconds kStarts{20};

Error failure(std::string text) {
  return Error{"KYTToolsErrorDomain", -1, std::move(text)};
}

std::string nginxProgram() {
  return std::filesystem::exists("/usr/sbin/nginx") ? "/usr/sbin/nginx" : "nginx";
}

void replaceAll(std::string& text, const std::string& what, const std::string& by) {
  for (size_t at = 0; (at = text.find(what, at)) != std::string::npos; at += by.size())
    text.replace(at, what.size(), by);
}

// The site with this front's own port, certificate and receivers in the place of the example's.
std::optional<std::string> siteOf(const FrontOptions& options, uint16_t port) {
  auto read = readFile(options.site);
  if (!std::holds_alternative<std::string>(read)) return std::nullopt;
  std::string site = std::get<std::string>(std::move(read));
  replaceAll(site, "listen 443", "listen 127.0.0.1:" + std::to_string(port));
  replaceAll(site, "/etc/nginx/kyt/certificate.pem", options.certificate);
  replaceAll(site, "/etc/nginx/kyt/key.pem", options.key);
  const std::string example = "  server 127.0.0.1:8480";
  const size_t first = site.find(example), end = site.find("  keepalive");
  if (first == std::string::npos || end == std::string::npos) return std::nullopt;
  const size_t parameters = first + example.size();
  const std::string rest = site.substr(parameters, site.find('\n', parameters) + 1 - parameters);
  std::string servers;
  for (const uint16_t receiver : options.receivers)
    servers += "  server 127.0.0.1:" + std::to_string(receiver) + rest;
  return site.replace(first, end - first, servers);
}

// The frame that Debian's nginx.conf gives a site.
std::string frameOf(const std::string& folder) {
  std::string text = geteuid() == 0 ? "user root;\n" : "";
  text +=
      "daemon off;\nworker_processes 2;\npid FOLDER/nginx.pid;\nerror_log FOLDER/error.log info;\n"
      "events { worker_connections 1024; }\n"
      "http {\n"
      "  log_format kyt '$request_method $uri $status $upstream_status $upstream_addr $request_time';\n"
      "  access_log FOLDER/access.log kyt;\n"
      "  client_body_temp_path FOLDER/body;\n  proxy_temp_path FOLDER/proxy;\n"
      "  fastcgi_temp_path FOLDER/fastcgi;\n  uwsgi_temp_path FOLDER/uwsgi;\n  scgi_temp_path FOLDER/scgi;\n"
      "  include FOLDER/site.conf;\n"
      "}\n";
  replaceAll(text, "FOLDER", folder);
  return text;
}

std::optional<Error> writeConfiguration(const FrontOptions& options, uint16_t port) {
  const std::optional<std::string> site = siteOf(options, port);
  if (!site) return failure(options.site + ": cannot be read, or has no receivers");
  if (auto error = writeFile(options.folder + "/site.conf", *site, 0644)) return error;
  return writeFile(options.folder + "/nginx.conf", frameOf(options.folder), 0644);
}

std::vector<std::string> argumentsOf(const FrontOptions& options) {
  return {"-p", options.folder, "-c", options.folder + "/nginx.conf", "-e", options.folder + "/error.log"};
}

}  // namespace

std::variant<Front, Error> Front::start(const FrontOptions& options) {
  std::string said;
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    const uint16_t port = freePort();
    if (auto error = writeConfiguration(options, port)) return *error;
    ChildProcess::Options how;
    how.outputFile = options.folder + "/output";
    auto process = ChildProcess::start(nginxProgram(), argumentsOf(options), how);
    if (!process) return failure(std::string("nginx: ") + std::strerror(errno));
    const bool isUp = waitUntil(kStarts, [&] { return takesConnections(port) || !process->isRunning(); });
    if (isUp && process->isRunning()) return Front(std::move(*process), port);
  }
  return failure("nginx did not start: " + options.folder + "/error.log");
}

std::pair<bool, std::string> Front::check(const FrontOptions& options) {
  if (const auto error = writeConfiguration(options, freePort())) return {false, error->localizedDescription};
  ChildProcess::Options how;
  how.outputFile = options.folder + "/checked";
  std::vector<std::string> arguments = argumentsOf(options);
  arguments.emplace_back("-t");
  auto process = ChildProcess::start(nginxProgram(), arguments, how);
  if (!process) return {false, std::strerror(errno)};
  const std::optional<int> status = process->wait(kStarts);
  auto said = readFile(how.outputFile);
  return {status == 0, std::holds_alternative<std::string>(said) ? std::get<std::string>(said) : ""};
}

}  // namespace kyt::tools
