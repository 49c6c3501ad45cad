#include "platform/lum/Pool.h"

#include <utility>

namespace platform {

struct Pool::Share::State {
    const std::size_t size;
    const std::size_t mostOfOne;
    std::mutex mutex;  // guards what follows
    std::size_t drawn = 0;
    std::map<Origin, std::size_t> byOrigin;
};

Pool::Pool(std::size_t size, std::size_t mostOfOne)
    : state_(new Share::State{size, mostOfOne, {}, 0, {}}) {}

std::size_t Pool::mostOfOne() const {
    return state_->mostOfOne;
}

std::optional<Pool::Share> Pool::draw(const Origin& origin, std::size_t count) {
    const std::lock_guard lock(state_->mutex);
    const auto place = state_->byOrigin.try_emplace(origin).first;
    // What is left is never less than nothing, whatever is asked for.
    if (count > state_->size - state_->drawn || count > mostOfOne() - place->second) {
        if (place->second == 0) state_->byOrigin.erase(place);
        return std::nullopt;
    }
    place->second += count;
    state_->drawn += count;
    return Share(state_, origin, count);
}

Pool::Share& Pool::Share::operator=(Share&& other) noexcept {
    std::swap(state_, other.state_);
    std::swap(origin_, other.origin_);
    std::swap(count_, other.count_);
    return *this;
}

Pool::Share::~Share() {
    if (!state_) return;
    const std::lock_guard lock(state_->mutex);
    state_->drawn -= count_;
    const auto place = state_->byOrigin.find(origin_);
    if ((place->second -= count_) == 0) state_->byOrigin.erase(place);
}

}  // namespace platform
