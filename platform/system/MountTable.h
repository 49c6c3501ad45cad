#pragma once

#include <sys/types.h>

#include <map>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/system/UniqueFd.h"

namespace platform {

/// What is mounted where, as the kernel tells this process. No file system is asked, so none can
/// keep anybody waiting. Used by one thread at a time.
class MountTable {
  public:
    struct Mount {
        int id = 0;  // of all that exist at one time, none other has it
        dev_t device = 0;
        std::string place;  // canonical
        std::string type;

        /// Whether its file system is one of the kernel's own, on disks and in memory, which waits
        /// for no server and no program.
        bool isOwn() const;
    };

    /// Learns what has changed; to be called before the first question. What cannot be read stays
    /// as it was known.
    void refresh();

    /// The mount that a canonical path lies on, be there anything or not. What another one covers
    /// is not on the way. Null when nothing is known. Good until something has changed.
    const Mount* of(const std::string& path) const;
    /// Whether that mount's file system is one of the kernel's own (see `Mount::isOwn`).
    bool isOwn(int id) const { return own_.contains(id); }
    /// The mounts that can be reached at places inside a canonical path.
    std::vector<const Mount*> within(const std::string& path) const;

  private:
    using Place = std::pair<int, std::string>;  // on which mount, and the path

    bool hasChanged();
    const Mount* entered(const Mount* mount, const std::string& place) const;

    UniqueFd table_;
    std::map<Place, Mount> mounts_;
    std::set<int> own_;            // of these, by their ids
    const Mount* root_ = nullptr;  // what nothing else is beneath
};

}  // namespace platform
