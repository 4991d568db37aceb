#include "tests/support/NetworkNamespace.h"

#include <fcntl.h>
#include <net/if.h>
#include <sched.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <stdexcept>
#include <thread>

namespace kyt {
namespace {

int currentNamespace() {
  return open("/proc/thread-self/ns/net", O_RDONLY | O_CLOEXEC);
}

}  // namespace

bool NetworkNamespace::isPermitted() {
  static const bool permitted = [] {
    try {
      const NetworkNamespace one, two;
      return one.connect("kyt-a0", "10.0.0.1/24", two, "kyt-b0", "10.0.0.2/24");
    } catch (const std::runtime_error&) {
      return false;
    }
  }();
  return permitted;
}

NetworkNamespace::NetworkNamespace() : descriptor_(-1) {
  const int before = currentNamespace();
  if (unshare(CLONE_NEWNET) != 0) {
    close(before);
    throw std::runtime_error("NetworkNamespace: not permitted");
  }
  descriptor_ = currentNamespace();
  if (setns(before, CLONE_NEWNET) != 0) std::abort();  // this thread would stay cut off
  close(before);
  run("ip link set lo up");
}

NetworkNamespace::~NetworkNamespace() {
  close(descriptor_);
}

NetworkNamespace::Entered::Entered(const NetworkNamespace& space) : before_(currentNamespace()) {
  if (setns(space.descriptor_, CLONE_NEWNET) != 0) throw std::runtime_error("NetworkNamespace: cannot enter");
}

NetworkNamespace::Entered::~Entered() {
  if (setns(before_, CLONE_NEWNET) != 0) std::abort();
  close(before_);
}

bool NetworkNamespace::run(const std::string& command) const {
  const Entered entered(*this);
  return std::system(command.c_str()) == 0;
}

bool NetworkNamespace::connect(const std::string& interface, const std::string& address,
                               const NetworkNamespace& other, const std::string& otherInterface,
                               const std::string& otherAddress) const {
  const std::string there = "/proc/" + std::to_string(getpid()) + "/fd/" + std::to_string(other.descriptor_);
  return run("ip link add " + interface + " type veth peer name " + otherInterface) &&
         run("ip link set " + otherInterface + " netns " + there) &&
         other.run("ip addr add " + otherAddress + " dev " + otherInterface + " && ip link set " +
                   otherInterface + " up") &&
         run("ip addr add " + address + " dev " + interface + " && ip link set " + interface + " up") &&
         other.waitUntilRunning(otherInterface) && waitUntilRunning(interface);
}

bool NetworkNamespace::waitUntilRunning(const std::string& interface) const {
  const Entered entered(*this);
  const int probe = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  ifreq question{};
  interface.copy(question.ifr_name, sizeof question.ifr_name - 1);
  const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  bool running = false;
  while (!running && std::chrono::steady_clock::now() < end) {
    running = ioctl(probe, SIOCGIFFLAGS, &question) == 0 && (question.ifr_flags & IFF_RUNNING) != 0;
    if (!running) std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  close(probe);
  return running;
}

}  // namespace kyt
