// What a peer of the administration socket may ask of the daemon: the window of administrators, which shows and changes
// nothing of what sessions do. The wire form is docs/com.vantu.kytreportingd.Administration.xml, which also tells the
// dictionaries' keys; AdministrationDispatcher translates.
//
// One object for each connection, called on its queue, one call at a time. No operation waits for a session: what a
// session shows is published by it.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/base/Function.h"
#include "platform/ipc/Listener.h"
#include "platform/objects/Value.h"

namespace kyt {

// Sends the signal Passed. False: not now, since the peer has not read what was sent before.
using PassedSignal = Function<bool(const Dictionary& passed)>;

struct AdministrationRefusal {
  enum class Why : uint8_t { wrongFilter, tooMany, notAllowed, isOff, failed };
  Why why = Why::wrongFilter;
  std::string text;
};

class AdministrationInterface : public ExportedObject {
 public:
  // Why this peer may ask nothing; null where it may.
  [[nodiscard]] virtual const char* refusal() const = 0;

  [[nodiscard]] virtual Dictionary status() = 0;
  // The oldest, so many at most.
  [[nodiscard]] virtual std::vector<Dictionary> sessions(size_t most) = 0;
  // A user who has more rows than so many has one, which adds up all; with 0 all users share one.
  [[nodiscard]] virtual std::vector<Dictionary> books(size_t mostRowsOfUser) = 0;
  [[nodiscard]] virtual std::vector<Dictionary> storebags() = 0;
  // None where no storebag of that name is in force.
  [[nodiscard]] virtual std::optional<Dictionary> storebag(std::string_view name) = 0;
  [[nodiscard]] virtual std::string metrics(size_t mostRowsOfUser) = 0;  // as of books()
  // "debug", "default" or "error", until the daemon ends or takes up another of its settings. What is wrong with it, or none.
  [[nodiscard]] virtual std::optional<std::string> setLogLevel(std::string_view level) = 0;
  // From now on the peer is told of events as they pass, by the signal, on the connection's queue, until its end. Another call
  // puts another filter in place of the first. Why not, or none.
  [[nodiscard]] virtual std::optional<AdministrationRefusal> watch(const Dictionary& filter,
                                                                   PassedSignal signal) = 0;
  // What could not be sent, a line for each server; empty without an outbox. These three may wait for the disk.
  [[nodiscard]] virtual std::vector<Dictionary> outbox() = 0;
  // Why not, or none. `dropped`: how many posts.
  [[nodiscard]] virtual std::optional<AdministrationRefusal> flushOutbox() = 0;
  [[nodiscard]] virtual std::optional<AdministrationRefusal> dropOutbox(const Dictionary& filter,
                                                                        uint64_t& dropped) = 0;
  // Takes up changed settings: a line for each that differs, in `lines`. What is wrong with their file, when nothing was
  // taken up; or none.
  [[nodiscard]] virtual std::optional<std::string> reload(std::vector<std::string>& lines) = 0;
};

}  // namespace kyt
