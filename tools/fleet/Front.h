// nginx in front of receivers, with the site that the packages bring (packaging/fleet/nginx-site.conf) and nothing of this
// machine's nginx: in a folder of its own, on a port of the loopback. For the fleet on one machine and its tests. One thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "platform/base/Error.h"
#include "tools/demo/ChildProcess.h"

namespace kyt::tools {

struct FrontOptions {
  std::string folder;               // exists
  std::string site;                 // the site's file
  std::string certificate, key;     // PEM files; ECDSA
  std::vector<uint16_t> receivers;  // their ports, on the loopback
};

class Front {
 public:
  // Listens when this returns. Free ports are tried until one is its own.
  [[nodiscard]] static std::variant<Front, Error> start(const FrontOptions& options);

  [[nodiscard]] std::string base() const { return "https://127.0.0.1:" + std::to_string(port_); }
  [[nodiscard]] uint16_t port() const { return port_; }
  // What nginx has to say of its configuration ("nginx -t"), and whether that is good.
  [[nodiscard]] static std::pair<bool, std::string> check(const FrontOptions& options);

 private:
  Front(ChildProcess process, uint16_t port) : process_(std::move(process)), port_(port) {}
  ChildProcess process_;
  uint16_t port_ = 0;
};

}  // namespace kyt::tools
