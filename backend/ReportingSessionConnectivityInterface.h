// All that a back end knows of the poster: one operation that sends a prepared request.
#pragma once

#include "platform/URLSession.h"

namespace kyt {

class ReportingSessionConnectivityInterface {
 public:
  virtual ~ReportingSessionConnectivityInterface() = default;
  // The caller sets method, headers and body. The completion may be empty; it runs on the URL session's own
  // queue with (data, response, error), unchanged. Any thread, never blocks.
  virtual void postURLRequestWithCompletionHandler(URLRequest request, URLCompletion completion) = 0;
};

}  // namespace kyt
