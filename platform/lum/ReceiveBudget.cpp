#include "platform/lum/ReceiveBudget.h"

#include <fmt/format.h>

namespace platform::lum {

bool ReceiveBudget::tryTake(Share& share, std::size_t bytes) {
    const auto count = static_cast<std::int64_t>(bytes);
    std::lock_guard lock(mutex_);
    if (!mayTake(accountOf(share), count)) return false;
    changeHeld(share, count);
    return true;
}

std::string ReceiveBudget::blame(std::int64_t held) const {
    return fmt::format("its requests, {} bytes, do not go on, and others wait", held);
}

}  // namespace platform::lum
