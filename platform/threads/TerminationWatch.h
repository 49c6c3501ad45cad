#pragma once

#include <functional>

#include "platform/system/UniqueFd.h"
#include "platform/threads/RunLoop.h"

namespace platform {

/// Tells when somebody asks this process to end: SIGTERM and SIGINT no longer end it, but call back
/// on the loop, each time. Made on the main thread before there are others, which inherit from it
/// that these signals are not theirs to take. The loop must outlive it.
class TerminationWatch {
  public:
    TerminationWatch(RunLoop& loop, std::function<void()> asked);
    TerminationWatch(const TerminationWatch&) = delete;

  private:
    void await();

    const std::function<void()> asked_;
    const UniqueFd signals_;
    RunLoop::Watch watch_;
};

}  // namespace platform
