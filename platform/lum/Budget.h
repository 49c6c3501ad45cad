#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_set>

#include "platform/lum/StallClock.h"
#include "platform/threads/RunLoop.h"

namespace platform::lum {

/// Keeps memory that peers can make grow bounded over all connections of a listener. Each
/// connection has a share, in which it counts what it holds. Whoever finds no room waits in line
/// and is called when there is some.
///
/// Nobody waits for long because of a peer that does nothing: while what is held stands in the way
/// of those in line, holders whose peers are stalled for longer than the budget's patience are cut
/// off, the largest first, until it does not. Patience is short once somebody has waited for all of
/// it, so that peers that stall in turn do not make others wait in turn.
class Budget : public std::enable_shared_from_this<Budget> {
  public:
    /// A connection, as the budget sees it. Called on the loop.
    class Holder {
      public:
        /// There may be room now.
        virtual void retry() = 0;
        /// Since when its peer has done nothing for what it holds in `budget` to become less; none
        /// when that is not up to the peer.
        virtual std::optional<StallClock::Time> stalledSince(const Budget& budget) const = 0;
        virtual void cutOff(const std::string& reason) = 0;

      protected:
        ~Holder() = default;
    };
    class Share;

    Budget(const Budget&) = delete;

    std::shared_ptr<Share> open();
    /// Lets go of the loop: nobody in line is called any more. On the loop, or while it does not
    /// run.
    void close();

  protected:
    /// `loop` must outlive it, or its closing.
    Budget(RunLoop& loop, std::chrono::milliseconds patience);
    virtual ~Budget() = default;

    // Called under the mutex; the first two only while somebody is in line.
    /// Whether the first in line can have what it waits for.
    virtual bool hasRoom() const = 0;
    /// Whether what is held stands in the way of those in line.
    virtual bool isOverfull() const = 0;
    virtual void heldChanged(std::int64_t /*by*/) {}

    virtual std::string blame(std::int64_t held) const = 0;

    /// Calls those in line, or looks who is stalled, if there is reason to.
    void wake(std::unique_lock<std::mutex> lock);
    void changeHeld(Share& share, std::int64_t by);
    /// What the first in line waits for.
    std::int64_t firstWanted() const;
    /// Whether the caller, on the loop, is behind somebody in line.
    bool isBehind() const { return !line_.empty() && !serving_; }

    std::mutex mutex_;  // guards what follows
    std::int64_t held_ = 0;
    std::deque<Share*> line_;

  private:
    bool needsRelief() const { return !line_.empty() && isOverfull(); }
    void serveLine();
    void relieve();
    std::chrono::milliseconds patienceAt(StallClock::Time now);

    std::unordered_set<Share*> shares_;
    bool attentionPosted_ = false;
    bool watching_ = false;  // the timer runs

    RunLoop& loop_;  // this and what follows is the loop's
    const std::chrono::milliseconds patience_;
    std::optional<RunLoop::Timer> timer_;
    bool serving_ = false;
};

/// What one connection holds. Waiting in line belongs to the loop; the others may be called from
/// any thread. Its end releases what it still holds.
class Budget::Share {
  public:
    explicit Share(std::shared_ptr<Budget> budget);
    Share(const Share&) = delete;
    ~Share();

    /// Needed before waiting, and to be held responsible.
    void setHolder(std::weak_ptr<Holder> holder);

    /// Bytes come and go. They may be reported in either order.
    void add(std::size_t bytes);
    void remove(std::size_t bytes);

    /// Enters the line, for `bytes` more; whoever is in line already changes that number. Being
    /// called ends it.
    void await(std::size_t bytes = 0);
    /// Room was found, or is not looked for any more.
    void stopWaiting();
    bool isWaiting() const { return waits_; }

  private:
    friend class Budget;
    const std::shared_ptr<Budget> budget_;
    bool waits_ = false;  // this and the next are the loop's
    /// Since when it finds no room, called in vain or not; none while it does not look for any.
    std::optional<StallClock::Time> waitsSince_;
    std::weak_ptr<Holder> holder_;  // this and what follows is guarded by the budget's mutex
    std::int64_t held_ = 0;
    std::int64_t wanted_ = 0;
};

}  // namespace platform::lum
