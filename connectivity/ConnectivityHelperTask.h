// One running request of a connectivity helper: collects the body of the answer and knows whom to tell.
#pragma once

#include <span>
#include <string>

#include "connectivity/ConnectivityInterface.h"
#include "connectivity/RequestWindow.h"

namespace velk {

/// Lives in its helper's table from the start of the request to its end; used on the helper's state queue alone.
class ConnectivityHelperTask {
 public:
  /// `place` (or null) is given up with the task, or when the request begins to wait for a route.
  ConnectivityHelperTask(std::string taskDescription, HttpCompletion completionHandler,
                         std::shared_ptr<PlaceInWindow> place = nullptr);
  ~ConnectivityHelperTask();
  ConnectivityHelperTask(const ConnectivityHelperTask&) = delete;
  ConnectivityHelperTask& operator=(const ConnectivityHelperTask&) = delete;

  [[nodiscard]] const std::string& taskDescription() const noexcept { return _taskDescription; }
  void appendReceivedData(std::span<const std::uint8_t> data);
  void waitsForConnectivity();
  /// Calls the completion, if there is one, with what was received. Once.
  void complete(std::shared_ptr<const HttpResponse> response, std::optional<Error> error);

 private:
  HttpCompletion _completionHandler;
  const std::string _taskDescription;
  const std::shared_ptr<PlaceInWindow> _place;
  ByteData _receivedData;
};

}  // namespace velk
