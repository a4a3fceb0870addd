// ConnectivityHelperTask: the record a connectivity helper keeps for one running
// request: its identifier ("Task_%08x"), the bytes received so far and the completion
// to call when the request ends.
//
// Owned by the helper's task map; touched only on the helper's state queue.
#pragma once

#include <string>

#include "connectivity/ReportingSessionConnectivityHelper.h"

namespace telvane {

class ConnectivityHelperTask {
 public:
  ConnectivityHelperTask(std::string taskDescription, ConnectivityCompletion completion);
  ~ConnectivityHelperTask();
  ConnectivityHelperTask(const ConnectivityHelperTask&) = delete;
  ConnectivityHelperTask& operator=(const ConnectivityHelperTask&) = delete;

  const std::string& taskDescription() const { return taskDescription_; }
  const ConnectivityCompletion& completionHandler() const { return completionHandler_; }
  void setCompletionHandler(ConnectivityCompletion completion) { completionHandler_ = std::move(completion); }
  const std::string& receivedData() const { return receivedData_; }
  void appendReceivedData(const std::string& bytes) { receivedData_ += bytes; }

 private:
  const std::string taskDescription_;
  ConnectivityCompletion completionHandler_;
  std::string receivedData_;
};

}  // namespace telvane
