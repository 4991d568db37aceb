// The window of administrators: accepts connections of the administration socket and answers their questions from what
// others publish (books, standings of sessions and storebags, records of servers, counters). It waits for no session, owns
// nothing that sessions use, and its connections neither start the daemon nor keep it running.
//
// Made by the composition root, which it does not outlive; everything in the sources outlives it. Any thread.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/base/Limits.h"
#include "platform/base/ServerRecords.h"
#include "platform/base/Watchers.h"
#include "platform/ipc/AdministrationInterface.h"
#include "platform/ipc/Listener.h"
#include "platform/objects/Value.h"

namespace kyt {

class SessionStandings;
class StorebagStandings;
struct Platform;

// What the system says of the daemon's process; 0 where it does not.
struct ProcessFigures {
  int32_t pid = 0;
  uint64_t residentBytes = 0, anonymousBytes = 0;
  uint32_t threads = 0;
};

// All empty where the settings want no outbox. They may wait for the disk.
struct OutboxOperations {
  struct Dropped {
    uint64_t posts = 0;
    const char* problem = nullptr;  // why they may still be on the disk; null: they are not
  };
  std::function<std::vector<Dictionary>()> view;
  std::function<void()> flush;
  std::function<Dropped(std::optional<std::string> server, std::optional<uint32_t> user)> drop;
};

struct AdministrationSources {
  Platform& platform;
  const SessionStandings& sessions;
  const StorebagStandings& storebags;
  const ServerRecords& servers;
  std::string version;
  int64_t since = 0;  // seconds since 1970
  // Any thread.
  OutboxOperations outbox;
  std::function<size_t()> connections;
  std::function<ProcessFigures()> process;
  // The program that a process runs, empty where that cannot be known; may take seconds once, when nobody answers.
  std::function<std::string(int32_t)> programOf;
  std::function<std::optional<std::string>(std::vector<std::string>&)> reload;  // see AdministrationInterface
};

// Who may look, besides root.
struct AdministrationAccess {
  uint32_t user = 0;              // the daemon's
  std::optional<uint32_t> group;  // none: nobody else
  std::string groupName;
};

class Administration final : public ListenerDelegate {
 public:
  Administration(AdministrationSources sources, AdministrationAccess access);

  // Everybody who reached the socket is taken, so that who may not look is told so.
  [[nodiscard]] bool listenerShouldAcceptNewConnection(
      Listener& listener, const std::shared_ptr<Connection>& connection) override;

  // What the window shows, by the interface's description.
  [[nodiscard]] Dictionary status() const;
  [[nodiscard]] std::vector<Dictionary> sessions(size_t most = Limits::maxShownSessions) const;
  [[nodiscard]] std::vector<Dictionary> books(size_t mostRowsOfUser = Limits::maxBookRows) const;
  [[nodiscard]] std::vector<Dictionary> storebags() const;
  // None where no storebag of that name is in force.
  [[nodiscard]] std::optional<Dictionary> storebag(std::string_view name) const;
  [[nodiscard]] std::string metrics(size_t mostRowsOfUser = Limits::maxBookRows) const;
  [[nodiscard]] std::optional<std::string> setLogLevel(std::string_view level) const;
  [[nodiscard]] bool hasOutbox() const { return sources_.outbox.view != nullptr; }
  [[nodiscard]] const OutboxOperations& outbox() const { return sources_.outbox; }
  // Begins to watch; null where the limit of watchers is reached.
  [[nodiscard]] std::unique_ptr<Watcher> watch(WatchFilter filter, bool isOwner) const;
  [[nodiscard]] std::optional<std::string> reload(std::vector<std::string>& lines) const {
    return sources_.reload(lines);
  }

 private:
  class Window;
  class Watching;
  const AdministrationSources sources_;
  const AdministrationAccess access_;
  const std::string refusal_;
};

}  // namespace kyt
