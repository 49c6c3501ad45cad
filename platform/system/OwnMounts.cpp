#include "platform/system/OwnMounts.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <mutex>

#include "platform/system/MountTable.h"

namespace platform {

namespace {

struct Mounts {
    std::mutex mutex;
    MountTable table;  // guarded by it
};

Mounts& mounts() {
    static auto* const mounts = new Mounts;  // never destroyed: threads may end with the process
    return *mounts;
}

}  // namespace

bool isOnOwnMount(int fd) {
    struct statx status {};
    if (::statx(fd, "", AT_EMPTY_PATH | AT_STATX_DONT_SYNC, STATX_MNT_ID, &status) != 0 ||
        !(status.stx_mask & STATX_MNT_ID))
        return false;
    Mounts& known = mounts();
    const std::lock_guard lock(known.mutex);
    // What is open keeps its mount, and that its number.
    known.table.refresh();
    return known.table.isOwn(static_cast<int>(status.stx_mnt_id));
}

}  // namespace platform
