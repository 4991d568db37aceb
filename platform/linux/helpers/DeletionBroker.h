// Removes files of clients with the clients' own rights, on behalf of the daemon, which is confined and has
// none of its own.
//
// A small process ("kyt-broker") is forked before the confinement is entered. It knows one request: an open
// file, its folder, a name, and whose rights to use; for each it forks a child that takes that user and those
// groups and nothing else (no capability), checks that the name in that folder is still this very file
// (device and inode), removes it and returns errno. A client's file system that never answers holds such
// a child alone, and a deadline ends it; a user that has many such gets no further one. Between check and removal the client
// could put another file there: that is then removed with its own rights, so nobody but itself is harmed.
//
// It believes the daemon whose rights to use, which code that took over the daemon could misuse. So the file must be
// one that a client passed: opened for reading, which the confined daemon cannot do outside the folders of its
// profile, and lie beneath none of these.
//
// Where the daemon was started by an ordinary user, the broker serves clients of that user alone.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "platform/FileExtension.h"
#include "platform/linux/helpers/HelperProcess.h"

namespace kyt {

// Any thread.
class DeletionBroker {
 public:
  // Supplementary groups of a client; one that has more is refused.
  static constexpr size_t kMaxGroups = 1024;
  static constexpr size_t kMostOfOneUser = 32;  // removals at once; eight times as many of all

  // Only before there are threads and before the confinement. Nothing beneath `daemonsOwn` is ever removed: the folders
  // in which the confined daemon can open files itself. An error's text when it cannot be started.
  [[nodiscard]] static std::variant<std::unique_ptr<DeletionBroker>, std::string> start(
      const std::vector<std::string>& daemonsOwn);

  // 0, or errno: ESTALE when the name is another file now, EPERM for a user that it may not serve and beneath
  // `daemonsOwn`, EBADF for a file that is not open for reading, EIO when the file system does not answer, ETIMEDOUT.
  // Waits for the answer, some seconds at most.
  [[nodiscard]] int remove(int file, int folder, std::string_view name, const PeerIdentity& peer) const;

 private:
  explicit DeletionBroker(std::unique_ptr<HelperProcess> process) : process_(std::move(process)) {}

  const std::unique_ptr<HelperProcess> process_;
};

}  // namespace kyt
