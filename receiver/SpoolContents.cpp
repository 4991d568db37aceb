#include "receiver/SpoolContents.h"

#include <algorithm>
#include <utility>

#include "http/Text.h"
#include "platform/linux/outbox/SQLitePostStore.h"
#include "receiver/SpoolFolder.h"

namespace kyt::receiver {
namespace {

std::string headerOf(const StoredPost& post, std::string_view name) {
  for (const auto& [known, value] : post.headers)
    if (known == name) return http::printable(value);
  return {};
}

// The numbers of its posts, or what is wrong.
std::variant<std::vector<SpooledPost>, std::string> headsOf(SpoolFolder& folder, PostStore& store) {
  if (auto wrong = folder.take()) return std::move(*wrong);
  std::vector<SpooledPost> posts;
  const auto wrong = store.open([&posts](const StoredPostHead& head) {
    SpooledPost& post = posts.emplace_back();
    post.number = head.post.number;
    if (head.isUnreadable) return;
    post.id = head.post.url;
    post.keptAt = head.post.keptAt;
    post.bytes = head.bytes;
  });
  if (wrong) return wrong->text;
  return posts;
}

}  // namespace

std::variant<std::vector<SpooledPost>, std::string> postsOfSpool(const Settings& settings) {
  SpoolFolder folder(settings.spoolPath);
  SQLitePostStore store(settings.spoolPath);
  auto found = headsOf(folder, store);
  if (auto* posts = std::get_if<std::vector<SpooledPost>>(&found))
    for (SpooledPost& post : *posts) {
      const auto read = store.read(post.number);
      if (const auto* whole = std::get_if<StoredPost>(&read))
        post.sender = headerOf(*whole, "Kyt-Sender") + "/" + headerOf(*whole, "Kyt-Client");
      else
        post.id.clear();
    }
  return found;
}

std::optional<std::string> removeFromSpool(const Settings& settings, int64_t number) {
  SpoolFolder folder(settings.spoolPath);
  SQLitePostStore store(settings.spoolPath);
  const auto found = headsOf(folder, store);
  if (const auto* wrong = std::get_if<std::string>(&found)) return *wrong;
  const auto& posts = std::get<std::vector<SpooledPost>>(found);
  if (std::none_of(posts.begin(), posts.end(),
                   [&](const SpooledPost& post) { return post.number == number; }))
    return "no post of the spool has the number " + std::to_string(number);
  const int64_t removed[] = {number};
  if (const auto wrong = store.change({}, removed, false)) return wrong->text;
  return std::nullopt;
}

}  // namespace kyt::receiver
