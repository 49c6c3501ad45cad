#include "platform/tandry/CurrentSnapshot.h"

#include <utility>

namespace platform::tandry {

void CurrentSnapshot::publish(std::shared_ptr<const Snapshot> snapshot) {
    {
        const std::lock_guard lock(mutex_);
        std::swap(snapshot_, snapshot);
    }
    changed_.notify_all();
    // The previous snapshot may go away here, outside the lock.
}

std::shared_ptr<const Snapshot> CurrentSnapshot::get() {
    std::unique_lock lock(mutex_);
    ++waiting_;
    changed_.wait(lock, [this] { return snapshot_ || closed_; });
    if (--waiting_ == 0 && closed_) changed_.notify_all();
    return closed_ ? nullptr : snapshot_;
}

void CurrentSnapshot::close() {
    std::unique_lock lock(mutex_);
    closed_ = true;
    changed_.notify_all();
    changed_.wait(lock, [this] { return waiting_ == 0; });
}

}  // namespace platform::tandry
