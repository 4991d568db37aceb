// A PostgreSQL of its own, in a folder of its own, reached through a socket there: for the fleet on one machine and for
// tests. Root starts it as another user, since it refuses to be root's. One thread.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <variant>

#include "platform/base/Error.h"
#include "tools/demo/ChildProcess.h"

namespace kyt::tools {

class Postgres {
 public:
  // Whether its programs are on this machine.
  [[nodiscard]] static bool isHere();
  // Takes connections when this returns.
  [[nodiscard]] static std::variant<std::unique_ptr<Postgres>, Error> start();
  ~Postgres();  // its folder goes with it
  Postgres(const Postgres&) = delete;
  Postgres& operator=(const Postgres&) = delete;

  // As libpq takes it.
  [[nodiscard]] std::string database() const { return "host=" + folder_ + " user=kyt dbname=postgres"; }
  // What psql prints for a query, a row a line, columns parted by "|"; its complaint when there is one.
  [[nodiscard]] std::string query(const std::string& sql) const;
  // Ends it at once and starts it again; its connections break.
  [[nodiscard]] std::optional<Error> restart();
  [[nodiscard]] std::string log() const;

 private:
  Postgres() = default;
  [[nodiscard]] std::optional<Error> makeCluster();
  [[nodiscard]] std::optional<Error> run();

  std::string folder_;
  std::optional<User> user_;  // none: this process's
  ChildProcess process_;
};

}  // namespace kyt::tools
