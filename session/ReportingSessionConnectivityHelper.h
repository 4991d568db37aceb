// The one object through which a session's back ends send HTTP requests: a private URL session of its own, so
// that all requests of a session share one connection pool and are attributed to the system's diagnostics and
// not to the daemon. Each session owns one; single messages share one for the process
// (session/ReportingdSessionClass.h).
//
// Any thread, never blocks. Completions run on a delegate queue of the URL session, which has one for each user.
// Destroying the helper lets requests already started finish and call their completions. shared_ptr, since back
// ends hold it weakly.
#pragma once

#include <memory>

#include "backend/ReportingSessionConnectivityInterface.h"
#include "platform/URLSession.h"

namespace kyt {

class ReportingSessionConnectivityHelper final : public ReportingSessionConnectivityInterface {
 public:
  [[nodiscard]] static std::shared_ptr<ReportingSessionConnectivityHelper> init(URLSessionFactory& factory);
  ~ReportingSessionConnectivityHelper() override;
  ReportingSessionConnectivityHelper(const ReportingSessionConnectivityHelper&) = delete;
  ReportingSessionConnectivityHelper& operator=(const ReportingSessionConnectivityHelper&) = delete;

  // The default configuration but for two settings.
  [[nodiscard]] static URLSessionConfiguration privateURLSessionConfig();

  void postURLRequestWithCompletionHandler(URLRequest request, URLCompletion completion) override;

 private:
  explicit ReportingSessionConnectivityHelper(std::unique_ptr<URLSession> session);

  const std::unique_ptr<URLSession> _privateURLSession;
};

}  // namespace kyt
