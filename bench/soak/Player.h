#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "bench/World.h"

namespace bench {

/// What a player has to tell at the end: how often it did its work, and how long each time took (in
/// microseconds; the slowest of all, and the value that one in a hundred was above).
struct Tally {
    std::uint64_t rounds = 0;
    double p99 = 0;
    double most = 0;
    char failure[200] = {};  // the last; an honest one gives up with it
};

/// Somebody who does the same work again and again: one round of it, which may keep what it needs
/// for the next. An honest one's throws a `Failure` when it does not get what it is due; a hostile
/// one's may fail as it likes.
using Work = std::function<void()>;

/// A kind of player.
struct Part {
    const char* name;
    bool isHonest;
    int pause;  // between rounds, in milliseconds
    std::function<Work(const World&)> begin;
};

/// Those who are due what they ask for, the one first whose requests are small; and those who do
/// what they should not.
const std::vector<Part>& honestParts();
const std::vector<Part>& hostileParts();

/// Applications of a world, by number, that a part has for itself.
enum Ground : int { kAsked, kStarted, kHeld, kComing, kAttacked };
std::string applicationOf(const World& world, Ground ground);

/// A process that plays a part, in a session of its own: one origin. Hostile ones leave the
/// processors to everybody else, so that what is measured is what the daemon does for them. Gone
/// when the object is gone, and when this process dies. To be made while this process has one
/// thread.
class Player {
  public:
    Player(const Part& part, const World& world);
    Player(Player&& other) noexcept;
    ~Player();

    /// Ends it, and answers what it has to tell.
    Tally stop();

  private:
    pid_t pid_ = -1;
    platform::UniqueFd child_;
};

}  // namespace bench
