#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string>

#include "platform/spawnerd/InstanceLimits.h"
#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace platform::spawnerd {

/// The kernel's group (cgroup v2) of one instance, whose limits hold for all its processes
/// together. It is removed with this object, once nothing runs in it. Without a group, operations
/// do nothing and succeed. Move-only.
class InstanceGroup {
  public:
    InstanceGroup() = default;
    InstanceGroup(InstanceGroup&&) = default;
    InstanceGroup& operator=(InstanceGroup&&) = delete;
    ~InstanceGroup();

    /// False, with errno set, when the process cannot be moved there. What it starts later is
    /// there, too.
    bool add(pid_t process) const;
    /// Ends all its processes.
    void kill() const;

  private:
    friend class InstanceGroups;
    std::string path_;
    UniqueFd folder_;
};

/// The daemon's own group, where that is delegated to it, with a group in it for each instance. On
/// the loop's thread.
class InstanceGroups {
  public:
    /// Takes the daemon's group into use when it has the unified tree's controllers of memory and
    /// processes, is writable, and no other process is in it; the daemon then moves to a group of
    /// its own in there, because groups have either processes or groups. Otherwise there are no
    /// groups, and nothing has changed. `tree` is where the unified tree is mounted, `membership`
    /// the file that says where in it this process is.
    static InstanceGroups find(const std::string& tree = "/sys/fs/cgroup",
                               const std::string& membership = "/proc/self/cgroup");

    bool areThere() const { return !path_.empty(); }
    /// A group with these limits; none, without an error, where there are no groups.
    Result<InstanceGroup> make(std::uint64_t instance, const InstanceLimits& limits) const;

  private:
    std::string path_;
};

}  // namespace platform::spawnerd
