// Reporting from C++: opens a session, configures it, sends a few events, and says goodbye. Where nothing can
// arrive it says why, and ends with status 1.
//
//   report_cpp [SOCKET]
#include <kytreporting/KYTReporting.h>

#include <chrono>
#include <cstdio>
#include <future>

int main(int argc, char** argv) {
  kyt::KYTReporting::Options options;
  if (argc > 1) options.socketPath = argv[1];
  options.sessionInfo =
      kyt::SessionInfo{.sessionID = 42, .clientType = 20, .clientVersion = 1, .batchEvent = true};
  options.userInfo = kyt::Dictionary{{kyt::kKYTReportingUserInfoClientName, "example"},
                                     {kyt::kKYTReportingUserInfoServiceName, "demo"}};
  // Without a daemon the completion below gets an error after so long.
  options.callDeadline = std::chrono::seconds(5);
  const auto session = kyt::KYTReporting::open(std::move(options));

  // A program may send without waiting for the configuration; this one shows first whether anything can arrive.
  std::promise<bool> configured;
  session->startConfiguration(
      [&configured](auto states, auto error) { configured.set_value(!error && states && !states->empty()); });
  const bool live = configured.get_future().get();
  std::fprintf(live ? stdout : stderr, "%s: %s\n", kyt::KYTReporting::nameOf(session->state()),
               session->stateReason().c_str());
  if (!live) return 1;

  for (int i = 1; i <= 3; ++i) session->sendMessage(10, 1, {{"step", i}, {"duration", 0.25 * i}});
  session->sendMessage(20, 2, {{"urgent", true}}, 1);  // realtime

  const bool all = session->finish();
  const auto figures = session->statistics();
  std::printf("sent %llu, lost %llu\n", static_cast<unsigned long long>(figures.sent),
              static_cast<unsigned long long>(figures.accepted - figures.sent));
  if (!all) std::fprintf(stderr, "not all was sent: %s\n", session->stateReason().c_str());
  return all ? 0 : 1;
}
