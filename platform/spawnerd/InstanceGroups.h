#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "platform/spawnerd/InstanceLimits.h"
#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace platform::spawnerd {

/// The kernel's group (cgroup v2) of one instance, whose limits hold for all its processes
/// together. It is removed with this object, or, when something is left in it then, before a later
/// one is made. Without a group, operations do nothing and succeed. Move-only.
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
    using Paths = std::vector<std::string>;
    std::string path_;
    UniqueFd folder_;
    std::shared_ptr<Paths> leftBehind_;  // of all instances
};

/// The daemon's own group, where that is delegated to it, with a group in it for each instance. On
/// the loop's thread.
class InstanceGroups {
  public:
    /// Takes the daemon's group into use when it has the unified tree's controllers of memory and
    /// processes, is writable, and no others than this process and those that it has forked are in
    /// it; these then move to a group of their own in there, because groups have either processes
    /// or groups. What an earlier daemon left there goes. Otherwise there are no groups, and
    /// nothing has changed. `tree` is where the unified tree is mounted, `membership` the file that
    /// says where in it this process is.
    static InstanceGroups find(const std::string& tree = "/sys/fs/cgroup",
                               const std::string& membership = "/proc/self/cgroup");

    bool areThere() const { return !path_.empty(); }
    /// A group with these limits; none, without an error, where there are no groups.
    Result<InstanceGroup> make(std::uint64_t instance, const InstanceLimits& limits) const;

  private:
    std::string path_;
    std::shared_ptr<InstanceGroup::Paths> leftBehind_ = std::make_shared<InstanceGroup::Paths>();
};

}  // namespace platform::spawnerd
