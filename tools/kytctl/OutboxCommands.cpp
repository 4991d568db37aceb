// kytctl outbox list, show, flush, drop: what could not be sent and waits on the disk, asked of the running daemon.
#include <algorithm>
#include <cinttypes>
#include <cstdio>
#include <limits>
#include <string>
#include <utility>
#include <variant>
#include <vector>

#include "platform/base/TextEscape.h"
#include "tools/kytctl/Columns.h"
#include "tools/kytctl/Commands.h"
#include "tools/kytctl/StatusText.h"
#include "tools/kytctl/WindowClient.h"
#include "tools/kytctl/WindowOutput.h"

namespace kyt::tools {

namespace {

struct Outbox {
  bool isOn = false;
  int64_t now = 0;
  std::vector<Dictionary> servers;
};

std::variant<Outbox, Error> ask(WindowClient& window) {
  auto status = window.dictionary("Status");
  if (auto* error = std::get_if<Error>(&status)) return std::move(*error);
  auto servers = window.dictionaries("Outbox");
  if (auto* error = std::get_if<Error>(&servers)) return std::move(*error);
  const auto& told = std::get<Dictionary>(status);
  return Outbox{told.boolean("outbox"), numberIn(told, "now"),
                std::move(std::get<std::vector<Dictionary>>(servers))};
}

std::string answerText(const Dictionary& server) {
  const int64_t status = numberIn(server, "lastStatus");
  if (status != 0) return std::to_string(status);
  return numberIn(server, "failures") != 0 ? "no answer" : "-";
}

std::string nextText(const Dictionary& server, int64_t now) {
  if (numberIn(server, "inFlight") != 0) return "being sent";
  const int64_t next = numberIn(server, "nextTry");
  return next <= now ? "now" : "in " + spanText(next - now);
}

std::string postsText(uint64_t posts) {
  return std::to_string(posts) + (posts == 1 ? " post" : " posts");
}

uint64_t sumOf(const std::vector<Dictionary>& servers, const char* key) {
  uint64_t sum = 0;
  for (const Dictionary& server : servers) sum += static_cast<uint64_t>(numberIn(server, key));
  return sum;
}

void printList(const Outbox& outbox) {
  if (!outbox.isOn) {
    std::printf("There is no outbox: outbox.enabled in kytreportingd.toml is not set\n");
    return;
  }
  if (outbox.servers.empty()) {
    std::printf("Nothing waits in the outbox\n");
    return;
  }
  Columns columns({{"SERVER", 36},
                   {"POSTS", 7, true},
                   {"SIZE", 9, true},
                   {"OLDEST", 7, true},
                   {"LAST ANSWER", 11},
                   {"NEXT TRY", 12}});
  for (const Dictionary& server : outbox.servers)
    columns.add({textIn(server, "server"), std::to_string(numberIn(server, "posts")),
                 bytesText(static_cast<uint64_t>(numberIn(server, "bytes"))),
                 spanText(outbox.now - numberIn(server, "oldest")), answerText(server),
                 nextText(server, outbox.now)});
  std::fputs(columns.text().c_str(), stdout);
}

void printServer(const Dictionary& server, int64_t now) {
  std::printf("server         %s\n", cutText(textIn(server, "server"), kMostCharacters - 15).c_str());
  std::printf("waiting        %s, %s\n", postsText(static_cast<uint64_t>(numberIn(server, "posts"))).c_str(),
              bytesText(static_cast<uint64_t>(numberIn(server, "bytes"))).c_str());
  std::printf("oldest         %s\n", clockText(numberIn(server, "oldest"), now).c_str());
  std::printf("last answer    %s, %" PRId64 " failures in a row\n", answerText(server).c_str(),
              numberIn(server, "failures"));
  std::printf("next try       %s\n", nextText(server, now).c_str());
  if (const int64_t alone = numberIn(server, "failingAlone"); alone != 0)
    std::printf("of these       %s that it does not take, while it takes others\n",
                postsText(static_cast<uint64_t>(alone)).c_str());
  const Array* users = server.array("users");
  for (size_t i = 0; users != nullptr && i < users->size(); ++i) {
    const Dictionary* user = (users->begin() + i)->dictionary();
    if (user == nullptr) continue;
    const int64_t number = numberIn(*user, "user");
    const bool isDaemon = number == std::numeric_limits<uint32_t>::max();
    std::printf("%s %s, %s\n",
                cutText(isDaemon ? "the daemon    " : "user " + std::to_string(number), 14).c_str(),
                postsText(static_cast<uint64_t>(numberIn(*user, "posts"))).c_str(),
                bytesText(static_cast<uint64_t>(numberIn(*user, "bytes"))).c_str());
  }
}

}  // namespace

int outboxListCommand(const std::string& root, bool json) {
  auto client = WindowClient::connect(root);
  if (const auto* error = std::get_if<Error>(&client)) return failedAtWindow(*error);
  auto answer = ask(std::get<WindowClient>(client));
  if (const auto* error = std::get_if<Error>(&answer)) return failedAtWindow(*error);
  auto& outbox = std::get<Outbox>(answer);
  if (!json) {
    printList(outbox);
    return 0;
  }
  Value shown = listed("servers", std::move(outbox.servers));
  shown.mutableDictionary()->set("enabled", outbox.isOn);
  printJSON(shown);
  return 0;
}

int outboxShowCommand(const std::string& root, const std::string& server, bool json) {
  auto client = WindowClient::connect(root);
  if (const auto* error = std::get_if<Error>(&client)) return failedAtWindow(*error);
  auto answer = ask(std::get<WindowClient>(client));
  if (const auto* error = std::get_if<Error>(&answer)) return failedAtWindow(*error);
  const auto& outbox = std::get<Outbox>(answer);
  const auto found =
      std::find_if(outbox.servers.begin(), outbox.servers.end(),
                   [&server](const Dictionary& one) { return textIn(one, "server") == server; });
  if (found == outbox.servers.end()) return failed("Nothing waits for " + escapedText(server));
  if (json)
    printJSON(*found);
  else
    printServer(*found, outbox.now);
  return 0;
}

int outboxFlushCommand(const std::string& root, bool json) {
  auto client = WindowClient::connect(root);
  if (const auto* error = std::get_if<Error>(&client)) return failedAtWindow(*error);
  auto& window = std::get<WindowClient>(client);
  auto answer = window.dictionaries("Outbox");
  if (const auto* error = std::get_if<Error>(&answer)) return failedAtWindow(*error);
  if (const auto error = window.order("FlushOutbox")) return failedAtWindow(*error);
  const auto& servers = std::get<std::vector<Dictionary>>(answer);
  const uint64_t posts = sumOf(servers, "posts");
  if (json)
    printJSON(Dictionary{{"servers", uint64_t{servers.size()}}, {"posts", posts}});
  else
    std::printf("%s, to %zu server%s: sending begins now\n", postsText(posts).c_str(), servers.size(),
                servers.size() == 1 ? "" : "s");
  return 0;
}

int outboxDropCommand(const std::string& root, const OutboxDropOptions& options) {
  Dictionary filter;
  if (!options.all && options.server.empty() && options.user.empty())
    return failed("Say which posts: --server, --user, or --all");
  if (!options.server.empty()) filter.set("server", options.server);
  if (!options.user.empty()) {
    const std::optional<uint32_t> user = userOf(options.user);
    if (!user) return failed("There is no user " + options.user);
    filter.set("user", *user);
  }
  auto client = WindowClient::connect(root);
  if (const auto* error = std::get_if<Error>(&client)) return failedAtWindow(*error);
  auto answer = std::get<WindowClient>(client).number("DropOutbox", filter);
  if (const auto* error = std::get_if<Error>(&answer)) return failedAtWindow(*error);
  const uint64_t dropped = std::get<uint64_t>(answer);
  if (options.json)
    printJSON(Dictionary{{"dropped", dropped}});
  else
    std::printf("Dropped: %s\n", postsText(dropped).c_str());
  return 0;
}

}  // namespace kyt::tools
