#include "platform/linux/helpers/DeletionBroker.h"

#include <fcntl.h>
#include <grp.h>
#include <linux/capability.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <span>

#include "platform/base/Blocking.h"
#include "platform/linux/confinement/Capabilities.h"

namespace kyt {
namespace {

constexpr time_t kChildSeconds = 5;
constexpr int kPatienceMilliseconds = 6000;  // a little more than a child has
constexpr size_t kLongestName = 255;
constexpr size_t kDescriptors = 3;  // the file, its folder, where the answer goes
constexpr uint32_t kNobody = ~0u;
constexpr size_t kDeepestFolder = 4096;  // no path is as long

struct FolderIdentity {
  dev_t device;
  ino_t inode;
};

struct Request {
  uint32_t user, group, groupCount, nameLength;
  uint32_t groups[DeletionBroker::kMaxGroups];
  char name[kLongestName + 1];
};

// ---- In the broker and its children: nothing below allocates or takes a lock.

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

// Whether somebody opened it for reading. Whoever may only name a file cannot have it removed.
bool isOpenForReading(int file) {
  const int flags = ::fcntl(file, F_GETFL);
  return flags >= 0 && (flags & O_PATH) == 0 && (flags & O_ACCMODE) != O_WRONLY;
}

bool isSame(const struct stat& one, const struct stat& other) {
  return one.st_dev == other.st_dev && one.st_ino == other.st_ino;
}

// 0 when the folder and all above it are none of the daemon's own, in whatever view of the system they were found.
int refusalOf(int folder, std::span<const FolderIdentity> daemonsOwn) {
  if (daemonsOwn.empty()) return 0;
  struct stat status = {}, above = {};
  Descriptor place = ownDescriptor(::openat(folder, ".", O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!place || ::fstat(place.get(), &status) != 0) return errno;
  for (size_t depth = 0; depth < kDeepestFolder; ++depth) {
    for (const FolderIdentity& own : daemonsOwn)
      if (own.device == status.st_dev && own.inode == status.st_ino) return EPERM;
    Descriptor next = ownDescriptor(::openat(place.get(), "..", O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!next || ::fstat(next.get(), &above) != 0) return errno;
    if (isSame(status, above)) return 0;
    place = std::move(next);
    status = above;
  }
  return ELOOP;
}

int removeFile(const Request& request, int file, int folder, std::span<const FolderIdentity> daemonsOwn) {
  if (!isName(request)) return EINVAL;
  if (const int error = become(request)) return error;
  struct stat opened = {}, named = {};
  if (::fstat(file, &opened) != 0) return errno;
  if (!S_ISREG(opened.st_mode)) return EINVAL;
  if (!isOpenForReading(file)) return EBADF;
  if (const int error = refusalOf(folder, daemonsOwn)) return error;
  if (::fstatat(folder, request.name, &named, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  if (!isSame(named, opened)) return ESTALE;
  return ::unlinkat(folder, request.name, 0) == 0 ? 0 : errno;
}

// Whether it was a whole request. Descriptors past those of a request are closed when the process ends.
bool receive(int socket, Request& request, int (&descriptors)[kDescriptors]) {
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof descriptors)];
  iovec part = {&request, sizeof request};
  msghdr message = {};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  message.msg_control = control;
  message.msg_controllen = sizeof control;
  if (::recvmsg(socket, &message, MSG_CMSG_CLOEXEC | MSG_DONTWAIT) != sizeof request) return false;
  if ((message.msg_flags & (MSG_TRUNC | MSG_CTRUNC)) != 0) return false;
  const cmsghdr* header = CMSG_FIRSTHDR(&message);
  if (header == nullptr || header->cmsg_level != SOL_SOCKET || header->cmsg_type != SCM_RIGHTS) return false;
  if (header->cmsg_len != CMSG_LEN(sizeof descriptors)) return false;
  std::memcpy(descriptors, CMSG_DATA(header), sizeof descriptors);
  request.name[kLongestName] = '\0';
  return request.groupCount <= DeletionBroker::kMaxGroups && request.nameLength <= kLongestName;
}

// Ends this process in time whatever it waits for, and even if the user whose rights it takes has stopped it: an
// alarm would then not.
bool setDeadline() {
  sigevent event = {};
  event.sigev_notify = SIGEV_SIGNAL;
  event.sigev_signo = SIGKILL;
  timer_t timer = {};
  itimerspec end = {};
  end.it_value.tv_sec = kChildSeconds;
  return ::timer_create(CLOCK_MONOTONIC, &event, &timer) == 0 &&
         ::timer_settime(timer, 0, &end, nullptr) == 0;
}

// In a child. It alone holds what the client made: to close that may take for ever. `taken` is closed as soon as the
// request has left the socket, and the socket before another's rights are taken.
[[noreturn]] void serveOne(int socket, int taken, std::span<const FolderIdentity> daemonsOwn) {
  static Request request;
  int descriptors[kDescriptors];
  if (!setDeadline()) ::_exit(1);
  const bool whole = receive(socket, request, descriptors);
  ::close(taken);
  ::close(socket);
  if (!whole) ::_exit(1);
  const int32_t result = removeFile(request, descriptors[0], descriptors[1], daemonsOwn);
  (void)::send(descriptors[2], &result, sizeof result, MSG_NOSIGNAL);
  ::_exit(0);
}

// The children that have not ended, and for whom they work.
class Children {
 public:
  void forgetEnded() {
    while (true) {
      const pid_t ended = ::waitpid(-1, nullptr, WNOHANG);
      if (ended <= 0) return;
      for (size_t i = 0; i < count_; ++i)
        if (children_[i].process == ended) children_[i--] = children_[--count_];
    }
  }
  [[nodiscard]] bool haveRoomFor(uint32_t user) const {
    size_t ofUser = 0;
    for (size_t i = 0; i < count_; ++i) ofUser += children_[i].user == user ? 1 : 0;
    return count_ < kMost && ofUser < DeletionBroker::kMostOfOneUser;
  }
  void add(pid_t process, uint32_t user) { children_[count_++] = {process, user}; }

 private:
  static constexpr size_t kMost = 8 * DeletionBroker::kMostOfOneUser;
  struct Child {
    pid_t process;
    uint32_t user;
  };
  Child children_[kMost] = {};
  size_t count_ = 0;
};

// The request stays in the socket until a child of this process takes it, so that none of its descriptors is ever
// this process's. False: the daemon has ended.
bool serveNext(int socket, Children& children, std::span<const FolderIdentity> daemonsOwn) {
  uint32_t user = kNobody;
  const ssize_t bytes = ::recv(socket, &user, sizeof user, MSG_PEEK | MSG_DONTWAIT);
  if (bytes < 0) return errno == EAGAIN || errno == EINTR;
  if (bytes == 0) return false;
  int taken[2];
  const bool possible = bytes == sizeof user && children.haveRoomFor(user) && ::pipe2(taken, O_CLOEXEC) == 0;
  const pid_t child = possible ? ::fork() : -1;
  if (child == 0) {
    ::close(taken[0]);
    serveOne(socket, taken[1], daemonsOwn);
  }
  if (possible) {
    char byte = 0;
    ::close(taken[1]);
    if (child > 0) (void)!::read(taken[0], &byte, 1);  // its end
    ::close(taken[0]);
  }
  if (child > 0)
    children.add(child, user);
  else
    (void)::recv(socket, &user, sizeof user, MSG_DONTWAIT);  // refused: who waits for an answer sees its end
  return true;
}

void wakeUp(int) {}

void serve(int socket, std::span<const FolderIdentity> daemonsOwn) {
  ::signal(SIGCHLD, wakeUp);
  sigset_t none, children;
  ::sigemptyset(&none);
  ::sigemptyset(&children);
  ::sigaddset(&children, SIGCHLD);
  ::sigprocmask(SIG_SETMASK, &children, nullptr);
  if (::chdir("/") != 0 || keepCapabilities(kTakingUsers) != 0) ::_exit(1);
  static Children working;
  while (true) {
    pollfd request = {socket, POLLIN, 0};
    (void)::ppoll(&request, 1, nullptr, &none);  // SIGCHLD alone interrupts it
    working.forgetEnded();
    if (!serveNext(socket, working, daemonsOwn)) ::_exit(0);
  }
}

// ---- In the daemon.

std::vector<FolderIdentity> identitiesOf(const std::vector<std::string>& paths) {
  std::vector<FolderIdentity> identities;
  for (const std::string& path : paths) {
    struct stat status = {};
    if (::stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode))
      identities.push_back({status.st_dev, status.st_ino});
  }
  return identities;
}

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
  const int ready = ::poll(&answer, 1, kPatienceMilliseconds);
  if (ready == 0) return ETIMEDOUT;
  int32_t result = 0;
  // The end of the stream: the child was ended by its deadline, this user has too many, or there is no broker.
  if (ready < 0 || ::recv(socket, &result, sizeof result, 0) != sizeof result) return EIO;
  return result;
}

}  // namespace

std::variant<std::unique_ptr<DeletionBroker>, std::string> DeletionBroker::start(
    const std::vector<std::string>& daemonsOwn) {
  auto process = HelperProcess::start(
      "kyt-broker", [folders = identitiesOf(daemonsOwn)](int socket) { serve(socket, folders); });
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

  const BlockingScope blocking;
  int ends[2];
  if (::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends) != 0) return errno;
  const Descriptor mine = ownDescriptor(ends[0]);
  {
    const Descriptor theirs = ownDescriptor(ends[1]);
    if (!sendRequest(process_->socket(), *request, {file, folder, theirs.get()}))
      return errno != 0 ? errno : EIO;
  }
  return awaitAnswer(mine.get());
}

}  // namespace kyt
