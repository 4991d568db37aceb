// What the demonstration reports, and the storebag that governs it.
#pragma once

#include <string>
#include <vector>

#include "platform/objects/Value.h"

namespace kyt::tools {

// The events of both clients, start and stop messages included: 6 batched and flushed, 1 realtime and 3 at
// the end for the signed one; the same for the plain one.
inline constexpr int kDemoEvents = 20;
inline constexpr char kDemoDigestKeyHex[] = "6b79742d64656d6f2d646967657374";
inline constexpr char kDemoAccount[] = "owner@example.org";

// A storebag with one back end and two clients, of which the second is "example" with the service "demo", for whoever
// tries a program of his own: "kytdemo" reports through "qrs" (posts signed with the digest
// key) as client type 20 ("cadmor"), "kytdemo-plain" through "httppost" as client type 8 ("dulvek").
[[nodiscard]] Dictionary demoBag(const std::string& serverBase, const std::string& backend,
                                 const std::string& clientName);

// The names of all storebags that client types have.
inline constexpr const char* kStorebagNames[] = {"brisca", "cadmor", "dulvek", "emrit",  "fosska",
                                                 "gelmar", "hovit",  "ismel",  "jorvan", "kelvit",
                                                 "lurra",  "morvek", "nessim", "torvel"};
// A storebag that lets all of any client leave by "httppost", from any country.
[[nodiscard]] Dictionary openBag(const std::string& serverBase);

// Those that the bags are for.
struct DemoClient {
  std::string name;
  int clientType = 0;
};
[[nodiscard]] std::vector<DemoClient> demoClients();

// Sessions in kytctl's script form: the steps with which one begins that goes on, and whole ones.
[[nodiscard]] std::string openingSteps(const DemoClient& client, int sessionID);
[[nodiscard]] std::string signedClientScript();
[[nodiscard]] std::string plainClientScript();

}  // namespace kyt::tools
