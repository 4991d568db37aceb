// The command lines of kytctl send, session, listen, explain and events.
#include <cstdint>
#include <limits>

#include "tools/kytctl/Arguments.h"

namespace kyt::tools {

namespace {

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

constexpr char kEventsChecked[] =
    R"(Findings are lines FILE:LINE: KIND: TEXT. The kinds: personal-unfiltered, category-refused, category-0, not-posted,
replaced, client-not-listed. Consent, countries, devices and sampling are not looked at: kytctl storebag simulate does.
The exit status is 0 without findings, 1 with some, and 2 when the file or the bag cannot be read.)";

void addConnectionOptions(const Command& command, Arguments& arguments) {
  command.option("--socket", arguments.connection.socket, "The daemon's socket, instead of the fixed one");
  command.option("--timeout", arguments.connection.timeoutSeconds, "Seconds to wait for the daemon")
      .between(0.1, 3600.0);
}

}  // namespace

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

}  // namespace kyt::tools
