#pragma once

#include <memory>

#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace zrctl {

/// A descriptor that is readable once SIGINT or SIGTERM has asked for the end. Call before there
/// are threads: the signals are blocked from then on.
platform::Result<platform::UniqueFd> interruption();

/// Something that happens once, on whatever thread, and can be polled for. Shared by who waits and
/// who tells.
class Event {
  public:
    static platform::Result<std::shared_ptr<const Event>> make();

    void happen() const;
    /// Readable once it has happened.
    int descriptor() const { return descriptor_.get(); }

  private:
    explicit Event(platform::UniqueFd descriptor) : descriptor_(std::move(descriptor)) {}

    const platform::UniqueFd descriptor_;
};

}  // namespace zrctl
