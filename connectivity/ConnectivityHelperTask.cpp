#include "connectivity/ConnectivityHelperTask.h"

#include "connectivity/LogTexts.h"
#include "platform/Log.h"

namespace velk {

ConnectivityHelperTask::ConnectivityHelperTask(std::string taskDescription, HttpCompletion completionHandler,
                                               std::shared_ptr<PlaceInWindow> place)
    : _completionHandler(std::move(completionHandler)),
      _taskDescription(std::move(taskDescription)),
      _place(std::move(place)) {
  log::standard(connectivity_texts::kTaskCreated, _taskDescription);
}

ConnectivityHelperTask::~ConnectivityHelperTask() {
  log::standard(connectivity_texts::kTaskDealloced, _taskDescription);
}

void ConnectivityHelperTask::appendReceivedData(std::span<const std::uint8_t> data) {
  _receivedData.insert(_receivedData.end(), data.begin(), data.end());
}

void ConnectivityHelperTask::waitsForConnectivity() {
  if (_place) _place->leave();
}

void ConnectivityHelperTask::complete(std::shared_ptr<const HttpResponse> response, std::optional<Error> error) {
  _completionHandler(std::move(_receivedData), std::move(response), std::move(error));
}

}  // namespace velk
