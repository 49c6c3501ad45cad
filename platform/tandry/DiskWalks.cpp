#include "platform/tandry/DiskWalks.h"

#include <utility>

#include "platform/log/OpsLog.h"

namespace platform::tandry {

namespace {

using namespace std::chrono_literals;

/// A walk is looked after so often within the patience.
constexpr int kPeriods = 4;

bool isOver(const std::future<void>& end, std::chrono::milliseconds time) {
    return end.wait_for(time) == std::future_status::ready;
}

}  // namespace

DiskWalks::DiskWalks(Maker maker, std::chrono::milliseconds patience)
    : maker_(std::move(maker)), patience_(patience), disk_(maker_({})) {}

/// Mounts whose threads are back are looked at again.
void DiskWalks::avoidAwaited() {
    std::erase_if(left_, [](const Left& left) { return isOver(left.end, 0ms); });
    std::set<int> mounts;
    for (const Left& left : left_) mounts.insert(left.mounts.begin(), left.mounts.end());
    disk_->places.avoid(std::move(mounts));
}

bool DiskWalks::run(std::function<void(Disk&)> work) {
    avoidAwaited();
    RegistryState before = disk_->state;
    const auto done = std::make_shared<std::promise<void>>();
    std::future<void> end = done->get_future();
    disk_->thread.async([disk = disk_.get(), work = std::move(work), done] {
        try {
            work(*disk);
        } catch (const ForeignPlaces::GivenUp&) {
            // Nobody waits for what it has found.
        }
        done->set_value();
    });
    std::set<int> mounts;
    if (!isGivenUp(*disk_, end, mounts)) return true;
    left_.push_back({std::move(disk_), std::move(mounts), std::move(end)});
    disk_ = maker_(std::move(before));
    return false;
}

/// Waits for a walk, or until it is given up.
bool DiskWalks::isGivenUp(Disk& disk, const std::future<void>& end, std::set<int>& mounts) const {
    std::uint64_t seen = disk.places.steps();
    for (int withoutStep = 0; !isOver(end, patience_ / kPeriods);) {
        const std::uint64_t steps = disk.places.steps();
        withoutStep = std::exchange(seen, steps) == steps ? withoutStep + 1 : 0;
        if (withoutStep < kPeriods) continue;
        withoutStep = 0;
        mounts = disk.places.awaited();
        if (mounts.empty()) continue;
        disk.places.giveUp();
        EVLOG_ERROR(ops(), "giving up a walk over applications: {} does not answer",
                    disk.places.place());
        return true;
    }
    return false;
}

}  // namespace platform::tandry
