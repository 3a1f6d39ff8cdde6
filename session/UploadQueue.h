// What a session uploads: one file or array after the other, beside the session's other calls, since each may take as
// long as a server likes. Owned by its session; its queue is made with the first upload.
#pragma once

#include <atomic>
#include <cstddef>
#include <memory>
#include <utility>

#include "backends/ProcessUploads.h"
#include "platform/Queue.h"

namespace velk {

/// Used on the session's queue alone. What it has taken runs to its end, whether or not the session still lives.
class UploadQueue {
 public:
  /// Uploads that are under way or wait. A client with more of them has to wait for its answers first: each may hold a
  /// descriptor, or a megabyte of log data.
  static constexpr std::size_t kMaximumUploads = 16;

  /// A place among the uploads of the session, of its user and of the process; given back with the last reference.
  using Place = std::shared_ptr<const void>;

  /// `user`: whose process the session's client is.
  UploadQueue(Scheduler& scheduler, std::shared_ptr<ProcessUploads> ofAll, ProcessUploads::User user)
      : _scheduler(scheduler), _ofAll(std::move(ofAll)), _user(user) {}

  [[nodiscard]] ProcessUploads::User user() const noexcept { return _user; }

  /// Null when the session, or its user, has its share already.
  [[nodiscard]] Place takePlace() {
    if (_underWay->load() >= kMaximumUploads || !_ofAll->enter(_user)) return nullptr;
    ++*_underWay;
    return Place(_ofAll.get(), [underWay = _underWay, ofAll = _ofAll, user = _user](const void*) {
      --*underWay;
      ofAll->leave(user);
    });
  }

  /// Runs the upload behind those that were taken before. It is told whether it may begin: when the process is about to
  /// end it may not, and only answers. It says whether what was to be uploaded has been delivered.
  template <class Upload>
  void run(Place place, Upload upload) {
    if (!_queue) _queue = _scheduler.makeSerialQueue("com.tavrin.velkreportingd.uploads");
    _queue->async([upload = std::move(upload), place = std::move(place), ofAll = _ofAll]() mutable {
      const bool isDelivered = upload(!ofAll->isStopping());
      if (!isDelivered && ofAll->isStopping()) ofAll->noteLeftBehind();
    });
  }

  /// Runs the work when all uploads have ended: at once if there are none.
  template <class Work>
  void runBehindUploads(Work work) {
    if (_underWay->load() == 0) {
      work();
    } else {
      _queue->async(std::move(work));
    }
  }

 private:
  Scheduler& _scheduler;
  const std::shared_ptr<ProcessUploads> _ofAll;
  const ProcessUploads::User _user;
  std::shared_ptr<Queue> _queue;
  const std::shared_ptr<std::atomic<std::size_t>> _underWay = std::make_shared<std::atomic<std::size_t>>(0);
};

}  // namespace velk
