// The timer that every scheduler hands out: deadlines from a TimerService, the handler on a queue.
#pragma once

#include <memory>

#include "platform/Queue.h"
#include "platform/TimerSchedule.h"

namespace velk {

[[nodiscard]] std::unique_ptr<Timer> makeQueueTimer(std::shared_ptr<TimerService> service, std::shared_ptr<Queue> queue,
                                                    Task handler);

}  // namespace velk
