#include "platform/lum/Decoder.h"

#include <sys/resource.h>

#include <utility>

namespace platform::lum {

namespace {

/// Who sends much waits rather than everybody else: where processors are few, the other threads go
/// first.
constexpr int kNice = 5;

std::unique_ptr<SerialQueue> makeQueue() {
    auto queue = std::make_unique<SerialQueue>("decoder");
    queue->async([] { ::setpriority(PRIO_PROCESS, 0, kNice); });  // Linux: of this thread
    return queue;
}

}  // namespace

void Decoder::async(const Origin& origin, Work work) {
    std::lock_guard lock(mutex_);
    if (closed_) return;
    if (!queue_) queue_ = makeQueue();
    auto& line = lines_[origin];
    if (line.empty()) turns_.push_back(origin);
    line.push_back(std::move(work));
    queue_->async([this] { doNext(); });
}

void Decoder::doNext() {
    Work work;
    {
        std::lock_guard lock(mutex_);
        const auto line = lines_.find(turns_.front());
        work = std::move(line->second.front());
        line->second.pop_front();
        if (line->second.empty())
            lines_.erase(line);
        else
            turns_.push_back(turns_.front());
        turns_.pop_front();
    }
    work();
}

void Decoder::close() {
    std::unique_ptr<SerialQueue> queue;
    {
        std::lock_guard lock(mutex_);
        closed_ = true;
        queue = std::move(queue_);
    }
}

}  // namespace platform::lum
