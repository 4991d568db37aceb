// Every packet with data in it is lost before the TCP of this socket's end has seen it, or no longer: what it sends itself
// arrives and is acknowledged.
#pragma once

#include <linux/filter.h>
#include <sys/socket.h>

#include <stdexcept>

namespace kyt {

inline void losePackets(int socket, bool lost) {
  // The kernel asks this of each packet: a TCP header has 60 bytes at most.
  sock_filter program[] = {{BPF_LD | BPF_W | BPF_LEN, 0, 0, 0},
                           {BPF_JMP | BPF_JGT | BPF_K, 0, 1, 60},
                           {BPF_RET | BPF_K, 0, 0, 0},
                           {BPF_RET | BPF_K, 0, 0, 0xffffffff}};
  const sock_fprog filter{4, program};
  const int none = 0;
  const bool good = lost ? setsockopt(socket, SOL_SOCKET, SO_ATTACH_FILTER, &filter, sizeof filter) == 0
                         : setsockopt(socket, SOL_SOCKET, SO_DETACH_FILTER, &none, sizeof none) == 0;
  if (!good) throw std::runtime_error("losePackets");
}

}  // namespace kyt
