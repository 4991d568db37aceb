#include "platform/linux/service/JournalSocket.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <cstring>
#include <utility>

namespace kyt {
namespace {

constexpr char kPath[] = "/run/systemd/journal/socket";

}  // namespace

bool JournalSocket::isThere() {
  struct stat status = {};
  return ::stat(kPath, &status) == 0 && S_ISSOCK(status.st_mode);
}

std::shared_ptr<JournalSocket> JournalSocket::open() {
  Descriptor socket = ownDescriptor(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!socket) return nullptr;
  std::shared_ptr<JournalSocket> journal(new JournalSocket(std::move(socket)));
  return journal->connectAgain() ? journal : nullptr;
}

bool JournalSocket::connectAgain() {
  sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  static_assert(sizeof kPath <= sizeof address.sun_path);
  std::memcpy(address.sun_path, kPath, sizeof kPath);
  return ::connect(socket_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0;
}

bool JournalSocket::sendInFile(std::string_view entry) {
  const Descriptor file = ownDescriptor(::memfd_create("journal-entry", MFD_CLOEXEC | MFD_ALLOW_SEALING));
  // The journal takes no file that could still change.
  constexpr int kSeals = F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE | F_SEAL_SEAL;
  if (!file || !writeAll(file.get(), entry) || ::fcntl(file.get(), F_ADD_SEALS, kSeals) != 0) return false;
  const int descriptor = file.get();
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof descriptor)] = {};
  msghdr message = {};
  message.msg_control = control;
  message.msg_controllen = sizeof control;
  cmsghdr* const header = CMSG_FIRSTHDR(&message);
  header->cmsg_level = SOL_SOCKET;
  header->cmsg_type = SCM_RIGHTS;
  header->cmsg_len = CMSG_LEN(sizeof descriptor);
  std::memcpy(CMSG_DATA(header), &descriptor, sizeof descriptor);
  return ::sendmsg(socket_.get(), &message, MSG_NOSIGNAL) >= 0;
}

}  // namespace kyt
