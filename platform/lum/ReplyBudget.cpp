#include "platform/lum/ReplyBudget.h"

#include <fmt/format.h>

#include <algorithm>
#include <utility>

namespace platform::lum {

constexpr auto kLimit = static_cast<std::int64_t>(kMaxUnsentTotal);

bool ReplyBudget::hasRoom() const {
    if (inService_ == 0) return !isOverfull();
    return held_ + (inService_ + 1) * expected_ <= kLimit;
}

bool ReplyBudget::isOverfull() const {
    return held_ > kLimit;
}

bool ReplyBudget::tryEnter() {
    std::lock_guard lock(mutex_);
    if (isBehind() || !hasRoom()) return false;
    inService_ += 1;
    return true;
}

void ReplyBudget::leave() {
    std::unique_lock lock(mutex_);
    inService_ -= 1;
    heldChanged(0);
    wake(std::move(lock));
}

void ReplyBudget::heldChanged(std::int64_t by) {
    expected_ = std::max(expected_, by);
    // One client's large replies are no reason to serve others one by one for ever after.
    if (held_ == 0 && inService_ == 0) expected_ = kMaxUnsentPerConnection;
}

std::string ReplyBudget::blame(std::int64_t held) const {
    return fmt::format("it does not read its replies, {} bytes, and others wait", held);
}

}  // namespace platform::lum
