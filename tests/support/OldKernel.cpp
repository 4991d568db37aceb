#include "tests/support/OldKernel.h"

#include <fcntl.h>
#include <linux/landlock.h>
#include <poll.h>
#include <seccomp.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/uio.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <string>

#include "tests/support/SendDescriptors.h"

namespace kyt {
namespace {

constexpr uint64_t kKnownRights = (1ULL << 14) - 1;  // reading to REFER
constexpr int kPeerProcess = 77;                     // SO_PEERPIDFD

int received(int socket) {
  char byte = 0;
  iovec part = {&byte, 1};
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
  msghdr message = {};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  message.msg_control = control;
  message.msg_controllen = sizeof control;
  if (::recvmsg(socket, &message, MSG_CMSG_CLOEXEC) != 1) return -1;
  const cmsghdr* header = CMSG_FIRSTHDR(&message);
  int descriptor = -1;
  if (header != nullptr) std::memcpy(&descriptor, CMSG_DATA(header), sizeof descriptor);
  return descriptor;
}

// Whether version 2 knows the ruleset's attributes: its size, and then the rights.
bool isKnown(const seccomp_notif& question) {
  if (question.data.args[1] != sizeof(uint64_t)) return false;
  const std::string memory = "/proc/" + std::to_string(question.pid) + "/mem";
  const int file = ::open(memory.c_str(), O_RDONLY | O_CLOEXEC);
  uint64_t rights = ~0ULL;
  const bool read = ::pread(file, &rights, sizeof rights, static_cast<off_t>(question.data.args[0])) ==
                    static_cast<ssize_t>(sizeof rights);
  ::close(file);
  return read && (rights & ~kKnownRights) == 0;
}

}  // namespace

OldKernel::OldKernel() {
  int ends[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0) return;
  toTest_ = ends[0];
  fromChild_ = ends[1];
}

OldKernel::~OldKernel() {
  stop_ = true;
  if (thread_.joinable()) thread_.join();
  if (toTest_ >= 0) ::close(toTest_);
  ::close(fromChild_);
}

void OldKernel::installHere() const {
  const scmp_filter_ctx filter = seccomp_init(SCMP_ACT_ALLOW);
  const scmp_arg_cmp peerProcess[] = {{1, SCMP_CMP_EQ, SOL_SOCKET, 0}, {2, SCMP_CMP_EQ, kPeerProcess, 0}};
  const bool made = seccomp_rule_add(filter, SCMP_ACT_NOTIFY, SCMP_SYS(landlock_create_ruleset), 0) == 0 &&
                    seccomp_rule_add_array(filter, SCMP_ACT_ERRNO(ENOPROTOOPT), SCMP_SYS(getsockopt), 2,
                                           peerProcess) == 0 &&
                    seccomp_load(filter) == 0;
  if (!made || test::sendDescriptors(toTest_, "-", {seccomp_notify_fd(filter)}) != 1) ::_exit(126);
  ::close(seccomp_notify_fd(filter));
}

void OldKernel::serve() {
  ::close(toTest_);
  toTest_ = -1;
  const int listener = received(fromChild_);
  if (listener < 0) return;
  thread_ = std::thread([this, listener] {
    pollfd waiting = {listener, POLLIN, 0};
    while (!stop_) {
      if (::poll(&waiting, 1, 50) <= 0) continue;
      if ((waiting.revents & POLLIN) == 0) break;  // nobody is left who could ask
      answer(listener);
    }
    ::close(listener);
  });
}

void OldKernel::answer(int listener) {
  seccomp_notif* question = nullptr;
  seccomp_notif_resp* reply = nullptr;
  if (seccomp_notify_alloc(&question, &reply) != 0) return;
  if (seccomp_notify_receive(listener, question) == 0) {
    reply->id = question->id;
    if (question->data.args[2] == LANDLOCK_CREATE_RULESET_VERSION) {
      reply->val = kLandlock;
      askedForVersion_ = true;
    } else if (isKnown(*question)) {
      reply->flags = SECCOMP_USER_NOTIF_FLAG_CONTINUE;
    } else {
      reply->error = -EINVAL;
      ++refusedRulesets_;
    }
    (void)seccomp_notify_respond(listener, reply);
  }
  seccomp_notify_free(question, reply);
}

void takeLandlockAwayHere() {
  const scmp_filter_ctx filter = seccomp_init(SCMP_ACT_ALLOW);
  for (const int call :
       {SCMP_SYS(landlock_create_ruleset), SCMP_SYS(landlock_add_rule), SCMP_SYS(landlock_restrict_self)})
    if (seccomp_rule_add(filter, SCMP_ACT_ERRNO(ENOSYS), call, 0) != 0) ::_exit(126);
  if (seccomp_load(filter) != 0) ::_exit(126);
}

void takeSeccompAwayHere() {
  const scmp_filter_ctx filter = seccomp_init(SCMP_ACT_ALLOW);
  const scmp_arg_cmp inTheOldWay[] = {{0, SCMP_CMP_EQ, PR_SET_SECCOMP, 0}};
  if (seccomp_rule_add(filter, SCMP_ACT_ERRNO(ENOSYS), SCMP_SYS(seccomp), 0) != 0 ||
      seccomp_rule_add_array(filter, SCMP_ACT_ERRNO(EINVAL), SCMP_SYS(prctl), 1, inTheOldWay) != 0 ||
      seccomp_load(filter) != 0)
    ::_exit(126);
}

}  // namespace kyt
