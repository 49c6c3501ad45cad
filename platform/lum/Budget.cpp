#include "platform/lum/Budget.h"

#include <algorithm>
#include <utility>

namespace platform::lum {

using Clock = std::chrono::steady_clock;

Budget::Budget(RunLoop& loop, std::size_t limit, std::chrono::milliseconds patience)
    : limit_(static_cast<std::int64_t>(limit)),
      quarter_(limit_ / 4),
      loop_(loop),
      patience_(patience),
      timer_(std::in_place, loop) {}

std::shared_ptr<Budget::Share> Budget::open(const Origin& origin) {
    return std::make_shared<Share>(shared_from_this(), origin);
}

void Budget::close() {
    timer_.reset();
    std::lock_guard lock(mutex_);
    for (Account* account : std::exchange(line_, {}))
        for (Share* share : std::exchange(account->line, {})) share->waits_ = false;
    waiting_ = 0;
}

Budget::Account& Budget::accountOf(const Share& share) {
    return *share.account_;
}

void Budget::changeHeld(Share& share, std::int64_t by) {
    Account& account = *share.account_;
    share.held_ += by;
    total_.held -= std::min(account.held, quarter_);
    account.held += by;
    total_.held += std::min(account.held, quarter_);
    heldChanged(by);
}

/// Whether the first in an origin's line could have what it waits for, as far as that origin goes.
bool Budget::hasOwnRoom(const Account& waiting) const {
    return hasRoom(waiting, quarter_, waiting.line.front()->wanted_);
}

bool Budget::mayTake(const Account& account, std::int64_t wanted) const {
    // Those who wait for everybody's room come first; those who wait for their own are in nobody's
    // way but that of their origin.
    const auto isAhead = [&](const Account* waiting) {
        return waiting == &account || hasOwnRoom(*waiting);
    };
    if (!serving_ && std::ranges::any_of(line_, isAhead)) return false;
    return hasRoom(account, quarter_, wanted) && hasRoom(total_, limit_, wanted);
}

/// The origin whose first in line is to be called next. Small wants do not overtake a large one for
/// which there is no room yet, except where its own origin has none.
std::deque<Budget::Account*>::iterator Budget::nextWithRoom() {
    const auto next = std::ranges::find_if(
        line_, [this](const Account* waiting) { return hasOwnRoom(*waiting); });
    if (next == line_.end()) return next;
    return hasRoom(total_, limit_, (*next)->line.front()->wanted_) ? next : line_.end();
}

/// Whether it is what others, or they themselves, hold that makes those of an origin wait.
bool Budget::isHeldUp(const Account& waiting) const {
    const std::int64_t wanted = waiting.line.front()->wanted_;
    return hasOwnRoom(waiting) ? isOverfull(total_, limit_, wanted)
                               : isOverfull(waiting, quarter_, wanted);
}

bool Budget::isInTheWay(const Account& account, const Account& waiting) const {
    return isHeldUp(waiting) && (&account == &waiting || hasOwnRoom(waiting));
}

bool Budget::needsRelief() const {
    return std::ranges::any_of(line_,
                               [this](const Account* waiting) { return isHeldUp(*waiting); });
}

void Budget::wake(std::unique_lock<std::mutex> lock) {
    if (line_.empty() || attentionPosted_) return;
    if (nextWithRoom() == line_.end() && (watching_ || !needsRelief())) return;
    attentionPosted_ = true;
    lock.unlock();
    loop_.post([weak = weak_from_this()] {
        auto self = weak.lock();
        if (!self) return;
        self->serveLine();
        self->relieve();
    });
}

void Budget::enterLine(Share& share) {
    if (share.account_->line.empty()) line_.push_back(share.account_);
    share.account_->line.push_back(&share);
    ++waiting_;
}

void Budget::leaveLine(Share& share) {
    Account& account = *share.account_;
    if (std::erase(account.line, &share) == 0) return;
    if (account.line.empty()) std::erase(line_, &account);
    --waiting_;
}

void Budget::serveLine() {
    std::unique_lock lock(mutex_);
    attentionPosted_ = false;
    serving_ = true;
    // Whoever finds too little room goes to the end of its line, and its origin's turn is over.
    for (std::size_t count = waiting_; count > 0; --count) {
        const auto next = nextWithRoom();
        if (next == line_.end()) break;
        Account& account = **next;
        line_.erase(next);
        Share& first = *account.line.front();
        account.line.pop_front();
        if (!account.line.empty()) line_.push_back(&account);
        --waiting_;
        first.waits_ = false;
        auto holder = first.holder_.lock();
        lock.unlock();
        if (holder) holder->retry();
        holder.reset();
        lock.lock();
    }
    serving_ = false;
}

/// Somebody whose share stands in the way of others, and how long its peer may be stalled.
struct Budget::Candidate {
    std::int64_t held;
    Origin origin;
    std::weak_ptr<Holder> holder;
    std::chrono::milliseconds patience;
};

/// The largest first.
std::vector<Budget::Candidate> Budget::candidates(StallClock::Time now) {
    constexpr int kHurry = 20;
    const auto hasWaited = [&](const Share* share) {
        return now - *share->waitsSince_ >= patience_;
    };
    std::lock_guard lock(mutex_);
    watching_ = false;
    std::vector<Candidate> found;
    for (const auto& [origin, account] : accounts_) {
        bool isAwaited = false;
        bool isUsedUp = false;
        for (const Account* waiting : line_) {
            if (!isInTheWay(account, *waiting)) continue;
            isAwaited = true;
            isUsedUp = isUsedUp || std::ranges::any_of(waiting->line, hasWaited);
        }
        if (!isAwaited) continue;
        for (const Share* share : account.shares)
            if (share->held_ > 0)
                found.push_back({share->held_, origin, share->holder_,
                                 isUsedUp ? patience_ / kHurry : patience_});
    }
    std::ranges::sort(found, std::ranges::greater(), &Candidate::held);
    return found;
}

bool Budget::isInTheWay(const Origin& origin) {
    std::lock_guard lock(mutex_);
    const auto account = accounts_.find(origin);
    return account != accounts_.end() && std::ranges::any_of(line_, [&](const Account* waiting) {
               return isInTheWay(account->second, *waiting);
           });
}

void Budget::relieve() {
    if (!timer_) return;
    const auto now = Clock::now();
    auto next = now + patience_;
    for (const auto& [held, origin, weak, patience] : candidates(now)) {
        if (!isInTheWay(origin)) continue;
        const auto holder = weak.lock();
        const auto since = holder ? holder->stalledSince(*this) : std::nullopt;
        const bool isDue = since && now - *since >= patience;
        next = std::min(next, (isDue ? now : since.value_or(now)) + patience);
        if (isDue) holder->cutOff(blame(held));
    }
    {
        std::lock_guard lock(mutex_);
        if (!needsRelief()) return;
        watching_ = true;
    }
    if (timer_)
        timer_->start(std::chrono::ceil<std::chrono::milliseconds>(next - now),
                      [this] { relieve(); });
}

Budget::Share::Share(std::shared_ptr<Budget> budget, const Origin& origin)
    : budget_(std::move(budget)), origin_(origin) {
    std::lock_guard lock(budget_->mutex_);
    account_ = &budget_->accounts_[origin];
    account_->shares.insert(this);
}

Budget::Share::~Share() {
    std::unique_lock lock(budget_->mutex_);
    budget_->leaveLine(*this);
    budget_->changeHeld(*this, -held_);
    account_->shares.erase(this);
    if (account_->shares.empty()) budget_->accounts_.erase(origin_);
    budget_->wake(std::move(lock));
}

void Budget::Share::setHolder(std::weak_ptr<Holder> holder) {
    std::lock_guard lock(budget_->mutex_);
    holder_ = std::move(holder);
}

void Budget::Share::add(std::size_t bytes) {
    std::unique_lock lock(budget_->mutex_);
    budget_->changeHeld(*this, static_cast<std::int64_t>(bytes));
    budget_->wake(std::move(lock));
}

void Budget::Share::remove(std::size_t bytes) {
    if (bytes == 0) return;
    std::unique_lock lock(budget_->mutex_);
    budget_->changeHeld(*this, -static_cast<std::int64_t>(bytes));
    budget_->wake(std::move(lock));
}

void Budget::Share::await(std::size_t bytes) {
    if (!waitsSince_) waitsSince_ = Clock::now();
    std::unique_lock lock(budget_->mutex_);
    wanted_ = static_cast<std::int64_t>(bytes);
    if (!std::exchange(waits_, true)) budget_->enterLine(*this);
    budget_->wake(std::move(lock));  // room may have come since the refusal
}

void Budget::Share::stopWaiting() {
    waitsSince_.reset();
    if (!waits_) return;
    std::unique_lock lock(budget_->mutex_);
    waits_ = false;
    budget_->leaveLine(*this);
    budget_->wake(std::move(lock));
}

}  // namespace platform::lum
