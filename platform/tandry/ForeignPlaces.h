#pragma once

#include <cstdint>
#include <mutex>
#include <set>
#include <string>
#include <unordered_set>
#include <vector>

#include "platform/system/MountTable.h"

namespace platform::tandry {

/// Where a walk over the disk may have to wait for somebody else: a server may be away, and the
/// program behind a mount of a user's own may do what it likes. Mounts that an earlier walk still
/// waits for are left alone, whichever links lead there, and who waits for this walk can tell where
/// it is. Belongs to the walk's thread, but for the last operations.
class ForeignPlaces {
  public:
    /// Thrown in a walk that has been given up: it ends where it is.
    struct GivenUp {};

    /// To be called before each walk, and before the first question: learns what is mounted where.
    void beginWalk();
    /// From now on these mounts, by their ids, are left alone.
    void avoid(std::set<int> mounts) { avoided_ = std::move(mounts); }

    /// Whether what a path leads to can be looked at. Otherwise `unseen` says where that lies. To
    /// be called before each look at something else.
    bool answers(const std::string& path, std::string* unseen = nullptr);
    /// The same for a path and all that lies within.
    bool answersWithin(const std::string& path);
    /// The same for an entry of a directory that answers, when it is known to be no symbolic link.
    bool entryAnswersWithin(const std::string& path);
    /// The walk gets on.
    void step() { noteAt({}); }

    std::uint64_t steps() const;
    /// Where the walk is.
    std::string place() const;
    /// The mounts that the walk may be waiting for, but for the kernel's own.
    std::set<int> awaited() const;
    void giveUp();

  private:
    bool isAvoided(const std::string& path) const;
    bool holdsAvoided(const std::string& path) const;
    void noteAt(std::vector<std::string> places);

    MountTable mounts_;
    std::set<int> avoided_;
    std::unordered_set<std::string> known_;  // directories on which no link lies, in this walk

    mutable std::mutex mutex_;         // guards what follows
    std::vector<std::string> places_;  // where the walk is, and links by which it has come there
    std::uint64_t steps_ = 0;
    bool isGivenUp_ = false;
};

}  // namespace platform::tandry
