#include "platform/tandry/ForeignPlaces.h"

#include <dirent.h>
#include <fcntl.h>

#include <algorithm>
#include <array>
#include <fstream>
#include <future>
#include <sstream>
#include <string_view>
#include <utility>

#include "platform/system/Files.h"
#include "platform/system/UniqueFd.h"
#include "platform/tandry/BundleReader.h"
#include "platform/tandry/RegistryState.h"

namespace platform::tandry {

namespace {

/// The kernel's own, on disks and in memory.
constexpr std::array<std::string_view, 14> kOwn{"ext2", "ext3",  "ext4",  "xfs",     "btrfs",
                                                "f2fs", "tmpfs", "ramfs", "overlay", "squashfs",
                                                "vfat", "erofs", "zfs",   "bcachefs"};

/// The text of a field of the table of mounts, in which odd characters stand as "\ooo".
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

/// Looks at what a walk would look at first.
void look(const std::string& path) {
    for (const std::string& place : {path, joinPath(path, "PlugIns")})
        if (DIR* directory = ::opendir(place.c_str())) {
            static_cast<void>(::readdir(directory));
            ::closedir(directory);
        }
    const UniqueFd bundle(::open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (bundle) static_cast<void>(readFileBeneath(bundle.get(), "Info.plist", kMaxBundleFile));
}

}  // namespace

ForeignPlaces::~ForeignPlaces() {
    if (!queue_) return;
    queue_->async([this] { looks_.reset(); });
    queue_.reset();
}

void ForeignPlaces::beginWalk() {
    answers_.clear();
    std::ifstream table("/proc/self/mountinfo");
    if (!table) return;  // what was known serves as well
    mounts_.clear();
    foreign_.clear();
    for (std::string line; std::getline(table, line);) {
        // id, parent, device, root, place, options, any number of fields, "-", type, ...
        std::istringstream fields(line);
        std::string field, place, type;
        for (int i = 0; i < 4; ++i) fields >> field;
        fields >> place;
        while (fields >> field && field != "-") continue;
        if (!(fields >> type)) continue;
        place = unescaped(place);
        // Without the root nothing goes on anyhow.
        const bool isForeign = place != "/" && std::ranges::find(kOwn, type) == kOwn.end();
        if (isForeign) foreign_.push_back(place);
        // Of two at one place, the later one covers the other.
        mounts_[std::move(place)] = isForeign;
    }
}

bool ForeignPlaces::isForeign(const std::string& path) const {
    if (std::ranges::none_of(foreign_, [&](const auto& place) { return isWithin(path, place); }))
        return false;
    // Something else may be mounted there again.
    for (std::string_view place = path; place.size() > 1; place = parentPath(place))
        if (const auto found = mounts_.find(place); found != mounts_.end()) return found->second;
    return false;
}

bool ForeignPlaces::answers(const std::string& path) {
    if (!isForeign(path)) return true;
    const auto [answer, isNew] = answers_.try_emplace(path, false);
    if (isNew) answer->second = ask(path);
    return answer->second;
}

bool ForeignPlaces::ask(const std::string& path) {
    if (!queue_) {
        queue_ = std::make_unique<SerialQueue>("places");
        looks_ = std::make_unique<PlaceLooks>(queue_->runLoop());
    }
    const auto answer = std::make_shared<std::promise<bool>>();
    looks_->make({{path, [path] { look(path); }}},
                 [answer](const std::vector<bool>& done) { answer->set_value(done[0]); });
    return answer->get_future().get();
}

}  // namespace platform::tandry
