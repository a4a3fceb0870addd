#include "connectivity/ConnectivityHelperTask.h"

#include "platform/Log.h"

namespace telvane {

ConnectivityHelperTask::ConnectivityHelperTask(std::string taskDescription, ConnectivityCompletion completion)
    : taskDescription_(std::move(taskDescription)), completionHandler_(std::move(completion)) {
  log::info("ConnectivityHelperTask with ID <%s> created", taskDescription_);
}

ConnectivityHelperTask::~ConnectivityHelperTask() {
  log::info("ConnectivityHelperTask with ID <%s> dealloced", taskDescription_);
}

}  // namespace telvane
