// The server's identity: a certificate authority of its own, made at the first start and kept, and a
// certificate for the names the server is reached by. Clients trust `ca.pem` and nothing else, so TLS is
// verified in development as it is in production. Called once by main() before any thread exists.
#pragma once

#include <filesystem>
#include <string>
#include <variant>
#include <vector>

#include "http/HttpServer.h"

namespace kyt::devserver {

using http::Identity;

// Reads or makes `ca.pem`, `ca-key.pem`, `server.pem` and `server-key.pem` in the folder; keys are readable
// by the owner alone. The server's certificate is made again when less than thirty days are left to it, when
// it does not fit the authority or its key, or when one of `hosts` is missing in it. The error is a text for
// people.
[[nodiscard]] std::variant<Identity, std::string> serverIdentity(const std::filesystem::path& folder,
                                                                 const std::vector<std::string>& hosts);

}  // namespace kyt::devserver
