#include "session/ReportingSessionConnectivityHelper.h"

#include <utility>

#include "platform/objects/Keys.h"

namespace kyt {

std::shared_ptr<ReportingSessionConnectivityHelper> ReportingSessionConnectivityHelper::init(
    URLSessionFactory& factory) {
  return std::shared_ptr<ReportingSessionConnectivityHelper>(
      new ReportingSessionConnectivityHelper(factory.create(privateURLSessionConfig())));
}

ReportingSessionConnectivityHelper::ReportingSessionConnectivityHelper(std::unique_ptr<URLSession> session)
    : _privateURLSession(std::move(session)) {}

ReportingSessionConnectivityHelper::~ReportingSessionConnectivityHelper() {
  _privateURLSession->finishTasksAndInvalidate();
}

URLSessionConfiguration ReportingSessionConnectivityHelper::privateURLSessionConfig() {
  URLSessionConfiguration configuration;
  configuration.sourceApplication = kSourceApplication;
  configuration.waitsForConnectivity = true;
  return configuration;
}

void ReportingSessionConnectivityHelper::postURLRequestWithCompletionHandler(URLRequest request,
                                                                             URLCompletion completion) {
  if (!completion) completion = [](std::optional<Data>, std::optional<URLResponse>, std::optional<Error>) {};
  _privateURLSession->start(std::move(request), std::move(completion));
}

}  // namespace kyt
