#pragma once

#include <cstddef>
#include <functional>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/lum/PeerLooks.h"
#include "platform/values/Value.h"

namespace zorvan {

/// Where the paths that a request names lead. They are resolved on a thread of their own, since
/// that may hang; whoever serves the request reads what has been settled by then.
class RequestPaths {
  public:
    explicit RequestPaths(platform::Array paths) : paths_(std::move(paths)) {}

    /// Resolves one after another, each of them a step, up to the first that is no absolute path.
    /// Ends early when it is not wanted any more.
    void resolve(platform::PeerLooks::Pace& pace, const std::function<bool()>& isWanted);
    /// So many are resolved. The others count as not resolved, also while `resolve` goes on.
    void settle(std::size_t steps) { settled_ = steps; }

    /// Where an element leads, as a canonical path; none when it could not be resolved.
    std::optional<std::string> resolved(std::size_t index) const;

  private:
    const platform::Array paths_;
    std::vector<std::optional<std::string>> resolved_;  // each written once, before its step
    std::size_t settled_ = 0;
};

}  // namespace zorvan
