#pragma once

#include <chrono>
#include <functional>
#include <future>
#include <memory>
#include <optional>
#include <set>
#include <vector>

#include "platform/tandry/Disk.h"

namespace platform::tandry {

/// Has walks over the disk made on a thread that may be given up: a file system need not answer,
/// and a thread that waits for it cannot be called back. With it goes the disk that it uses, and
/// the next walk has another one, which knows what was known before. While the thread waits, its
/// mounts are left alone, so that each has one thread at the most. Belongs to the registry's
/// thread; its end waits for the threads.
class DiskWalks {
  public:
    /// Makes a disk of which so much is known.
    using Maker = std::function<std::shared_ptr<Disk>(RegistryState known)>;

    /// A walk is given up that waits for a mount of somebody else's and has made no step for so
    /// long.
    DiskWalks(Maker maker, std::chrono::milliseconds patience);
    DiskWalks(const DiskWalks&) = delete;

    /// The same until a walk is given up.
    const std::shared_ptr<Disk>& disk() const { return disk_; }

    /// Has work done and waits for its result; none when it was given up, which is logged. The work
    /// may go on for a while then, so it refers to nothing but the disk.
    template <class Result>
    std::optional<Result> walk(std::function<Result(Disk&)> work) {
        const auto result = std::make_shared<std::optional<Result>>();
        if (!run([=](Disk& disk) { *result = work(disk); })) return std::nullopt;
        return std::move(*result);
    }

  private:
    bool run(std::function<void(Disk&)> work);
    struct Left {
        std::shared_ptr<Disk> disk;
        std::set<int> mounts;  // that its thread waits for
        std::future<void> end;
    };

    void avoidAwaited();
    bool isGivenUp(Disk& disk, const std::future<void>& end, std::set<int>& mounts) const;

    const Maker maker_;
    const std::chrono::milliseconds patience_;
    std::shared_ptr<Disk> disk_;
    std::vector<Left> left_;
};

}  // namespace platform::tandry
