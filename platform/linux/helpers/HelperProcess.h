// A small process that does for the daemon one thing which a confined process cannot: forked before the confinement is
// entered and before there are threads, it keeps one socket, answers one kind of question on it, and ends when the
// daemon does. The program inspector and the deletion broker are such processes.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <variant>

#include "platform/linux/files/Files.h"

namespace kyt {

class HelperProcess {
 public:
  // Runs `serve` in a new process called `name`, with its end of the socket; `serve` does not return and, as it runs in
  // a forked process, allocates nothing and takes no lock. An error's text when it cannot be started.
  [[nodiscard]] static std::variant<std::unique_ptr<HelperProcess>, std::string> start(
      const char* name, const std::function<void(int)>& serve);
  ~HelperProcess();  // closes the socket, which ends the process, and waits for it, some seconds at most
  HelperProcess(const HelperProcess&) = delete;
  HelperProcess& operator=(const HelperProcess&) = delete;

  // Keeps the boundaries of messages. To send or to receive takes two seconds at most.
  [[nodiscard]] int socket() const { return socket_.get(); }

 private:
  HelperProcess(Descriptor socket, int32_t child) : socket_(std::move(socket)), child_(child) {}

  Descriptor socket_;
  const int32_t child_;
};

}  // namespace kyt
