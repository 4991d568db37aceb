// The command lines of kytctl status, sessions, books, storebags, reload, metrics, watch, log-level and outbox.
#include <string>
#include <tuple>

#include "tools/kytctl/Arguments.h"

namespace kyt::tools {

void addWindow(const Command& program, Arguments& a) {
  using Print = int (*)(const std::string&, bool);
  const std::tuple<const char*, const char*, Print> commands[] = {
      {"status", "Print how the running daemon stands: what left, what is lost and why", statusCommand},
      {"sessions", "Print the sessions of the running daemon and the states of their back ends",
       sessionsCommand},
      {"books", "Print what became of each program's events", booksCommand},
      {"storebags", "Print which storebags are in force", storebagsCommand},
      {"reload", "Let the running daemon take up changed settings", reloadCommand}};
  for (const auto& [name, what, run] : commands) {
    const Command command = program.command(name, what);
    command.flag("--json", a.json, "Print one JSON object");
    command.runs([&a, run = run] { a.status = run(a.connection.root, a.json); });
  }
  const Command metrics =
      program.command("metrics", "Print the figures in the OpenMetrics text format, or an older one");
  const CommandOption json = metrics.flag("--json", a.metrics.json, "Print one JSON object");
  metrics.flag("--text-format", a.metrics.textFormat, "In the older text format, without units and end")
      .excludes(json);
  metrics.runs([&a] { a.status = metricsCommand(a.connection.root, a.metrics); });
  const Command watch = program.command("watch", "Print events as they pass, with their fate");
  watch.option("--user", a.watch.user, "Of this user's programs alone, by name or number").notEmpty();
  watch.option("--client", a.watch.client, "Of clients of this name alone, which may be empty");
  watch.option("--category", a.watch.category, "Of this category alone");
  watch.flag("--bodies", a.watch.bodies, "Print the body of each request too, as it left");
  watch.flag("--json", a.watch.json, "Print one JSON object a line");
  watch.runs([&a] { a.status = watchCommand(a.connection.root, a.watch); });
  const Command level =
      program.command("log-level", "Print or set from which level on the running daemon logs lines");
  level.option("level", a.level, "The new level, until the daemon ends").oneOf({"debug", "default", "error"});
  level.flag("--json", a.json, "Print one JSON object");
  level.runs([&a] { a.status = logLevelCommand(a.connection.root, a.level, a.json); });
}

void addOutbox(const Command& program, Arguments& a) {
  const Command outbox = program.command("outbox", "What could not be sent and waits on the disk");
  outbox.needsCommand();
  const Command list = outbox.command("list", "Print what waits for each server");
  list.flag("--json", a.json, "Print one JSON object");
  list.runs([&a] { a.status = outboxListCommand(a.connection.root, a.json); });
  const Command show = outbox.command("show", "Print what waits for one server, and whose it is");
  show.option("server", a.server, "The server, as list prints it: https://events.example.org").required();
  show.flag("--json", a.json, "Print one JSON object");
  show.runs([&a] { a.status = outboxShowCommand(a.connection.root, a.server, a.json); });
  const Command flush = outbox.command("flush", "Send now, whatever is waited for");
  flush.flag("--json", a.json, "Print one JSON object");
  flush.runs([&a] { a.status = outboxFlushCommand(a.connection.root, a.json); });
  const Command drop = outbox.command("drop", "Delete what waits");
  drop.option("--server", a.drop.server, "For this server alone").notEmpty();
  drop.option("--user", a.drop.user, "Of this user's programs alone, by name or number").notEmpty();
  drop.flag("--all", a.drop.all, "All of it");
  drop.flag("--json", a.drop.json, "Print one JSON object");
  drop.runs([&a] { a.status = outboxDropCommand(a.connection.root, a.drop); });
}

}  // namespace kyt::tools
