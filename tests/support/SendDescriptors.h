// Bytes with descriptors beside them, over a Unix socket, as any client can send them.
#pragma once

#include <sys/socket.h>

#include <cstring>
#include <string_view>
#include <vector>

namespace kyt::test {

// What sendmsg(2) returns.
[[nodiscard]] inline ssize_t sendDescriptors(int socket, std::string_view bytes,
                                             const std::vector<int>& descriptors) {
  const size_t size = sizeof(int) * descriptors.size();
  std::vector<char> control(CMSG_SPACE(size));
  iovec part = {const_cast<char*>(bytes.data()), bytes.size()};
  msghdr message = {};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  if (!descriptors.empty()) {
    message.msg_control = control.data();
    message.msg_controllen = control.size();
    cmsghdr* header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(size);
    std::memcpy(CMSG_DATA(header), descriptors.data(), size);
  }
  return ::sendmsg(socket, &message, MSG_NOSIGNAL);
}

}  // namespace kyt::test
