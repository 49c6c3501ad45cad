#include "platform/threads/SyncQueue.h"

namespace platform {

// The owner is compared only with the calling thread itself, whose own writes it always sees, so no
// ordering is needed: another thread's id, stale or not, never equals ours.

SyncQueue::Entry::Entry(SyncQueue& queue, CodePlace place) : queue_(queue) {
    if (queue_.owner_.load(std::memory_order_relaxed) == std::this_thread::get_id())
        programmingError("queue \"" + queue_.label_ + "\" was entered again from inside", place);
    queue_.mutex_.lock();
    queue_.owner_.store(std::this_thread::get_id(), std::memory_order_relaxed);
}

SyncQueue::Entry::~Entry() {
    queue_.owner_.store(std::thread::id(), std::memory_order_relaxed);
    queue_.mutex_.unlock();
}

void SyncQueue::assertCurrent(CodePlace place) const {
    if (owner_.load(std::memory_order_relaxed) != std::this_thread::get_id())
        programmingError("not inside queue \"" + label_ + "\"", place);
}

}  // namespace platform
