#include "platform/threads/SerialQueue.h"

#include <pthread.h>

#include <thread>
#include <utility>

#include "platform/threads/RunLoop.h"

namespace platform {

struct SerialQueue::State {
    std::string label;
    std::unique_ptr<RunLoop> ownLoop;  // null on somebody else's loop
    RunLoop& loop;
    std::thread thread;

    explicit State(std::string text)
        : label(std::move(text)), ownLoop(std::make_unique<RunLoop>()), loop(*ownLoop) {}
    State(std::string text, RunLoop& other) : label(std::move(text)), loop(other) {}
};

SerialQueue::SerialQueue(std::string label) : state_(std::make_unique<State>(std::move(label))) {
    State& state = *state_;
    state.thread = std::thread([&state] {
        constexpr std::size_t kLongestThreadName = 15;
        pthread_setname_np(pthread_self(), state.label.substr(0, kLongestThreadName).c_str());
        state.loop.run();
    });
}

SerialQueue::SerialQueue(std::string label, RunLoop& loop)
    : state_(std::make_unique<State>(std::move(label), loop)) {}

SerialQueue::~SerialQueue() {
    if (!state_->thread.joinable()) return;
    if (isCurrent())
        programmingError("queue \"" + state_->label + "\" was destroyed on its own thread");
    // Stopping by a piece of work lets what was submitted before it run, and does not wait for
    // descriptors that are still watched.
    state_->loop.post([&loop = state_->loop] { loop.stop(); });
    state_->thread.join();
}

void SerialQueue::async(std::function<void()> work) {
    state_->loop.post(std::move(work));
}

bool SerialQueue::isCurrent() const {
    return state_->loop.isCurrent();
}

void SerialQueue::assertCurrent(CodePlace place) const {
    if (!isCurrent()) programmingError("not on queue \"" + state_->label + "\"", place);
}

const std::string& SerialQueue::label() const {
    return state_->label;
}

RunLoop& SerialQueue::runLoop() {
    return state_->loop;
}

}  // namespace platform
