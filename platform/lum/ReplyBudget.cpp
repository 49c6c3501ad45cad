#include "platform/lum/ReplyBudget.h"

#include <utility>

namespace platform::lum {

bool ReplyBudget::hasRoom() const {
    constexpr auto kLimit = static_cast<std::int64_t>(kMaxUnsentTotal);
    if (inService_ == 0) return held_ <= kLimit;
    return held_ + (inService_ + 1) * expected_ <= kLimit;
}

bool ReplyBudget::tryEnter() {
    std::lock_guard lock(mutex_);
    if ((isAwaited_ && !retrying_) || !hasRoom()) return false;
    inService_ += 1;
    return true;
}

void ReplyBudget::await(std::function<void()> retry) {
    awaiting_.push_back(std::move(retry));
    std::unique_lock lock(mutex_);
    isAwaited_ = true;
    wake(std::move(lock));  // room may have come since the refusal
}

void ReplyBudget::leave() {
    std::unique_lock lock(mutex_);
    inService_ -= 1;
    wake(std::move(lock));
}

void ReplyBudget::add(std::size_t bytes) {
    const auto count = static_cast<std::int64_t>(bytes);
    std::lock_guard lock(mutex_);
    held_ += count;
    expected_ = std::max(expected_, count);
}

void ReplyBudget::remove(std::size_t bytes) {
    if (bytes == 0) return;
    std::unique_lock lock(mutex_);
    held_ -= static_cast<std::int64_t>(bytes);
    wake(std::move(lock));
}

void ReplyBudget::wake(std::unique_lock<std::mutex> lock) {
    if (!isAwaited_ || retryPosted_ || !hasRoom()) return;
    retryPosted_ = true;
    lock.unlock();
    loop_.post([weak = weak_from_this()] {
        if (auto self = weak.lock()) self->retryAwaiting();
    });
}

void ReplyBudget::retryAwaiting() {
    {
        std::lock_guard lock(mutex_);
        retryPosted_ = false;
    }
    retrying_ = true;
    const auto roomLeft = [this] {
        std::lock_guard lock(mutex_);
        return hasRoom();
    };
    // Whoever is refused again goes to the end; each is called at most once.
    for (std::size_t count = awaiting_.size(); count > 0 && roomLeft(); --count) {
        auto retry = std::move(awaiting_.front());
        awaiting_.pop_front();
        retry();
    }
    retrying_ = false;
    std::lock_guard lock(mutex_);
    isAwaited_ = !awaiting_.empty();
}

}  // namespace platform::lum
