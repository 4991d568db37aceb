#include "platform/linux/system/DeletionBroker.h"

#include <fcntl.h>
#include <grp.h>
#include <linux/capability.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/WorkerPool.h"
#include "platform/linux/system/Capabilities.h"

namespace kyt {
namespace {

constexpr unsigned kChildSeconds = 5;
constexpr int kPatienceMilliseconds = 6000;  // a little more than a child has
constexpr size_t kLongestName = 255;
constexpr int kDescriptors = 3;  // the file, its folder, where the answer goes
constexpr uint32_t kNobody = ~0u;

struct Request {
  uint32_t user, group, groupCount, nameLength;
  uint32_t groups[DeletionBroker::kMaxGroups];
  char name[kLongestName + 1];
};

// ---- In the broker: nothing below allocates or takes a lock.

constexpr CapabilitySet kTakingUsers = capabilitySet(CAP_SETUID) | capabilitySet(CAP_SETGID);

bool mayTakeUsers() {
  return (effectiveCapabilities() & kTakingUsers) == kTakingUsers;
}

// Leaves no capability, whoever this process was and is. 0 or errno.
int become(const Request& request) {
  if (request.user == kNobody || request.group == kNobody) return EPERM;
  if (mayTakeUsers()) {
    if (::setgroups(request.groupCount, request.groups) != 0) return errno;
    if (::setresgid(request.group, request.group, request.group) != 0) return errno;
    if (::setresuid(request.user, request.user, request.user) != 0) return errno;
  }
  uid_t real = 0, effective = 0, saved = 0;
  if (::getresuid(&real, &effective, &saved) != 0) return errno;
  if (real != request.user || effective != request.user || saved != request.user) return EPERM;
  return keepCapabilities(0);
}

bool isName(const Request& request) {
  if (request.nameLength == 0 || request.nameLength > kLongestName) return false;
  if (::memchr(request.name, '/', request.nameLength) != nullptr) return false;
  if (::memchr(request.name, '\0', request.nameLength) != nullptr) return false;
  return ::strcmp(request.name, ".") != 0 && ::strcmp(request.name, "..") != 0;
}

int removeFile(const Request& request, int file, int folder) {
  if (!isName(request)) return EINVAL;
  if (const int error = become(request)) return error;
  struct stat opened = {}, named = {};
  if (::fstat(file, &opened) != 0) return errno;
  if (!S_ISREG(opened.st_mode)) return EINVAL;
  if (::fstatat(folder, request.name, &named, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  if (named.st_dev != opened.st_dev || named.st_ino != opened.st_ino) return ESTALE;
  return ::unlinkat(folder, request.name, 0) == 0 ? 0 : errno;
}

struct Received {
  ssize_t bytes = -1;
  int descriptors[kDescriptors] = {-1, -1, -1};
  bool whole = false;
};

Received receive(int socket, Request& request) {
  alignas(cmsghdr) char control[CMSG_SPACE(kDescriptors * sizeof(int))];
  iovec part = {&request, sizeof request};
  msghdr message = {};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  message.msg_control = control;
  message.msg_controllen = sizeof control;
  Received received;
  received.bytes = ::recvmsg(socket, &message, MSG_CMSG_CLOEXEC);
  if (received.bytes <= 0) return received;
  const cmsghdr* header = CMSG_FIRSTHDR(&message);
  if (header == nullptr || header->cmsg_type != SCM_RIGHTS) return received;
  const size_t count = (header->cmsg_len - CMSG_LEN(0)) / sizeof(int);
  std::memcpy(received.descriptors, CMSG_DATA(header), count * sizeof(int));
  received.whole = count == kDescriptors && received.bytes == sizeof request &&
                   (message.msg_flags & (MSG_TRUNC | MSG_CTRUNC)) == 0 &&
                   request.groupCount <= DeletionBroker::kMaxGroups && request.nameLength <= kLongestName;
  request.name[kLongestName] = '\0';
  return received;
}

void serve(int socket) {
  ::signal(SIGCHLD, SIG_IGN);  // children leave nothing behind
  ::signal(SIGALRM, SIG_DFL);
  sigset_t none;
  ::sigemptyset(&none);
  ::sigprocmask(SIG_SETMASK, &none, nullptr);
  if (::chdir("/") != 0 || keepCapabilities(kTakingUsers) != 0) ::_exit(1);
  static Request request;
  while (true) {
    request = {};
    const Received received = receive(socket, request);
    if (received.bytes < 0 && errno == EINTR) continue;
    if (received.bytes <= 0) ::_exit(0);
    if (received.whole && ::fork() == 0) {
      ::alarm(kChildSeconds);
      const int32_t result = removeFile(request, received.descriptors[0], received.descriptors[1]);
      (void)::send(received.descriptors[2], &result, sizeof result, MSG_NOSIGNAL);
      ::_exit(0);
    }
    for (const int descriptor : received.descriptors)
      if (descriptor >= 0) ::close(descriptor);
  }
}

// ---- In the daemon.

bool sendRequest(int socket, const Request& request, const int (&descriptors)[kDescriptors]) {
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof descriptors)] = {};
  iovec part = {const_cast<Request*>(&request), sizeof request};
  msghdr message = {};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  message.msg_control = control;
  message.msg_controllen = sizeof control;
  cmsghdr* header = CMSG_FIRSTHDR(&message);
  header->cmsg_level = SOL_SOCKET;
  header->cmsg_type = SCM_RIGHTS;
  header->cmsg_len = CMSG_LEN(sizeof descriptors);
  std::memcpy(CMSG_DATA(header), descriptors, sizeof descriptors);
  return ::sendmsg(socket, &message, MSG_NOSIGNAL) == static_cast<ssize_t>(sizeof request);
}

int awaitAnswer(int socket) {
  pollfd answer = {socket, POLLIN, 0};
  const BlockingScope blocking;
  const int ready = ::poll(&answer, 1, kPatienceMilliseconds);
  if (ready == 0) return ETIMEDOUT;
  int32_t result = 0;
  // The end of the stream: the child was ended by its alarm, or there is no broker.
  if (ready < 0 || ::recv(socket, &result, sizeof result, 0) != sizeof result) return EIO;
  return result;
}

}  // namespace

std::variant<std::unique_ptr<DeletionBroker>, std::string> DeletionBroker::start() {
  auto process = HelperProcess::start("kyt-broker", serve);
  if (auto* const problem = std::get_if<std::string>(&process)) return std::move(*problem);
  return std::unique_ptr<DeletionBroker>(
      new DeletionBroker(std::get<std::unique_ptr<HelperProcess>>(std::move(process))));
}

int DeletionBroker::remove(int file, int folder, std::string_view name, const PeerIdentity& peer) const {
  if (file < 0 || folder < 0) return EBADF;
  if (name.empty() || name.size() > kLongestName || peer.groups.size() > kMaxGroups) return EINVAL;
  const auto request = std::make_unique<Request>();
  request->user = peer.user;
  request->group = peer.group;
  request->groupCount = static_cast<uint32_t>(peer.groups.size());
  request->nameLength = static_cast<uint32_t>(name.size());
  if (!peer.groups.empty())
    std::memcpy(request->groups, peer.groups.data(), peer.groups.size() * sizeof(uint32_t));
  name.copy(request->name, name.size());

  int ends[2];
  if (::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends) != 0) return errno;
  const FileHandle mine(ends[0]);
  {
    const FileHandle theirs(ends[1]);
    if (!sendRequest(process_->socket(), *request, {file, folder, theirs.get()}))
      return errno != 0 ? errno : EIO;
  }
  return awaitAnswer(mine.get());
}

}  // namespace kyt
