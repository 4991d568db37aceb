// A network of its own for a test: a network namespace that starts empty, and vanishes with this object and
// the sockets made in it. Needs root; isPermitted() says whether a test that needs one must be skipped
// (visibly).
//
// A namespace belongs to a thread: within an Entered scope this thread, and the threads and processes it
// starts, are in it. Sockets stay in the namespace they were made in.
#pragma once

#include <string>

namespace kyt {

class NetworkNamespace {
 public:
  static bool isPermitted();

  NetworkNamespace();  // throws when it cannot
  ~NetworkNamespace();
  NetworkNamespace(const NetworkNamespace&) = delete;
  NetworkNamespace& operator=(const NetworkNamespace&) = delete;

  class Entered {
   public:
    explicit Entered(const NetworkNamespace& space);
    ~Entered();
    Entered(const Entered&) = delete;
    Entered& operator=(const Entered&) = delete;

   private:
    int before_;
  };

  // Runs a shell command inside; whether it succeeded.
  bool run(const std::string& command) const;
  // A pair of virtual interfaces, one end here and one there, both up, each with its address ("10.0.0.1/24").
  // Waits until the kernel says that both carry: it does so a little later.
  bool connect(const std::string& interface, const std::string& address, const NetworkNamespace& other,
               const std::string& otherInterface, const std::string& otherAddress) const;

 private:
  [[nodiscard]] bool waitUntilRunning(const std::string& interface) const;
  int descriptor_;
};

}  // namespace kyt
