// DashboardBackend: upload of archived log-data arrays.
#include <utility>

#include "backends/dashboard/DashboardBackend.h"
#include "platform/Json.h"
#include "platform/Log.h"
#include "platform/PropertyList.h"

namespace telvane {

bool DashboardBackend::uploadLogData(const Array& logData) {
  if (!postURL_) {
    log::error("DashboardBackend(uploadLogData): Post URL for log data array is nil");
    return false;
  }
  // The keyed archive of the array is its binary property list.
  Result<Bytes> archive = plist::encodeBinary(Value(logData));
  if (!archive.ok()) {
    log::error("DashboardBackend(uploadLogData): Failed to serialize log data array for upload");
    return false;
  }
  HttpRequest request;
  request.method = "POST";
  request.url = *postURL_;
  request.headers = {{"Content-Type", "application/octet-stream"}};
  request.body.assign(archive.value().begin(), archive.value().end());

  std::shared_ptr<ReportingSessionConnectivityHelper> helper = reportingSessionConnectivityDelegate();
  if (!helper) return true;

  std::optional<PostAnswer> answer = postAndWait(*helper, std::move(request), uploadAnswerWaitLimit_);
  std::string problem;
  if (!answer) {
    problem = "no answer within " + std::to_string(uploadAnswerWaitLimit_.count()) + " ms";
  } else if (answer->error) {
    problem = answer->error->description;
  } else if (!answer->data || answer->data->empty()) {
    problem = "no response data";
  } else if (!json::isValidUtf8(*answer->data)) {
    problem = "response data is not UTF-8 text";
  } else {
    const std::string location = std::move(*answer->data);
    log::info("DashboardBackend(uploadLogData): Log data uploaded to %s", location);
    // Through the base's five-argument send: it counts the event and hands it to the
    // six-argument send, which this class leaves to the base, so no datagram is made.
    TelvaneBackendBase::sendMessage(Value(Dictionary{{kLogDataUploadLocationKey, Value(location)}}),
                                    TimeValue::fromSeconds(platform_.clock->now()), 0, 2, kMessageFlagOrdinary);
    return true;
  }
  log::error("DashboardBackend(uploadLogData): Error uploading log data array (%s)", problem);
  return false;
}

}  // namespace telvane
