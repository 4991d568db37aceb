#include "tools/kytctl/WaitingPosts.h"

#include <map>
#include <numeric>
#include <utility>
#include <variant>

#include "platform/base/Departures.h"
#include "platform/linux/outbox/SQLitePostStore.h"
#include "tools/kytctl/Columns.h"
#include "tools/kytctl/StatusText.h"
#include "tools/kytctl/WindowClient.h"

namespace kyt::tools {

namespace {

WaitingPosts askedOf(const std::string& root) {
  WaitingPosts waiting;
  auto client = WindowClient::connect(root);
  if (const auto* error = std::get_if<Error>(&client)) {
    waiting.problem = error->localizedDescription;
    return waiting;
  }
  auto answer = std::get<WindowClient>(client).dictionaries("Outbox");
  if (const auto* error = std::get_if<Error>(&answer)) {
    waiting.problem = error->localizedDescription;
    return waiting;
  }
  for (const Dictionary& server : std::get<std::vector<Dictionary>>(answer))
    waiting.servers.push_back({textIn(server, "server"), static_cast<uint64_t>(numberIn(server, "posts")),
                               static_cast<uint64_t>(numberIn(server, "bytes")), numberIn(server, "oldest")});
  return waiting;
}

WaitingPosts readFrom(const Paths& paths) {
  WaitingPosts waiting;
  std::map<std::string, WaitingPosts::Server> servers;
  SQLitePostStore store(paths.outbox());
  const auto problem = store.open([&servers](const StoredPostHead& head) {
    if (head.isUnreadable) return;
    WaitingPosts::Server& server = servers[serverOf(head.post.url)];
    ++server.posts;
    server.bytes += head.bytes;
    if (server.oldest == 0) server.oldest = head.post.keptAt;
  });
  if (problem) waiting.problem = problem->text;
  for (auto& [name, server] : servers) {
    server.server = name;
    waiting.servers.push_back(std::move(server));
  }
  return waiting;
}

}  // namespace

WaitingPosts WaitingPosts::of(const std::string& root, const Paths& paths, bool daemonRuns) {
  return daemonRuns ? askedOf(root) : readFrom(paths);
}

uint64_t WaitingPosts::posts() const {
  return std::accumulate(servers.begin(), servers.end(), uint64_t{0},
                         [](uint64_t sum, const Server& server) { return sum + server.posts; });
}

Value WaitingPosts::object() const {
  if (problem) return {};
  Array rows;
  for (const Server& server : servers)
    rows.append(Dictionary{{"server", std::string_view(server.server)},
                           {"posts", server.posts},
                           {"bytes", server.bytes},
                           {"oldest", server.oldest}});
  return Dictionary{{"posts", posts()}, {"servers", std::move(rows)}};
}

std::string WaitingPosts::text() const {
  if (problem) return "Waiting in the outbox: cannot be told: " + cutText(*problem, 60) + "\n";
  std::string lines;
  for (const Server& server : servers)
    lines += "Waiting in the outbox: " + std::to_string(server.posts) +
             (server.posts == 1 ? " post, " : " posts, ") + bytesText(server.bytes) + ", to " +
             cutText(server.server, 50) + "\n";
  return lines;
}

Array postsThatWait(const Paths& paths) {
  std::vector<int64_t> numbers;
  SQLitePostStore store(paths.outbox());
  if (store.open([&numbers](const StoredPostHead& head) { numbers.push_back(head.post.number); })) return {};
  Array posts;
  for (const int64_t number : numbers) {
    auto read = store.read(number);
    const auto* post = std::get_if<StoredPost>(&read);
    if (post == nullptr) continue;
    Array headers;
    for (const auto& [name, value] : post->headers) headers.append(Value(name + ": " + value));
    posts.append(Dictionary{{"address", std::string_view(post->url)},
                            {"kept", post->keptAt},
                            {"headers", std::move(headers)},
                            {"body", Value(post->body)}});
  }
  return posts;
}

}  // namespace kyt::tools
