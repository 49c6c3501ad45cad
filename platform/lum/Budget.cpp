#include "platform/lum/Budget.h"

#include <algorithm>
#include <utility>
#include <vector>

namespace platform::lum {

using Clock = std::chrono::steady_clock;

Budget::Budget(RunLoop& loop, std::chrono::milliseconds patience)
    : loop_(loop), patience_(patience), timer_(std::in_place, loop) {}

std::shared_ptr<Budget::Share> Budget::open() {
    return std::make_shared<Share>(shared_from_this());
}

void Budget::close() {
    timer_.reset();
    std::lock_guard lock(mutex_);
    for (Share* share : line_) share->waits_ = false;
    line_.clear();
}

void Budget::changeHeld(Share& share, std::int64_t by) {
    share.held_ += by;
    held_ += by;
    heldChanged(by);
}

std::int64_t Budget::firstWanted() const {
    return line_.front()->wanted_;
}

void Budget::wake(std::unique_lock<std::mutex> lock) {
    if (line_.empty() || attentionPosted_) return;
    if (!hasRoom() && (watching_ || !isOverfull())) return;
    attentionPosted_ = true;
    lock.unlock();
    loop_.post([weak = weak_from_this()] {
        auto self = weak.lock();
        if (!self) return;
        self->serveLine();
        self->relieve();
    });
}

void Budget::serveLine() {
    std::unique_lock lock(mutex_);
    attentionPosted_ = false;
    serving_ = true;
    // Whoever finds too little room goes to the end of the line; each is called at most once.
    for (std::size_t count = line_.size(); count > 0 && !line_.empty() && hasRoom(); --count) {
        Share& first = *line_.front();
        line_.pop_front();
        first.waits_ = false;
        auto holder = first.holder_.lock();
        lock.unlock();
        if (holder) holder->retry();
        holder.reset();
        lock.lock();
    }
    serving_ = false;
}

/// How long a peer may be stalled while others wait.
std::chrono::milliseconds Budget::patienceAt(StallClock::Time now) {
    constexpr int kHurry = 20;
    std::lock_guard lock(mutex_);
    const bool isUsedUp = std::any_of(line_.begin(), line_.end(), [&](const Share* share) {
        return now - *share->waitsSince_ >= patience_;
    });
    return isUsedUp ? patience_ / kHurry : patience_;
}

void Budget::relieve() {
    if (!timer_) return;
    std::vector<std::pair<std::int64_t, std::weak_ptr<Holder>>> holders;
    {
        std::lock_guard lock(mutex_);
        watching_ = false;
        if (!needsRelief()) return;
        for (const Share* share : shares_)
            if (share->held_ > 0) holders.emplace_back(share->held_, share->holder_);
    }
    std::sort(holders.begin(), holders.end(),
              [](const auto& a, const auto& b) { return a.first > b.first; });
    const auto now = Clock::now();
    const auto patience = patienceAt(now);
    auto next = now + patience;
    for (const auto& [held, weak] : holders) {
        const auto holder = weak.lock();
        const auto since = holder ? holder->stalledSince(*this) : std::nullopt;
        if (!since) continue;
        if (now - *since < patience) {
            next = std::min(next, *since + patience);
            continue;
        }
        holder->cutOff(blame(held));
        std::lock_guard lock(mutex_);
        if (!needsRelief()) return;
    }
    if (!timer_) return;
    {
        std::lock_guard lock(mutex_);
        watching_ = true;
    }
    timer_->start(std::chrono::ceil<std::chrono::milliseconds>(next - now), [this] { relieve(); });
}

Budget::Share::Share(std::shared_ptr<Budget> budget) : budget_(std::move(budget)) {
    std::lock_guard lock(budget_->mutex_);
    budget_->shares_.insert(this);
}

Budget::Share::~Share() {
    std::unique_lock lock(budget_->mutex_);
    budget_->shares_.erase(this);
    std::erase(budget_->line_, this);
    budget_->changeHeld(*this, -held_);
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
    if (!std::exchange(waits_, true)) budget_->line_.push_back(this);
    budget_->wake(std::move(lock));  // room may have come since the refusal
}

void Budget::Share::stopWaiting() {
    waitsSince_.reset();
    if (!waits_) return;
    std::unique_lock lock(budget_->mutex_);
    waits_ = false;
    std::erase(budget_->line_, this);
    budget_->wake(std::move(lock));
}

}  // namespace platform::lum
