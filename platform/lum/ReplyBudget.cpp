#include "platform/lum/ReplyBudget.h"

#include <fmt/format.h>

#include <algorithm>
#include <utility>

namespace platform::lum {

bool ReplyBudget::hasRoom(const Tally& tally, std::int64_t limit, std::int64_t wanted) const {
    if (tally.inService == 0) return !isOverfull(tally, limit, wanted);
    return tally.held + (tally.inService + 1) * expected_ <= limit;
}

bool ReplyBudget::isOverfull(const Tally& tally, std::int64_t limit,
                             std::int64_t /*wanted*/) const {
    return tally.held > limit;
}

bool ReplyBudget::tryEnter(const Share& share) {
    std::lock_guard lock(mutex_);
    Account& account = accountOf(share);
    if (!mayTake(account, 0)) return false;
    account.inService += 1;
    total_.inService += 1;
    return true;
}

void ReplyBudget::leave(const Share& share) {
    std::unique_lock lock(mutex_);
    accountOf(share).inService -= 1;
    total_.inService -= 1;
    heldChanged(0);
    wake(std::move(lock));
}

void ReplyBudget::heldChanged(std::int64_t by) {
    expected_ = std::max(expected_, by);
    // One client's large replies are no reason to serve others one by one for ever after.
    if (total_.held == 0 && total_.inService == 0) expected_ = kMaxUnsentPerConnection;
}

std::string ReplyBudget::blame(std::int64_t held) const {
    return fmt::format("it does not read its replies, {} bytes, and others wait", held);
}

}  // namespace platform::lum
