#pragma once

#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/lum/PlaceLooks.h"
#include "platform/threads/SerialQueue.h"

namespace platform::tandry {

/// Which places on disk can be looked at without waiting for somebody else: a server may be away,
/// and the program behind a mount of a user's own may do what it likes. Before a walk looks at such
/// a place it has a thread see whether it answers. Belongs to the registry's thread.
class ForeignPlaces {
  public:
    ForeignPlaces() = default;
    ForeignPlaces(const ForeignPlaces&) = delete;
    /// Waits for the threads that wait for an answer.
    ~ForeignPlaces();

    /// To be called before each walk, and before the first question: learns what is mounted where.
    /// Each place is asked once a walk.
    void beginWalk();

    /// Whether what lies at a path can be looked at: at once when its file system is the kernel's
    /// own, otherwise when it has answered in time.
    bool answers(const std::string& path);

  private:
    bool isForeign(const std::string& path) const;
    bool ask(const std::string& path);

    std::map<std::string, bool, std::less<>> mounts_;  // by place: whether they are foreign
    std::vector<std::string> foreign_;                 // places of those that are
    std::map<std::string, bool> answers_;              // of this walk
    // From the first question on:
    std::unique_ptr<SerialQueue> queue_;
    std::unique_ptr<PlaceLooks> looks_;  // the queue's
};

}  // namespace platform::tandry
