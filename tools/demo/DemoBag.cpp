#include "tools/demo/DemoBag.h"

#include "platform/objects/Keys.h"

namespace kyt::tools {

namespace {

Dictionary client(const std::string& name, const std::string& base) {
  return {{"client", name},
          {"service", "demo"},
          {"expedite", 0},
          {"locale_whitelist", Array{"DE", "FR"}},
          {"filters", Array{Dictionary{{"key", "secret"}, {"action", "remove"}},
                            Dictionary{{"key", "account"}, {"action", "sha256"}}}},
          {"sampling_threshold", 1.0},
          {"event_threshold", 49},
          {"post_url", base + "/events/" + name},
          {"realtime_post_url", base + "/events/" + name + "/realtime"}};
}

// For programs that people try out: what they send leaves at once, unless their session batches.
Dictionary guest(const std::string& base) {
  return {{"client", "example"},
          {"service", "demo"},
          {"locale_whitelist", Array{"DE", "FR"}},
          {"filters", Array{}},
          {"sampling_threshold", 1.0},
          {"event_threshold", 49},
          {"post_url", base + "/events/example"}};
}

std::string script(const DemoClient& client, int sessionID) {
  std::string text = openingSteps(client, sessionID);
  text += "{\"do\":\"displayURL\"}\n";
  text +=
      std::string(
          "{\"do\":\"send\",\"category\":10,\"type\":1,\"repeat\":5,\"payload\":{\"duration\":1.5,\"count\":3,"
          "\"secret\":\"never leaves\",\"account\":\"") +
      kDemoAccount + "\"}}\n";
  text += "{\"do\":\"flush\"}\n";
  text +=
      "{\"do\":\"send\",\"category\":20,\"type\":2,\"flag\":1,\"reply\":true,\"payload\":{\"urgent\":true}}\n";
  text += "{\"do\":\"send\",\"category\":11,\"type\":1,\"repeat\":2,\"payload\":{\"late\":\"yes\"}}\n";
  text += "{\"do\":\"finish\"}\n";
  return text;
}

}  // namespace

Dictionary demoBag(const std::string& serverBase, const std::string& backend, const std::string& clientName) {
  const Dictionary section = {
      {backend, Dictionary{{"display_url", serverBase + "/"},
                           {"clients", Array{client(clientName, serverBase), guest(serverBase)}}}}};
  return {{"version", "demo-1"}, {"refresh_cycle", 3600}, {"release", section}, {"vantu_internal", section}};
}

Dictionary openBag(const std::string& serverBase) {
  const Dictionary anyone = {{"filters", Array{}},
                             {"locale_whitelist", Array{"DE", "FR"}},
                             {"sampling_threshold", 1.0},
                             {"event_threshold", 49},
                             {"post_url", serverBase + "/events/stage"}};
  const Dictionary section = {{kKYTReportingBackendHTTPPost, Dictionary{{"clients", Array{anyone}}}}};
  return {{"version", "stage-1"}, {"release", section}, {"vantu_internal", section}};
}

std::vector<DemoClient> demoClients() {
  return {{"kytdemo", 20}, {"kytdemo-plain", 8}};
}

std::string openingSteps(const DemoClient& client, int sessionID) {
  std::string text =
      "{\"do\":\"open\",\"sessionInfo\":{\"SessionID\":" + std::to_string(sessionID) +
      ",\"ClientType\":" + std::to_string(client.clientType) +
      ",\"ClientVersion\":3,\"BatchEvent\":true,\"RequireUserInfo\":true},\"userInfo\":{\"ClientName\":\"" +
      client.name + "\",\"ServiceName\":\"demo\"}}\n";
  text += "{\"do\":\"configure\"}\n";
  text += std::string("{\"do\":\"digestKey\",\"hex\":\"") + kDemoDigestKeyHex + "\",\"algorithm\":0}\n";
  return text;
}

std::string signedClientScript() {
  return script(demoClients()[0], 7001);
}

std::string plainClientScript() {
  return script(demoClients()[1], 7002);
}

}  // namespace kyt::tools
