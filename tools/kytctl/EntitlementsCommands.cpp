// Why a client is served or refused: the files and grants of entitlements.d, matched as the daemon matches them and told
// criterion by criterion. Run by root it reads the files as the daemon's user, so that what that user cannot read counts
// for nothing here too.
#include <grp.h>
#include <pwd.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <string_view>

#include "platform/base/Counters.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/base/LinuxClock.h"
#include "platform/linux/entitlements/EntitlementMatch.h"
#include "platform/linux/entitlements/TomlEntitlements.h"
#include "platform/linux/service/LogSinks.h"
#include "platform/objects/Keys.h"
#include "platform/queues/Log.h"
#include "tools/kytctl/Commands.h"
#include "tools/kytctl/EntitlementClient.h"

namespace kyt::tools {

namespace {

constexpr int kGranted = 0, kRefused = 1, kCannotTell = 2;

// What is told, line by line.
class Lines {
 public:
  explicit Lines(std::vector<std::string>& lines) : lines_(lines) {}
  __attribute__((format(printf, 2, 3))) void say(const char* format, ...) {
    va_list arguments;
    va_start(arguments, format);
    char text[4096];
    std::vsnprintf(text, sizeof text, format, arguments);
    va_end(arguments);
    lines_.emplace_back(text);
  }
  int cannotTell(const std::string& why) {
    say("cannot tell: %s", why.c_str());
    return kCannotTell;
  }

 private:
  std::vector<std::string>& lines_;
};

void sayClient(Lines& out, const EntitlementClient& client) {
  if (client.isProcess)
    out.say("process %d runs %s", client.peer.pid,
            client.program.empty() ? "a program that may not be looked at" : client.program.c_str());
  if (client.file) out.say("any process that runs %s", client.program.c_str());
  out.say("user %s, groups %s", userText(client.peer.uid).c_str(), client.groupsText().c_str());
  if (!client.peer.securityLabel.empty()) out.say("security label %s", client.peer.securityLabel.c_str());
}

// ---- The daemon's user.

struct DaemonUser {
  std::string name;
  uid_t user;
  gid_t group;
};

// While it exists root reads files as the daemon's user does.
class AsDaemon {
 public:
  explicit AsDaemon(const std::optional<DaemonUser>& daemon) {
    if (::geteuid() != 0 || !daemon || daemon->user == 0) return;
    groups_.resize(static_cast<size_t>(std::max(0, ::getgroups(0, nullptr))));
    if (::getgroups(static_cast<int>(groups_.size()), groups_.data()) < 0) return;
    changed_ = ::initgroups(daemon->name.c_str(), daemon->group) == 0 && ::setegid(daemon->group) == 0 &&
               ::seteuid(daemon->user) == 0;
  }
  ~AsDaemon() {
    if (!changed_) return;
    if (::seteuid(0) != 0 || ::setegid(0) != 0 || ::setgroups(groups_.size(), groups_.data()) != 0)
      ::_exit(kCannotTell);
  }
  AsDaemon(const AsDaemon&) = delete;
  AsDaemon& operator=(const AsDaemon&) = delete;

 private:
  std::vector<gid_t> groups_;
  bool changed_ = false;
};

// The daemon asks a helper that may look at every process; here that is root, when this is run by root. Where a program file
// was named, every process runs that.
class OwnInspector final : public ProgramInspector {
 public:
  explicit OwnInspector(std::optional<ProgramIdentity> file) : file_(file) {}
  std::variant<ProgramIdentity, int> runningProgram(int32_t pid) override {
    if (file_) return *file_;
    const uid_t user = ::geteuid();
    const bool root = ::getuid() == 0 && user != 0 && ::seteuid(0) == 0;
    auto program = direct_.runningProgram(pid);
    if (root && ::seteuid(user) != 0) ::_exit(kCannotTell);
    return program;
  }
  std::string programPath(int32_t pid) override { return direct_.programPath(pid); }

 private:
  const std::optional<ProgramIdentity> file_;
  DirectProgramInspector direct_;
};

// Who owns the daemon's state.
std::optional<DaemonUser> daemonUser(const std::string& root) {
  struct stat status = {};
  for (const char* folder : {"/var/lib/kytreportingd/defaults", "/var/lib/kytreportingd"})
    if (::stat((root + folder).c_str(), &status) == 0) {
      const passwd* const entry = ::getpwuid(status.st_uid);
      if (entry != nullptr) return DaemonUser{entry->pw_name, entry->pw_uid, entry->pw_gid};
    }
  return std::nullopt;
}

// ---- The grants.

std::string text(const NameOrNumber& who) {
  const auto* const name = std::get_if<std::string>(&who);
  return name != nullptr ? "\"" + *name + "\"" : std::to_string(std::get<int64_t>(who));
}

std::string text(const ProgramIdentity& program) {
  return "device " + std::to_string(major(program.device)) + ":" + std::to_string(minor(program.device)) +
         ", inode " + std::to_string(program.inode);
}

std::string text(const Value& value) {
  if (value.kind() == Value::Kind::boolean) return value.boolValue() ? "true" : "false";
  return description(value);
}

enum class Answer : uint8_t { matches, unknown, differs };  // of several the last counts

class Check {
 public:
  Check(Lines& lines, const EntitlementClient& client, bool servicesView, ProgramInspector& inspector)
      : out_(lines), client_(client), servicesView_(servicesView), match_(client.peer, inspector, numbers_) {}

  // Tells each criterion; all of them, so that a second fault is seen before the first is mended.
  Answer grant(const EntitlementGrant& grant) {
    answer_ = Answer::matches;
    if (grant.user)
      tell("user " + text(*grant.user), match_.isUser(*grant.user),
           numbers_.user(*grant.user) ? "the client is " + userText(client_.peer.uid)
                                      : "there is no such user");
    if (grant.user) noteDigits("user", *grant.user);
    if (grant.group)
      tell("group " + text(*grant.group), match_.isMember(*grant.group),
           numbers_.group(*grant.group) ? "the client is in " + client_.groupsText()
                                        : "there is no such group");
    if (grant.group) noteDigits("group", *grant.group);
    if (grant.securityLabel) label(*grant.securityLabel);
    if (grant.executable) executable(*grant.executable);
    return answer_;
  }

 private:
  void tell(const std::string& criterion, Answer answer, const std::string& why) {
    const char* const verb = answer == Answer::matches   ? "matches"
                             : answer == Answer::differs ? "does not match"
                                                         : "cannot be judged";
    out_.say("    %s: %s%s%s", criterion.c_str(), verb, why.empty() ? "" : ": ", why.c_str());
    answer_ = std::max(answer_, answer);
  }
  void tell(const std::string& criterion, bool matches, const std::string& why) {
    tell(criterion, matches ? Answer::matches : Answer::differs, matches ? "" : why);
  }

  void label(const std::string& wanted) {
    const std::string criterion = "security_label \"" + wanted + "\"";
    if (!client_.isProcess) return tell(criterion, Answer::unknown, "it depends on the process");
    const std::string& own = client_.peer.securityLabel;
    tell(criterion, match_.hasLabel(wanted),
         own.empty() ? "the client has none" : "the client's is \"" + own + "\"");
  }

  void executable(const std::string& wanted) {
    using Program = EntitlementMatch::Program;
    const std::string criterion = "executable \"" + wanted + "\"";
    if (!client_.isProcess && !client_.file)
      return tell(criterion, Answer::unknown, "it depends on the process");
    const auto result = match_.runs(wanted);
    switch (result.program) {
      case Program::matches:
        tell(criterion, Answer::matches, text(result.running));
        break;
      case Program::otherProgram:
        tell(criterion, Answer::differs, otherProgram(result));
        break;
      case Program::missing:
        tell(criterion, Answer::differs,
             "the daemon's user cannot see that file (" + errorText(result.error) + ")");
        break;
      case Program::processEnded:
        tell(criterion, Answer::unknown, "the process has ended");
        break;
      case Program::unknown:
        if (result.error == 0)
          tell(criterion, Answer::differs,
               "the kernel does not tell the daemon which process is connected (Linux 6.5 does)");
        else
          tell(criterion, Answer::unknown, errorText(result.error) + " (run this as root)");
        break;
    }
    noteHidden(wanted);
  }

  [[nodiscard]] std::string otherProgram(const EntitlementMatch::ProgramResult& result) const {
    const bool replaced = client_.program.ends_with(" (deleted)");
    return "the client runs " + (client_.program.empty() ? "another file" : client_.program) + " (" +
           text(result.running) + "), this is " + text(result.wanted) +
           (replaced ? ". The client's file was replaced or removed since it was started: start it again"
                     : "");
  }

  // A number in quotes is a name, which hardly anybody has.
  void noteDigits(const char* key, const NameOrNumber& who) const {
    const auto* const name = std::get_if<std::string>(&who);
    if (name == nullptr || name->find_first_not_of("0123456789") != std::string::npos) return;
    out_.say("      warning: \"%s\" in quotes is a name; a number is written without: %s = %s", name->c_str(),
             key, name->c_str());
  }

  void noteHidden(const std::string& path) const {
    if (!servicesView_) return;
    for (const char* hidden : {"/home", "/root", "/run/user", "/tmp", "/var/tmp"})
      if (path.starts_with(std::string(hidden) + "/"))
        out_.say(
            "      note: as a service (kytreportingd.service) the daemon does not see %s, and this never matches",
            hidden);
  }

  Lines& out_;
  const EntitlementClient& client_;
  const bool servicesView_;
  AccountNumbers numbers_;
  EntitlementMatch match_;
  Answer answer_ = Answer::matches;
};

// What the files say together.
struct Outcome {
  bool mayBeGranted = false;  // something that counts could not be judged or read
};

void checkGrants(Lines& out, const EntitlementsFile& file, Check& check, Outcome& outcome) {
  for (const EntitlementGrant& grant : file.grants) {
    const auto value = grant.values.find(kEntitlement);
    if (value == grant.values.end()) {
      out.say("  line %u: grants other entitlements only", grant.line);
      continue;
    }
    out.say("  line %u: %s = %s", grant.line, std::string(kEntitlement).c_str(), text(value->second).c_str());
    const Answer answer = check.grant(grant);
    const bool grants = value->second.boolValue();
    outcome.mayBeGranted |= answer == Answer::unknown && grants;
    out.say("    so it %s", answer == Answer::unknown   ? "cannot be judged"
                            : answer == Answer::differs ? "does not match"
                            : grants                    ? "matches, and grants it"
                                                        : "matches, and that value is no");
  }
}

void checkFile(Lines& out, const EntitlementsFile& file, Check& check, Outcome& outcome) {
  out.say("%s", file.path.c_str());
  for (const TomlError& problem : file.problems) out.say("  %s", problem.text.c_str());
  if (file.ignored && file.identity.exists())
    out.say("  its mode is %04o, its owner %s", file.identity.mode & 07777U,
            userText(file.identity.owner).c_str());
  if (!file.ignored && file.grants.empty()) out.say("  has no grant");
  checkGrants(out, file, check, outcome);
}

class NoSink final : public LogSink {
 public:
  void write(LogLevel /*level*/, std::string_view /*line*/) override {}
};

// As the daemon answers it.
bool isGranted(const TomlEntitlementsOptions& options, const PeerCredentials& peer,
               ProgramInspector& inspector) {
  NoSink sink;
  Log log(sink);
  Counters counters;
  const LinuxClock clock;
  TomlEntitlements entitlements(options, inspector, log, counters, clock);
  return entitlements.valueFor(peer, kEntitlement).boolValue();
}

int verdict(Lines& out, bool granted, bool mayBeGranted, const EntitlementClient& client) {
  if (client.hasEnded()) return out.cannotTell("the process has ended meanwhile");
  if (granted) {
    out.say("granted: this client is served");
    return kGranted;
  }
  if (mayBeGranted) return out.cannotTell("it depends on what could not be judged above");
  out.say("refused: no grant matches");
  return kRefused;
}

}  // namespace

int checkEntitlement(const std::string& root, const CheckOptions& options, std::vector<std::string>& lines) {
  Lines out(lines);
  auto found = options.pid != 0          ? EntitlementClient::ofProcess(options.pid)
               : options.program.empty() ? EntitlementClient::ofUser(options.user)
                                         : EntitlementClient::ofProgram(options.program, options.user);
  if (const auto* wrong = std::get_if<std::string>(&found)) return out.cannotTell(*wrong);
  const EntitlementClient& client = std::get<EntitlementClient>(found);
  sayClient(out, client);

  const auto daemon = daemonUser(root);
  TomlEntitlementsOptions files{root + "/etc/kytreportingd/entitlements.d", std::nullopt};
  if (!root.empty()) files.trustedUser = daemon ? daemon->user : ::geteuid();
  OwnInspector inspector(client.file);
  bool granted = false;
  Outcome outcome;
  {
    const AsDaemon view(daemon);
    const bool isDaemonsView = daemon && daemon->user == ::geteuid();
    if (isDaemonsView) out.say("files are read as the daemon's user, %s", userText(::geteuid()).c_str());
    const EntitlementsListing listing = entitlementsFiles(files.folder);
    if (listing.error != 0) {
      out.say("%s: %s", files.folder.c_str(), errorText(listing.error).c_str());
      outcome.mayBeGranted = listing.error != ENOENT && !isDaemonsView;
    }
    Check check(out, client, root.empty(), inspector);
    for (const std::string& name : listing.names) {
      const EntitlementsFile file = readEntitlementsFile(files.folder + "/" + name, files.trustedUser);
      outcome.mayBeGranted |= file.unreadable && !isDaemonsView;
      checkFile(out, file, check, outcome);
    }
    for (const std::string& name : listing.others) {
      out.say("%s/%s", files.folder.c_str(), name.c_str());
      out.say("  is not read: its name must end in .toml and not begin with a point");
    }
    granted = isGranted(files, client.peer, inspector);
  }
  return verdict(out, granted, outcome.mayBeGranted, client);
}

int entitlementsCheckCommand(const std::string& root, const CheckOptions& options) {
  if (options.user.empty() == (options.pid == 0)) {
    failed("say either --pid or --user");
    return kCannotTell;
  }
  std::vector<std::string> lines;
  const int status = checkEntitlement(root, options, lines);
  for (const std::string& line : lines) std::printf("%s\n", escapedText(line).c_str());
  return status;
}

}  // namespace kyt::tools
