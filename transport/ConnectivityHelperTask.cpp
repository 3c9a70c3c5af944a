#include "transport/ConnectivityHelperTask.h"

#include "platform/Log.h"

namespace zerith {

namespace {

const log::Logger& logger() {
  static const auto* l = new log::Logger("transport");
  return *l;
}

}  // namespace

ConnectivityHelperTask::ConnectivityHelperTask(std::string taskDescription, URLCompletion completion)
    : taskDescription_(std::move(taskDescription)), completionHandler_(std::move(completion)) {
  logger().debug("ConnectivityHelperTask with ID <{}> created", taskDescription_);
}

ConnectivityHelperTask::~ConnectivityHelperTask() {
  logger().debug("ConnectivityHelperTask with ID <{}> dealloced", taskDescription_);
}

}  // namespace zerith
