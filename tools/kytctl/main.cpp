// kytctl: the command for people: sends events, reads and writes user defaults, grants and withdraws the
// consent, shows and erases what is known of the owner, makes keys, signs and checks storebags, and shows how the running
// daemon stands.
#include <tuple>

#include "platform/linux/cli/CommandLine.h"
#include "tools/kytctl/Commands.h"

namespace {

using namespace kyt::tools;

struct Arguments {
  ConnectionOptions connection;
  SendOptions send;
  SignOptions sign;
  CheckOptions check;
  ExplainOptions explain;
  SimulateOptions simulate;
  std::string script, domain, key, value, type = "string", folder, document, publicKey;
  unsigned bits = 2048;
  std::string level;
  bool json = false;
  int status = 0;
};

constexpr char kFinished[] =
    R"("finished" means that the daemon had a storebag for the client type and has offered the event to its back ends.
It does not mean that the event was sent: no consent, another country, a list, sampling or a server may have stopped
it. The daemon's log and the server tell.)";

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

constexpr char kExplained[] =
    R"(The event is a JSON object as it goes over the wire, or - for standard input:
  {"Category":10,"Type":1,"Payload":{"step":1},"Flag":0}
Nothing is sent and nothing is stored; no daemon needs to run. What servers answer is not known here.
The exit status is 0 when the event leaves, 1 when it does not, and 2 when that cannot be told.)";

constexpr char kSimulated[] =
    R"(Besides the steps of kytctl session there is one that says what devices there are, with weights:
  {"do":"devices","countries":{"DE":3,"unknown":1},"families":{"Phone":1},"models":{"P1":1},"consent":0.8}
and "perDay" of a step "open" is how many such sessions a device has each day. What is not said is what the bag
names, in equal shares, and one that it does not name; the consent is given then.)";

void addConnectionOptions(CLI::App& command, Arguments& arguments) {
  command.add_option("--socket", arguments.connection.socket,
                     "The daemon's socket, instead of the fixed one");
  command.add_option("--timeout", arguments.connection.timeoutSeconds, "Seconds to wait for the daemon")
      ->check(CLI::Range(0.1, 3600.0));
}

void addSend(CLI::App& app, Arguments& a) {
  CLI::App* send = app.add_subcommand("send", "Send one event without a session of its own");
  addConnectionOptions(*send, a);
  send->add_option("--client-type", a.send.clientType, "The client type, 0 to 23")
      ->required()
      ->check(CLI::Range(0, 23));
  send->add_option("--session-id", a.send.sessionID, "The session ID, 32 bits");
  send->add_option("--client-version", a.send.clientVersion, "The client version, 16 bits");
  send->add_option("--category", a.send.category, "The event's category (method)")->required();
  send->add_option("--type", a.send.type, "The event's type (response code)")->required();
  send->add_option("--payload", a.send.payloadJSON, "A JSON object");
  send->add_option("--user-info", a.send.userInfoJSON,
                   "A JSON object; ClientName and ServiceName choose the client entry");
  send->add_flag("--require-user-info", a.send.requireUserInfo, "The session promises user information");
  send->footer(kFinished);
  send->callback([&a] { a.status = sendCommand(a.connection, a.send); });

  CLI::App* session =
      app.add_subcommand("session", "Run a scripted session: one JSON object a line (kytctl session --help)");
  addConnectionOptions(*session, a);
  session->add_option("script", a.script, "A file, or - for standard input")->required();
  session->footer(kSessionSteps);
  session->callback([&a] { a.status = sessionCommand(a.connection, a.script); });
}

void addExplain(CLI::App& app, Arguments& a) {
  CLI::App* explain = app.add_subcommand("explain", "Tell what becomes of an event on this device, and why");
  ExplainOptions& o = a.explain;
  explain->add_option("event", o.event, "A JSON object, or - for standard input")->required();
  CLI::Option* information = explain->add_option("--session-info", o.sessionInfoJSON,
                                                 "The session's information, a JSON object, as it is sent");
  for (CLI::Option* part :
       {explain->add_option("--client-type", o.clientType, "The client type, 0 to 23"),
        explain->add_option("--session-id", o.sessionID, "The session ID, 32 bits"),
        explain->add_option("--client-version", o.clientVersion, "The client version, 16 bits"),
        explain->add_flag("--require-user-info", o.requireUserInfo, "The session promises user information"),
        explain->add_flag("--batch", o.batch, "The session batches its events")})
    part->excludes(information);
  CLI::Option* userInfo =
      explain->add_option("--user-info", o.userInfoJSON, "The user information, a JSON object");
  explain->add_option("--client", o.client, "The client's name in the user information")->excludes(userInfo);
  explain->add_option("--service", o.service, "The service's name in the user information")
      ->excludes(userInfo);
  explain->add_flag("--single", o.single, "A single message, without a session");
  explain->add_option("--storebag", o.storebag,
                      "A document, or a bag not signed yet (.json, .toml, .plist), instead of the server's");
  CLI::Option* pid = explain->add_option("--pid", o.program.pid, "The program, a process")
                         ->check(CLI::Range(1, std::numeric_limits<int32_t>::max()));
  explain->add_option("--user", o.program.user, "Any process of a user instead; your own without either")
      ->excludes(pid);
  explain->add_option("--draw", o.draw, "The session's sampling draw, 0 to 1; all are tried without")
      ->check(CLI::Range(0.0, 1.0));
  explain->add_flag("--json", o.json, "Print one JSON object");
  explain->footer(kExplained);
  explain->callback([&a] { a.status = explainCommand(a.connection.root, a.explain); });
}

void addDefaults(CLI::App& app, Arguments& a) {
  CLI::App* defaults = app.add_subcommand("defaults", "User defaults by domain and key");
  defaults->require_subcommand(1);
  CLI::App* read = defaults->add_subcommand("read", "Print a value, or all of a domain");
  read->add_option("domain", a.domain, "The domain, as com.vantu.kytreporting")->required();
  read->add_option("key", a.key, "The key; without one all are printed");
  read->callback([&a] { a.status = defaultsReadCommand(a.connection.root, a.domain, a.key); });
  CLI::App* write = defaults->add_subcommand("write", "Store a value");
  write->add_option("domain", a.domain, "The domain, as com.vantu.kytreporting")->required();
  write->add_option("key", a.key, "The key")->required();
  write->add_option("value", a.value, "The value; put -- before one that begins with a minus sign")
      ->required();
  write->add_option("--type", a.type, "What the value is")
      ->check(CLI::IsMember({"string", "integer", "real", "boolean"}))
      ->capture_default_str();
  write->callback(
      [&a] { a.status = defaultsWriteCommand(a.connection.root, a.domain, a.key, a.type, a.value); });
  CLI::App* erase = defaults->add_subcommand("delete", "Remove a value");
  erase->add_option("domain", a.domain, "The domain, as com.vantu.kytreporting")->required();
  erase->add_option("key", a.key, "The key")->required();
  erase->callback(
      [&a] { a.status = defaultsWriteCommand(a.connection.root, a.domain, a.key, a.type, std::nullopt); });

  CLI::App* consent = app.add_subcommand("consent", "The owner's consent to diagnostics-and-usage upload");
  consent->require_subcommand(1);
  const std::pair<const char*, const char*> changes[] = {
      {"show", "Print whether it is given"}, {"grant", "Give it"}, {"withdraw", "Take it back"}};
  for (const auto& [change, what] : changes)
    consent->add_subcommand(change, what)->callback([&a, change = change] {
      a.status = consentCommand(a.connection.root, change);
    });
}

void addOwner(CLI::App& app, Arguments& a) {
  CLI::App* owner = app.add_subcommand("owner", "What left the device, for its owner");
  owner->require_subcommand(1);
  CLI::App* show =
      owner->add_subcommand("show", "Print what left in the last day, identifiers, and what waits");
  show->add_flag("--json", a.json, "As one JSON object");
  show->callback([&a] { a.status = ownerShowCommand(a.connection.root, a.json); });
  CLI::App* take =
      owner->add_subcommand("export", "Write all that is kept about it on the device into a file");
  take->add_option("file", a.document, "The file, JSON; - for standard output")->required();
  take->callback([&a] { a.status = ownerExportCommand(a.connection.root, a.document); });
  CLI::App* erase = owner->add_subcommand("erase", "Erase identifiers, local logs and what waits");
  erase->callback([&a] { a.status = ownerEraseCommand(a.connection.root); });
}

void addEntitlements(CLI::App& app, Arguments& a) {
  CLI::App* entitlements = app.add_subcommand("entitlements", "Who may connect");
  entitlements->require_subcommand(1);
  CLI::App* check = entitlements->add_subcommand("check", "Tell why a client is served or refused");
  CLI::Option* pid = check->add_option("--pid", a.check.pid, "A process")
                         ->check(CLI::Range(1, std::numeric_limits<int32_t>::max()));
  check->add_option("--user", a.check.user, "Any process of a user, by name or number")->excludes(pid);
  check->callback([&a] { a.status = entitlementsCheckCommand(a.connection.root, a.check); });
}

void addStorebag(CLI::App& app, Arguments& a) {
  CLI::App* keys = app.add_subcommand("keys", "Keys for signing storebags");
  keys->require_subcommand(1);
  CLI::App* make = keys->add_subcommand("make", "Write private.pem and publicKey.der into a folder");
  make->add_option("folder", a.folder, "The folder; made when missing, its parent must exist")->required();
  make->add_option("--bits", a.bits, "Length of the key, 2048 to 16384")->capture_default_str();
  make->callback([&a] { a.status = makeKeysCommand(a.folder, a.bits); });

  CLI::App* bag = app.add_subcommand("storebag", "Signed configurations");
  bag->require_subcommand(1);
  CLI::App* sign = bag->add_subcommand("sign", "Sign a bag into the document that servers hand out");
  sign->add_option("bag", a.sign.bag, "FILE.json, FILE.toml or FILE.plist")->required();
  sign->add_option("--key", a.sign.key, "The private key, PEM")->required();
  sign->add_option("-o,--output", a.sign.output, "The document; - for standard output")->required();
  sign->callback([&a] { a.status = signCommand(a.sign); });
  CLI::App* verify = bag->add_subcommand("verify", "Check a document's signature");
  verify->add_option("document", a.document, "The document; - for standard input")->required();
  verify->add_option("--public-key", a.publicKey, "The public key, publicKey.der")->required();
  verify->callback([&a] { a.status = verifyCommand(a.document, a.publicKey); });
  CLI::App* show =
      bag->add_subcommand("show", "Print the bag of a document as JSON, and what in it may surprise");
  show->add_option("document", a.document, "The document; - for standard input")->required();
  show->add_option("--public-key", a.publicKey, "Check the signature with this public key first");
  show->callback([&a] { a.status = showCommand(a.document, a.publicKey); });
  CLI::App* simulate =
      bag->add_subcommand("simulate", "Tell how many sessions and events of many devices would leave");
  simulate->add_option("bag", a.simulate.bag, "A document, or a bag (.json, .toml or .plist)")->required();
  simulate
      ->add_option("--events", a.simulate.events, "Sessions and events: steps as kytctl session takes them")
      ->required();
  simulate->add_option("--devices", a.simulate.devices, "How many devices")
      ->check(CLI::Range(1, 1000000))
      ->capture_default_str();
  simulate->add_option("--seed", a.simulate.seed, "The same seed gives the same figures")
      ->capture_default_str();
  simulate->add_flag("--json", a.simulate.json, "Print one JSON object");
  simulate->footer(kSimulated);
  simulate->callback([&a] { a.status = simulateCommand(a.connection.root, a.simulate); });
}

void addWindow(CLI::App& app, Arguments& a) {
  using Command = int (*)(const std::string&, bool);
  const std::tuple<const char*, const char*, Command> commands[] = {
      {"status", "Print how the running daemon stands: what left, what is lost and why", statusCommand},
      {"sessions", "Print the sessions of the running daemon and the states of their back ends",
       sessionsCommand},
      {"books", "Print what became of each program's events", booksCommand},
      {"storebags", "Print which storebags are in force", storebagsCommand},
      {"metrics", "Print the figures in the OpenMetrics text format", metricsCommand},
      {"reload", "Let the running daemon take up changed settings", reloadCommand}};
  for (const auto& [name, what, run] : commands) {
    CLI::App* command = app.add_subcommand(name, what);
    command->add_flag("--json", a.json, "Print one JSON object");
    command->callback([&a, run = run] { a.status = run(a.connection.root, a.json); });
  }
  CLI::App* level =
      app.add_subcommand("log-level", "Print or set from which level on the running daemon logs lines");
  level->add_option("level", a.level, "The new level, until the daemon ends")
      ->check(CLI::IsMember({"debug", "default", "error"}));
  level->add_flag("--json", a.json, "Print one JSON object");
  level->callback([&a] { a.status = logLevelCommand(a.connection.root, a.level, a.json); });
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app("The command for people around kytreportingd", "kytctl");
  kyt::addCommonOptions(app);
  Arguments arguments;
  app.add_option("--root", arguments.connection.root,
                 "A folder that stands in front of every fixed path, as the daemon's --root");
  app.require_subcommand(1);
  app.fallthrough();
  addSend(app, arguments);
  addExplain(app, arguments);
  addDefaults(app, arguments);
  addOwner(app, arguments);
  addEntitlements(app, arguments);
  addStorebag(app, arguments);
  addWindow(app, arguments);
  if (const auto status = kyt::parseCommandLine(app, argc, argv)) return *status;
  return arguments.status;
}
