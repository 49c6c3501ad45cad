#include "platform/system/MountTable.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/sysmacros.h>

#include <algorithm>
#include <array>
#include <fstream>
#include <sstream>
#include <string_view>

namespace platform {

namespace {

constexpr std::array<std::string_view, 14> kOwn{"ext2", "ext3",  "ext4",  "xfs",     "btrfs",
                                                "f2fs", "tmpfs", "ramfs", "overlay", "squashfs",
                                                "vfat", "erofs", "zfs",   "bcachefs"};

constexpr const char* kTable = "/proc/thread-self/mountinfo";

/// The text of a field of the table, in which odd characters stand as "\ooo".
std::string unescaped(std::string_view field) {
    std::string text;
    for (std::size_t i = 0; i < field.size(); ++i) {
        const std::string_view digits = field.substr(i + 1, 3);
        const bool isEscape =
            field[i] == '\\' && digits.size() == 3 &&
            std::ranges::all_of(digits, [](char c) { return c >= '0' && c <= '7'; });
        if (isEscape) {
            text += static_cast<char>((digits[0] - '0') << 6 | (digits[1] - '0') << 3 |
                                      (digits[2] - '0'));
            i += 3;
        } else {
            text += field[i];
        }
    }
    return text;
}

}  // namespace

bool MountTable::Mount::isOwn() const {
    return std::ranges::find(kOwn, type) != kOwn.end();
}

/// The kernel says so of a table that is open. One that cannot be opened may always have changed.
bool MountTable::hasChanged() {
    if (!table_) {
        table_.reset(::open(kTable, O_RDONLY | O_CLOEXEC));
        return true;
    }
    pollfd table{table_.get(), POLLPRI, 0};
    return ::poll(&table, 1, 0) != 0;
}

void MountTable::refresh() {
    if (!hasChanged() && root_) return;
    std::ifstream table(kTable);
    std::map<Place, Mount> mounts;
    std::set<int> ids;
    for (std::string line; std::getline(table, line);) {
        // id, parent, device, root, place, options, any number of fields, "-", type, ...
        std::istringstream fields(line);
        Mount mount;
        int parent = 0;
        unsigned int major = 0, minor = 0;
        char colon = 0;
        std::string field;
        fields >> mount.id >> parent >> major >> colon >> minor >> field >> mount.place;
        while (fields >> field && field != "-") continue;
        if (!(fields >> mount.type)) continue;
        mount.device = ::makedev(major, minor);
        mount.place = unescaped(mount.place);
        ids.insert(mount.id);
        Place place(parent, mount.place);
        mounts.insert_or_assign(std::move(place), std::move(mount));
    }
    if (mounts.empty()) return;
    mounts_ = std::move(mounts);
    root_ = nullptr;
    own_.clear();
    for (const auto& [place, mount] : mounts_) {
        if (place.second == "/" && !ids.contains(place.first)) root_ = &mount;
        if (mount.isOwn()) own_.insert(mount.id);
    }
}

/// The mount on top of those at a place, when one comes there on `mount`.
const MountTable::Mount* MountTable::entered(const Mount* mount, const std::string& place) const {
    for (auto above = mounts_.find({mount->id, place}); above != mounts_.end();
         above = mounts_.find({mount->id, place}))
        mount = &above->second;
    return mount;
}

const MountTable::Mount* MountTable::of(const std::string& path) const {
    if (!root_) return nullptr;
    const Mount* mount = entered(root_, "/");
    for (std::size_t end = 0; end != std::string::npos && end + 1 < path.size();) {
        end = path.find('/', end + 1);
        mount = entered(mount, path.substr(0, end));
    }
    return mount;
}

std::vector<const MountTable::Mount*> MountTable::within(const std::string& path) const {
    std::vector<const Mount*> found;
    const std::string inside = path.ends_with('/') ? path : path + '/';
    for (const auto& [place, mount] : mounts_)
        if (mount.place.size() > inside.size() && mount.place.starts_with(inside) &&
            of(mount.place) == &mount)
            found.push_back(&mount);
    return found;
}

}  // namespace platform
