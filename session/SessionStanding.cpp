#include "session/SessionStanding.h"

#include <utility>

#include "platform/base/Limits.h"
#include "platform/base/TextEscape.h"

namespace kyt {

// Handles may outlive the one who lists them.
struct SessionStandings::List {
  Mutex mutex;
  uint64_t next GUARDED_BY(mutex) = 0;
  std::map<uint64_t, std::weak_ptr<SessionStanding>> standings GUARDED_BY(mutex);
};

std::shared_ptr<SessionStandings::List> SessionStandings::makeList() {
  return std::make_shared<List>();
}

std::shared_ptr<SessionStanding> SessionStandings::add(SessionView first) {
  auto standing = std::make_unique<SessionStanding>(std::move(first));
  MutexLock lock(list_->mutex);
  const uint64_t number = list_->next++;
  // Deleted after it was taken out of the list, which a reader may hold for a moment longer.
  std::shared_ptr<SessionStanding> listed(standing.release(), [list = list_, number](SessionStanding* gone) {
    {
      MutexLock last(list->mutex);
      list->standings.erase(number);
    }
    delete gone;
  });
  list_->standings.emplace(number, listed);
  return listed;
}

std::vector<std::shared_ptr<SessionStanding>> SessionStandings::standings(size_t most) const {
  std::vector<std::shared_ptr<SessionStanding>> all;
  MutexLock lock(list_->mutex);
  for (const auto& [number, weak] : list_->standings) {
    if (all.size() >= most) break;
    if (auto standing = weak.lock()) all.push_back(std::move(standing));
  }
  return all;
}

std::vector<SessionView> SessionStandings::views(size_t most) const {
  std::vector<SessionView> views;
  for (const auto& standing : standings(most)) views.push_back(standing->view());
  return views;
}

std::string shownName(std::string_view name) {
  return std::string(name.substr(0, lengthThatFits(name, Limits::maxBookNameBytes)));
}

}  // namespace kyt
