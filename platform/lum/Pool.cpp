#include "platform/lum/Pool.h"

#include <algorithm>
#include <utility>

namespace platform {

struct Pool::Share::State {
    const std::size_t size;
    std::mutex mutex;  // guards what follows
    std::size_t drawn = 0;
    std::map<Origin, std::size_t> byOrigin;
};

Pool::Pool(std::size_t size) : state_(new Share::State{size, {}, 0, {}}) {}

std::size_t Pool::quarter() const {
    return std::max<std::size_t>(state_->size / 4, 1);
}

std::optional<Pool::Share> Pool::draw(const Origin& origin) {
    const std::lock_guard lock(state_->mutex);
    const auto place = state_->byOrigin.try_emplace(origin).first;
    if (state_->drawn >= state_->size || place->second >= quarter()) {
        if (place->second == 0) state_->byOrigin.erase(place);
        return std::nullopt;
    }
    ++place->second;
    ++state_->drawn;
    return Share(state_, origin);
}

Pool::Share& Pool::Share::operator=(Share&& other) noexcept {
    std::swap(state_, other.state_);
    std::swap(origin_, other.origin_);
    return *this;
}

Pool::Share::~Share() {
    if (!state_) return;
    const std::lock_guard lock(state_->mutex);
    --state_->drawn;
    const auto place = state_->byOrigin.find(origin_);
    if (--place->second == 0) state_->byOrigin.erase(place);
}

}  // namespace platform
