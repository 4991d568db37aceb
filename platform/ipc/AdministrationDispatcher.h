// Turns the calls that come to the administration socket into the operations of AdministrationInterface. A peer that may
// not ask gets the error AccessDenied for each of ours; the standard interfaces are everybody's who reached the socket.
//
// One object serves all connections; it has no state of its own. The objects that the connections export are windows.
#pragma once

#include <array>
#include <string>
#include <string_view>

#include "platform/ipc/MessageDispatcher.h"
#include "platform/ipc/StandardInterfaces.h"

namespace kyt {

class Counters;

// The contract as a table: docs/com.vantu.kytreportingd.Administration.xml tells everybody else the same; a test compares
// the two.
struct AdministrationContract {
  std::string_view member, signature, reply;
};
inline constexpr std::array kAdministrationMethods{
    AdministrationContract{"Status", "", "a{sv}"},    AdministrationContract{"Sessions", "", "aa{sv}"},
    AdministrationContract{"Books", "", "aa{sv}"},    AdministrationContract{"Storebags", "", "aa{sv}"},
    AdministrationContract{"Metrics", "", "s"},       AdministrationContract{"SetLogLevel", "s", ""},
    AdministrationContract{"Reload", "", "as"},       AdministrationContract{"Watch", "a{sv}", ""},
    AdministrationContract{"Storebag", "s", "a{sv}"}, AdministrationContract{"Outbox", "", "aa{sv}"},
    AdministrationContract{"FlushOutbox", "", ""},    AdministrationContract{"DropOutbox", "a{sv}", "t"},
};
inline constexpr std::string_view kPassedSignal = "Passed", kPassedSignature = "a{sv}";

class AdministrationDispatcher final : public MessageDispatcher {
 public:
  // `machineId`: 32 hexadecimal digits.
  AdministrationDispatcher(Counters& counters, std::string machineId);
  [[nodiscard]] const char* handle(const Message& message, const Peer& peer) const override;

 private:
  Counters& counters_;
  const StandardInterfaces standard_;
};

// The text that Introspect answers: docs/com.vantu.kytreportingd.Administration.xml without its comments.
[[nodiscard]] std::string administrationIntrospection();

}  // namespace kyt
