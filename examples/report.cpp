// Reporting from C++: opens a session, configures it, sends a few events, flushes, and says goodbye.
//
//   report_cpp [SOCKET]
#include <kytreporting/KYTReporting.h>

#include <cstdio>
#include <future>

int main(int argc, char** argv) {
  kyt::KYTReporting::Options options;
  if (argc > 1) options.socketPath = argv[1];
  options.sessionInfo =
      kyt::SessionInfo{.sessionID = 42, .clientType = 20, .clientVersion = 1, .batchEvent = true};
  options.userInfo = kyt::Dictionary{{kyt::kKYTReportingUserInfoClientName, "example"},
                                     {kyt::kKYTReportingUserInfoServiceName, "demo"}};
  const auto session = kyt::KYTReporting::open(std::move(options));

  // A program may send without waiting for the configuration; this one shows the answer first.
  std::promise<void> configured;
  session->startConfiguration([&](auto states, auto error) {
    if (error)
      std::printf("configuration failed: %s\n", error->localizedDescription.c_str());
    else if (!states)
      std::printf("no storebag for this client type: nothing will be sent\n");
    else
      for (const std::string& name : *states) std::printf("live: %s\n", name.c_str());
    configured.set_value();
  });
  configured.get_future().wait();

  for (int i = 1; i <= 3; ++i) session->sendMessage(10, 1, {{"step", i}, {"duration", 0.25 * i}});
  session->sendMessage(20, 2, {{"urgent", true}}, 1);  // realtime

  const bool all = session->finish();
  const auto figures = session->statistics();
  std::printf("sent %llu, lost %llu\n", static_cast<unsigned long long>(figures.sent),
              static_cast<unsigned long long>(figures.lostOnConnectionEnd));
  return all ? 0 : 1;
}
