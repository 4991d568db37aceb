#include "tools/kytctl/EntitlementClient.h"

#include <grp.h>
#include <poll.h>
#include <pwd.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <fstream>
#include <sstream>
#include <vector>

#include "platform/linux/base/UnixSocket.h"
#include "platform/linux/entitlements/EntitlementMatch.h"

namespace kyt::tools {
namespace {

std::string named(const std::string& name, uint32_t number) {
  return name.empty() ? std::to_string(number) : name + " (" + std::to_string(number) + ")";
}
std::string groupText(uint32_t number) {
  const group* const entry = ::getgrgid(number);
  return named(entry == nullptr ? "" : entry->gr_name, number);
}

std::string labelOf(const std::string& folder) {
  std::ifstream file(folder + "/attr/current", std::ios::binary);
  std::string label;
  std::getline(file, label);
  return label.substr(0, label.find('\0'));
}

bool readStatus(const std::string& folder, PeerCredentials& peer) {
  std::ifstream status(folder + "/status");
  int found = 0;
  for (std::string line; std::getline(status, line);) {
    std::istringstream words(line);
    std::string key;
    uint32_t real = 0, number = 0;
    words >> key;
    if (key == "Uid:" && words >> real >> peer.uid) ++found;
    if (key == "Gid:" && words >> real >> peer.gid) ++found;
    if (key != "Groups:") continue;
    while (words >> number) peer.groups.push_back(number);
    ++found;
  }
  return found == 3;
}

Descriptor openProcess(int32_t pid) {
  return ownDescriptor(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
}

}  // namespace

std::string userText(uint32_t number) {
  const passwd* const entry = ::getpwuid(number);
  return named(entry == nullptr ? "" : entry->pw_name, number);
}

// The descriptor comes first: alive in the end means that the number stood for this process all the time.
std::variant<EntitlementClient, std::string> EntitlementClient::ofProcess(int32_t pid) {
  EntitlementClient client;
  client.isProcess = true;
  client.process = openProcess(pid);
  if (client.process.get() < 0)
    return errno == ESRCH ? "there is no process " + std::to_string(pid) : errorText(errno);
  if (kernelTellsPeerProcess()) client.peer.pidfd = openProcess(pid);
  const std::string folder = "/proc/" + std::to_string(pid);
  client.peer.pid = pid;
  if (!readStatus(folder, client.peer)) return "process " + std::to_string(pid) + " cannot be looked at";
  client.peer.securityLabel = labelOf(folder);
  char target[4096];
  const ssize_t length = ::readlink((folder + "/exe").c_str(), target, sizeof target);
  if (length > 0) client.program.assign(target, static_cast<size_t>(length));
  return client;
}

std::variant<EntitlementClient, std::string> EntitlementClient::ofUser(const std::string& text) {
  int64_t number = 0;
  const auto parsed = std::from_chars(text.data(), text.data() + text.size(), number);
  const bool isNumber = parsed.ec == std::errc() && parsed.ptr == text.data() + text.size();
  const auto user = AccountNumbers().user(isNumber ? NameOrNumber(number) : NameOrNumber(text));
  if (!user) return "there is no user \"" + text + "\"";
  EntitlementClient client;
  client.peer.uid = client.peer.gid = *user;
  const passwd* const entry = ::getpwuid(*user);
  if (entry == nullptr) return client;
  client.peer.gid = entry->pw_gid;
  std::vector<gid_t> groups(65536);
  int count = static_cast<int>(groups.size());
  if (::getgrouplist(entry->pw_name, entry->pw_gid, groups.data(), &count) >= 0)
    client.peer.groups.assign(groups.begin(), groups.begin() + count);
  return client;
}

// What stands for the process is this one, which lives until all is told.
std::variant<EntitlementClient, std::string> EntitlementClient::ofProgram(const std::string& path,
                                                                          const std::string& user) {
  auto found = ofUser(user);
  auto* client = std::get_if<EntitlementClient>(&found);
  if (client == nullptr) return found;
  struct stat status = {};
  if (::stat(path.c_str(), &status) != 0) return path + ": " + errorText(errno);
  if (!S_ISREG(status.st_mode)) return path + " is no program file";
  client->file = ProgramIdentity{status.st_dev, status.st_ino};
  client->program = path;
  client->peer.pid = ::getpid();
  if (kernelTellsPeerProcess()) client->peer.pidfd = openProcess(client->peer.pid);
  return found;
}

bool EntitlementClient::hasEnded() const {
  pollfd wanted = {process.get(), POLLIN, 0};
  return isProcess && process.get() >= 0 && ::poll(&wanted, 1, 0) != 0;
}

std::string EntitlementClient::groupsText() const {
  std::string text = groupText(peer.gid);
  for (const uint32_t number : peer.groups)
    if (number != peer.gid) text += ", " + groupText(number);
  return text;
}

}  // namespace kyt::tools
