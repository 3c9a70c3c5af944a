#pragma once

// The connectivity helper's record of one task in flight: its description,
// the caller's completion and the bytes received so far. Lives on the
// helper's state queue from registration until the completion has run.

#include <string>

#include "platform/Value.h"
#include "transport/ReportingSessionConnectivityInterface.h"

namespace zerith {

class ConnectivityHelperTask {
 public:
  // initWithTaskDescription:completion:
  ConnectivityHelperTask(std::string taskDescription, URLCompletion completion);
  ~ConnectivityHelperTask();
  ConnectivityHelperTask(const ConnectivityHelperTask&) = delete;
  ConnectivityHelperTask& operator=(const ConnectivityHelperTask&) = delete;

  const std::string& taskDescription() const { return taskDescription_; }
  const URLCompletion& completionHandler() const { return completionHandler_; }
  void setCompletionHandler(URLCompletion completion) { completionHandler_ = std::move(completion); }
  const Data& receivedData() const { return receivedData_; }
  void appendReceivedData(const Data& chunk) { receivedData_.insert(receivedData_.end(), chunk.begin(), chunk.end()); }

 private:
  std::string taskDescription_;
  URLCompletion completionHandler_;
  Data receivedData_;
};

}  // namespace zerith
