// kytctl: the command for people: sends events, reads and writes user defaults, grants and withdraws the
// consent, shows and erases what is known of the owner, makes keys, signs and checks storebags, and shows how the running
// daemon stands.
#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <limits>
#include <optional>
#include <string>
#include <tuple>
#include <utility>

#include "platform/linux/cli/CommandLine.h"
#include "tools/kytctl/Commands.h"

namespace {

using namespace kyt::tools;
using kyt::Command;
using kyt::CommandLine;
using kyt::CommandOption;

struct Arguments {
  ConnectionOptions connection;
  SendOptions send;
  ListenOptions listen;
  SignOptions sign;
  CheckOptions check;
  ExplainOptions explain;
  SimulateOptions simulate;
  EventsOptions events;
  GenerateOptions generate;
  PublishOptions publish;
  ProbeOptions probe;
  RingOptions ring;
  WatchOptions watch;
  MetricsOptions metrics;
  OutboxDropOptions drop;
  std::string script, domain, key, value, type = "string", folder, document, publicKey, oldBag, newBag;
  unsigned bits = 2048;
  std::string level, server;
  bool json = false;
  int status = 0;
  int unwritten = 1;  // the status at least, of a command whose output is lost
};

constexpr char kFinished[] =
    R"("finished" means that the daemon had a storebag for the client type and has offered the event to its back ends.
It does not mean that the event was sent: no consent, another country, a list, sampling or a server may have stopped
it. The daemon's log and the server tell.
With --stdin a line is {"category":10,"type":1,"payload":{…},"flag":0}; the live back ends and the figures are printed.)";

constexpr char kSessionSteps[] =
    R"(Steps, by "do"; from standard input each runs as soon as its line is there. A key that a step does not have is an error:
  {"do":"open","sessionInfo":{…},"userInfo":{…}}   first; the keys are SessionID, ClientType, …;
                                                   "aggregate":true prints each message of the hierarchy
  {"do":"configure"}                               prints the live back ends
  {"do":"states","userInfo":{…}}                   new user information; prints the live back ends
  {"do":"send","category":1,"type":2,"payload":{…},"flag":0,"repeat":1,"reply":false}
  {"do":"flush"}                                   posts what is batched
  {"do":"displayURL"}                              prints the address for people
  {"do":"sharedData","entries":{…}}                null removes a key
  {"do":"digestKey","hex":"00ff…","algorithm":0}   signs the posts of the back end qrs
  {"do":"wait","messages":1}                       until so many aggregated messages have been printed
  {"do":"finish"}                                  sends what is queued and prints the figures

The manual page kytctl tells more.)";

constexpr char kListened[] =
    R"(Each line is a JSON object; "event" is one of listening (when programs may come), session, configuration,
states, message, flush, sharedData, digestKey, file, logData, finish (the graceful end) and end (of a connection).
Dates are seconds since 1970, data is hexadecimal digits. It ends with SIGINT or SIGTERM. Nothing leaves it.)";

constexpr char kExplained[] =
    R"(The event is a JSON object as it goes over the wire, or - for standard input:
  {"Category":10,"Type":1,"Payload":{"step":1},"Flag":0}
Nothing is sent and nothing is stored; no daemon needs to run. What servers answer is not known here.
The exit status is 0 when the event leaves, 1 when it does not, and 2 when that cannot be told.)";

constexpr char kRing[] =
    R"(Each device is in one of 100 rings, 00 to 99, which its identifier decides for good. A server that has an address for
each ring can hand out a bag to some of them first:
  kytctl ring --set 'https://bags.example.org/{ring}/bags/tolvar'
stores the ring's address as the user default kytreporting_storebag_url.)";

constexpr char kSimulated[] =
    R"(Besides the steps of kytctl session there is one that says what devices there are, with weights:
  {"do":"devices","countries":{"DE":3,"unknown":1},"families":{"Phone":1},"models":{"P1":1},"consent":0.8}
and "perDay" of a step "open" is how many such sessions a device has each day. What is not said is what the bag
names, in equal shares, and one that it does not name; the consent is given then.)";

constexpr char kEventsChecked[] =
    R"(Findings are lines FILE:LINE: KIND: TEXT. The kinds: personal-unfiltered, category-refused, category-0, not-posted,
replaced, client-not-listed. Consent, countries, devices and sampling are not looked at: kytctl storebag simulate does.
The exit status is 0 without findings, 1 with some, and 2 when the file or the bag cannot be read.)";

void addConnectionOptions(const Command& command, Arguments& arguments) {
  command.option("--socket", arguments.connection.socket, "The daemon's socket, instead of the fixed one");
  command.option("--timeout", arguments.connection.timeoutSeconds, "Seconds to wait for the daemon")
      .between(0.1, 3600.0);
}

void addSend(const Command& program, Arguments& a) {
  const Command send = program.command("send", "Send one event without a session of its own");
  addConnectionOptions(send, a);
  send.option("--client-type", a.send.clientType, "The client type, 0 to 23").required().between(0, 23);
  send.option("--session-id", a.send.sessionID, "The session ID, 32 bits");
  send.option("--client-version", a.send.clientVersion, "The client version, 16 bits");
  send.option("--category", a.send.category, "The event's category (method)");
  send.option("--type", a.send.type, "The event's type (response code)");
  send.option("--payload", a.send.payloadJSON, "A JSON object");
  send.option("--user-info", a.send.userInfoJSON,
              "A JSON object; ClientName and ServiceName choose the client entry");
  send.flag("--require-user-info", a.send.requireUserInfo, "The session promises user information");
  send.flag("--stdin", a.send.fromStandardInput,
            "Send the events of standard input, a JSON object a line, in one session");
  send.flag("--quiet-if-no-daemon", a.send.quietIfNoDaemon, "Succeed without a word where no daemon listens");
  send.ends(kFinished);
  send.runs([&a] { a.status = sendCommand(a.connection, a.send); });

  const Command session =
      program.command("session", "Run a scripted session: one JSON object a line (kytctl session --help)");
  addConnectionOptions(session, a);
  session.option("script", a.script, "A file, or - for standard input").required();
  session.ends(kSessionSteps);
  session.runs([&a] { a.status = sessionCommand(a.connection, a.script); });
}

void addListen(const Command& program, Arguments& a) {
  const Command listen =
      program.command("listen", "Stand in for the daemon in tests, and print what programs tell it");
  ListenOptions& o = a.listen;
  listen.option("--socket", o.socket, "Where to listen").required();
  const CommandOption live =
      listen.option("--live", o.live, "The live back ends of each session, parted by commas").showsDefault();
  listen.flag("--no-storebag", o.noStorebag, "No client type has a storebag").excludes(live);
  listen.flag("--refuse", o.refuse, "Serve nobody");
  listen.option("--die-after", o.dieAfter, "End as if killed after so many messages");
  listen.ends(kListened);
  listen.runs([&a] { a.status = listenCommand(a.listen); });
}

void addExplain(const Command& program, Arguments& a) {
  const Command explain = program.command("explain", "Tell what becomes of an event on this device, and why");
  ExplainOptions& o = a.explain;
  explain.option("event", o.event, "A JSON object, or - for standard input").required();
  const CommandOption information = explain.option("--session-info", o.sessionInfoJSON,
                                                   "The session's information, a JSON object, as it is sent");
  for (const CommandOption& part :
       {explain.option("--client-type", o.clientType, "The client type, 0 to 23"),
        explain.option("--session-id", o.sessionID, "The session ID, 32 bits"),
        explain.option("--client-version", o.clientVersion, "The client version, 16 bits"),
        explain.flag("--require-user-info", o.requireUserInfo, "The session promises user information"),
        explain.flag("--batch", o.batch, "The session batches its events")})
    part.excludes(information);
  const CommandOption userInfo =
      explain.option("--user-info", o.userInfoJSON, "The user information, a JSON object");
  explain.option("--client", o.client, "The client's name in the user information").excludes(userInfo);
  explain.option("--service", o.service, "The service's name in the user information").excludes(userInfo);
  explain.flag("--single", o.single, "A single message, without a session");
  const CommandOption bag =
      explain
          .option("--storebag", o.storebag,
                  "A document, or a bag not signed yet (.json, .toml, .plist), instead of the one in force")
          .notEmpty();
  explain.flag("--fetch", o.fetch, "The server's storebag, also where a running daemon has one")
      .excludes(bag);
  const CommandOption pid = explain.option("--pid", o.program.pid, "The program, a process")
                                .between(1, std::numeric_limits<int32_t>::max());
  explain.option("--user", o.program.user, "Any process of a user instead; your own without either")
      .notEmpty()
      .excludes(pid);
  explain.option("--program", o.program.program, "Of that user, one that runs this program file")
      .notEmpty()
      .excludes(pid);
  explain.option("--draw", o.draw, "The session's sampling draw, 0 to 1; all are tried without")
      .between(0.0, 1.0);
  explain.flag("--json", o.json, "Print one JSON object");
  explain.ends(kExplained);
  explain.runs([&a] {
    a.unwritten = 2;  // 1 would tell that the event does not leave
    a.status = explainCommand(a.connection.root, a.explain);
  });
}

void addDefaults(const Command& program, Arguments& a) {
  const Command defaults = program.command("defaults", "User defaults by domain and key");
  defaults.needsCommand();
  const Command read = defaults.command("read", "Print a value, or all of a domain");
  read.option("domain", a.domain, "The domain, as com.vantu.kytreporting").required();
  read.option("key", a.key, "The key; without one all are printed");
  read.runs([&a] { a.status = defaultsReadCommand(a.connection.root, a.domain, a.key); });
  const Command write = defaults.command("write", "Store a value");
  write.option("domain", a.domain, "The domain, as com.vantu.kytreporting").required();
  write.option("key", a.key, "The key").required();
  write.option("value", a.value, "The value; put -- before one that begins with a minus sign").required();
  write.option("--type", a.type, "What the value is")
      .oneOf({"string", "integer", "real", "boolean"})
      .showsDefault();
  write.runs([&a] { a.status = defaultsWriteCommand(a.connection.root, a.domain, a.key, a.type, a.value); });
  const Command erase = defaults.command("delete", "Remove a value");
  erase.option("domain", a.domain, "The domain, as com.vantu.kytreporting").required();
  erase.option("key", a.key, "The key").required();
  erase.runs(
      [&a] { a.status = defaultsWriteCommand(a.connection.root, a.domain, a.key, a.type, std::nullopt); });

  const Command consent = program.command("consent", "The owner's consent to diagnostics-and-usage upload");
  consent.needsCommand();
  const std::pair<const char*, const char*> changes[] = {
      {"show", "Print whether it is given"}, {"grant", "Give it"}, {"withdraw", "Take it back"}};
  for (const auto& [change, what] : changes)
    consent.command(change, what).runs([&a, change = change] {
      a.status = consentCommand(a.connection.root, change);
    });
}

void addOwner(const Command& program, Arguments& a) {
  const Command owner = program.command("owner", "What left the device, for its owner");
  owner.needsCommand();
  const Command show = owner.command("show", "Print what left in the last day, identifiers, and what waits");
  show.flag("--json", a.json, "As one JSON object");
  show.runs([&a] { a.status = ownerShowCommand(a.connection.root, a.json); });
  const Command take = owner.command("export", "Write all that is kept about it on the device into a file");
  take.option("file", a.document, "The file, JSON; - for standard output").required();
  take.runs([&a] { a.status = ownerExportCommand(a.connection.root, a.document); });
  const Command erase = owner.command("erase", "Erase identifiers, local logs and what waits");
  erase.runs([&a] { a.status = ownerEraseCommand(a.connection.root); });
}

void addEntitlements(const Command& program, Arguments& a) {
  const Command entitlements = program.command("entitlements", "Who may connect");
  entitlements.needsCommand();
  const Command check = entitlements.command("check", "Tell why a client is served or refused");
  const CommandOption pid =
      check.option("--pid", a.check.pid, "A process").between(1, std::numeric_limits<int32_t>::max());
  check.option("--user", a.check.user, "Any process of a user, by name or number").notEmpty().excludes(pid);
  check.runs([&a] {
    a.unwritten = 2;  // 1 would tell that the client is refused
    a.status = entitlementsCheckCommand(a.connection.root, a.check);
  });
}

// What is signed, and what of it the command line decides.
void addSigning(const Command& command, SignOptions& options) {
  command.option("bag", options.bag, "FILE.json, FILE.toml or FILE.plist").required();
  command.option("--key", options.key, "The private key, PEM").required();
  command.option("--serial", options.serial, "The bag's serial, which grows from bag to bag");
  command.option("--expires-in-days", options.expiresInDays, "The bag's expiry, in days from now");
}

// On their way to devices.
void addRollOut(const Command& program, const Command& bag, Arguments& a) {
  const Command publish = bag.command("publish", "Sign a bag and put it where a server hands it out");
  addSigning(publish, a.publish.sign);
  publish.option("--to", a.publish.folder, "The folder that the server hands out").required();
  publish.option("--name", a.publish.name, "The storebag's name; without it the file's, without its ending");
  publish.runs([&a] { a.status = publishCommand(a.publish); });
  const Command diff = bag.command("diff", "Tell what changes when one bag takes the place of another");
  diff.option("old", a.oldBag, "A document, or a bag (.json, .toml or .plist)").required();
  diff.option("new", a.newBag, "A document, or a bag (.json, .toml or .plist)").required();
  diff.runs([&a] { a.status = diffCommand(a.oldBag, a.newBag); });
  const Command probe = bag.command("probe", "Ask a server as the daemon does, and tell what it gets wrong");
  probe.option("url", a.probe.url, "The storebag's address, as https://bags.example.org/bags/tolvar/dulvek")
      .required();
  probe.option("--public-key", a.probe.publicKey, "The public key, instead of the device's");
  probe.option("--ca-file", a.probe.caFile, "Trusted authorities, PEM, instead of the device's");
  probe.runs([&a] { a.status = probeCommand(a.connection.root, a.probe); });

  const Command ring =
      program.command("ring", "Print in which of 100 rings this device is, or set its address");
  ring.option("--identifier", a.ring.identifier, "Of another device, as it reports it").notEmpty();
  ring.option("--set", a.ring.address, "Take storebags from this address from now on; {ring} is the ring")
      .notEmpty();
  ring.ends(kRing);
  ring.runs([&a] { a.status = ringCommand(a.connection.root, a.ring); });
}

void addStorebag(const Command& program, Arguments& a) {
  const Command keys = program.command("keys", "Keys for signing storebags");
  keys.needsCommand();
  const Command make = keys.command("make", "Write private.pem and publicKey.der into a folder");
  make.option("folder", a.folder, "The folder; made when missing, its parent must exist").required();
  make.option("--bits", a.bits, "Length of the key, 2048 to 16384").showsDefault();
  make.runs([&a] { a.status = makeKeysCommand(a.folder, a.bits); });

  const Command bag = program.command("storebag", "Signed configurations");
  bag.needsCommand();
  const Command sign = bag.command("sign", "Sign a bag into the document that servers hand out");
  addSigning(sign, a.sign);
  sign.option("-o,--output", a.sign.output, "The document; - for standard output").required();
  sign.runs([&a] { a.status = signCommand(a.sign); });
  const Command verify = bag.command("verify", "Check a document's signature");
  verify.option("document", a.document, "The document; - for standard input").required();
  verify.option("--public-key", a.publicKey, "The public key, publicKey.der").required();
  verify.runs([&a] { a.status = verifyCommand(a.document, a.publicKey); });
  const Command show =
      bag.command("show", "Print the bag of a document as JSON, and what in it may surprise");
  show.option("document", a.document, "The document; - for standard input").required();
  show.option("--public-key", a.publicKey, "Check the signature with this public key first");
  show.runs([&a] { a.status = showCommand(a.document, a.publicKey); });
  const Command simulate =
      bag.command("simulate", "Tell how many sessions and events of many devices would leave");
  simulate.option("bag", a.simulate.bag, "A document, or a bag (.json, .toml or .plist)").required();
  simulate.option("--events", a.simulate.events, "Sessions and events: steps as kytctl session takes them")
      .required();
  simulate.option("--devices", a.simulate.devices, "How many devices").between(1, 1000000).showsDefault();
  simulate.option("--seed", a.simulate.seed, "The same seed gives the same figures").showsDefault();
  simulate.flag("--json", a.simulate.json, "Print one JSON object");
  simulate.ends(kSimulated);
  simulate.runs([&a] { a.status = simulateCommand(a.connection.root, a.simulate); });
  addRollOut(program, bag, a);
}

void addEvents(const Command& program, Arguments& a) {
  const Command events = program.command("events", "What a program reports, as its events.toml says");
  events.needsCommand();
  const Command check = events.command("check", "Tell what a bag leaves unguarded of it, or does not take");
  check.option("file", a.events.file, "What the program reports, events.toml").required();
  check.option("bag", a.events.bag, "A document, or a bag (.json, .toml or .plist)").required();
  check.flag("--json", a.events.json, "Print one JSON object");
  check.ends(kEventsChecked);
  check.runs([&a] {
    a.unwritten = 2;  // 1 would tell of findings
    a.status = checkEventsCommand(a.events);
  });
  const Command generate = events.command("generate", "Write source code that fills and sends its events");
  generate.option("file", a.generate.file, "What the program reports, events.toml").required();
  generate.option("--lang", a.generate.language, "The language").required().oneOf({"c", "c++", "python"});
  generate.option("-o,--output", a.generate.output, "Where it goes; without it, and with -, standard output");
  generate.runs([&a] { a.status = generateEventsCommand(a.generate); });
  const Command document =
      events.command("document", "Write a page about them for owners and reviewers, in Markdown");
  document.option("file", a.generate.file, "What the program reports, events.toml").required();
  document.option("-o,--output", a.generate.output, "Where it goes; without it, and with -, standard output");
  document.runs([&a] { a.status = documentEventsCommand(a.generate); });
}

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

// Says so, where it is not: who redirects it to a file would take a part for the whole.
bool isOutputWritten() {
  errno = 0;
  if (std::fflush(stdout) == 0 && std::ferror(stdout) == 0) return true;
  const std::string why = errno != 0 ? std::string(": ") + std::strerror(errno) : std::string();
  failed("can't write the output" + why);
  return false;
}

}  // namespace

int main(int argc, char** argv) {
  const CommandLine program("kytctl", "The command for people around kytreportingd");
  Arguments arguments;
  program.option("--root", arguments.connection.root,
                 "A folder that stands in front of every fixed path, as the daemon's --root");
  program.needsCommand();
  program.takesOptionsAnywhere();
  addSend(program, arguments);
  addListen(program, arguments);
  addExplain(program, arguments);
  addDefaults(program, arguments);
  addOwner(program, arguments);
  addEntitlements(program, arguments);
  addStorebag(program, arguments);
  addEvents(program, arguments);
  addWindow(program, arguments);
  addOutbox(program, arguments);
  const std::optional<int> ended = program.parse(argc, argv);
  const int status = ended.value_or(arguments.status);
  return isOutputWritten() ? status : std::max(status, arguments.unwritten);
}
