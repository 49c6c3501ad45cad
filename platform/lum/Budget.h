#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_set>
#include <vector>

#include "platform/lum/Origin.h"
#include "platform/lum/StallClock.h"
#include "platform/threads/RunLoop.h"

namespace platform::lum {

/// Keeps memory that peers can make grow bounded over all connections of a listener. Each
/// connection has a share, in which it counts what it holds. The shares of one origin together may
/// hold a quarter of all. Whoever finds no room waits in its origin's line and is called when there
/// is some, one of each origin in turn: those who wait for room of their own origin are passed by.
///
/// Nobody waits for long because of a peer that does nothing: while what is held stands in the way
/// of those in line, holders whose peers are stalled for longer than the budget's patience are cut
/// off, the largest first, until it does not. Patience is short once somebody has waited for all of
/// it, so that peers that stall in turn do not make others wait in turn. Where an origin has used
/// up its quarter, it stands in its own way alone.
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

    /// The share of a connection from there.
    std::shared_ptr<Share> open(const Origin& origin);
    /// Lets go of the loop: nobody in line is called any more. On the loop, or while it does not
    /// run.
    void close();

  protected:
    /// What is held, and how many requests are in service.
    struct Tally {
        std::int64_t held = 0;
        std::int64_t inService = 0;
    };
    /// One origin's, as long as it has a share.
    struct Account : Tally {
        std::unordered_set<Share*> shares;
        std::deque<Share*> line;
    };

    /// `loop` must outlive it, or its closing. `limit` is for all.
    Budget(RunLoop& loop, std::size_t limit, std::chrono::milliseconds patience);
    virtual ~Budget() = default;

    // Called under the mutex.
    /// Whether there is room below a limit for one who wants so many bytes.
    virtual bool hasRoom(const Tally& tally, std::int64_t limit, std::int64_t wanted) const = 0;
    /// Whether it is what is held that leaves no room.
    virtual bool isOverfull(const Tally& tally, std::int64_t limit, std::int64_t wanted) const = 0;
    virtual void heldChanged(std::int64_t /*by*/) {}

    virtual std::string blame(std::int64_t held) const = 0;

    /// Whether the caller, on the loop, finds room and is behind nobody in line.
    bool mayTake(const Account& account, std::int64_t wanted) const;
    /// Calls those in line, or looks who is stalled, if there is reason to.
    void wake(std::unique_lock<std::mutex> lock);
    void changeHeld(Share& share, std::int64_t by);

    static Account& accountOf(const Share& share);

    std::mutex mutex_;  // guards what follows
    /// What an origin holds beyond its quarter does not count in it: that is in nobody else's way.
    Tally total_;

  private:
    struct Candidate;

    const std::int64_t limit_;
    const std::int64_t quarter_;

    bool hasOwnRoom(const Account& waiting) const;
    std::deque<Account*>::iterator nextWithRoom();
    bool isHeldUp(const Account& waiting) const;
    bool isInTheWay(const Account& account, const Account& waiting) const;
    bool needsRelief() const;
    void enterLine(Share& share);
    void leaveLine(Share& share);
    void serveLine();
    std::vector<Candidate> candidates(StallClock::Time now);
    bool isInTheWay(const Origin& origin);
    void relieve();

    std::map<Origin, Account> accounts_;
    std::deque<Account*> line_;  // those who have somebody in line
    std::size_t waiting_ = 0;    // how many that are together
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
    Share(std::shared_ptr<Budget> budget, const Origin& origin);
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
    const Origin origin_;
    Account* account_ = nullptr;  // set once
    bool waits_ = false;          // this and the next are the loop's
    /// Since when it finds no room, called in vain or not; none while it does not look for any.
    std::optional<StallClock::Time> waitsSince_;
    std::weak_ptr<Holder> holder_;  // this and what follows is guarded by the budget's mutex
    std::int64_t held_ = 0;
    std::int64_t wanted_ = 0;
};

}  // namespace platform::lum
