#include "platform/lum/Decoder.h"

#include <utility>

namespace platform::lum {

void Decoder::async(const Origin& origin, Work work) {
    std::lock_guard lock(mutex_);
    if (closed_) return;
    if (!queue_) queue_ = std::make_unique<SerialQueue>("decoder");
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
