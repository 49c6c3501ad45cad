#include "platform/threads/RunLoop.h"

#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>
#include <asio/posix/stream_descriptor.hpp>
#include <asio/post.hpp>
#include <asio/steady_timer.hpp>
#include <cstdint>
#include <utility>

#include "platform/log/OpsLog.h"

namespace platform {

struct RunLoop::State {
    // Without a concurrency hint, work posted on the loop's own thread goes through the one common
    // queue too, and the order of posting holds across threads.
    asio::io_context context;
    asio::executor_work_guard<asio::io_context::executor_type> work{context.get_executor()};

    /// A stopped context would run nothing any more: the stop is used up by the call that it ended.
    std::size_t returning(std::size_t count) {
        if (context.stopped()) context.restart();
        return count;
    }
};

RunLoop::RunLoop() : state_(std::make_unique<State>()) {}
RunLoop::~RunLoop() = default;

void RunLoop::run() {
    state_->returning(state_->context.run());
}
void RunLoop::stop() {
    state_->context.stop();
}
void RunLoop::finish() {
    asio::post(state_->context, [this] { state_->work.reset(); });
}

std::size_t RunLoop::poll() {
    return state_->returning(state_->context.poll());
}

bool RunLoop::runOnce(std::chrono::milliseconds timeout) {
    return state_->returning(state_->context.run_one_for(timeout)) > 0;
}

void RunLoop::post(std::function<void()> work) {
    asio::post(state_->context, std::move(work));
}

bool RunLoop::isCurrent() const {
    return state_->context.get_executor().running_in_this_thread();
}

struct RunLoop::Watch::State {
    asio::posix::stream_descriptor descriptor;

    explicit State(asio::io_context& context) : descriptor(context) {}
    // Closing is the owner's business.
    ~State() {
        if (descriptor.is_open()) descriptor.release();
    }
};

RunLoop::Watch::Watch(RunLoop& loop, int fd)
    : state_(std::make_shared<State>(loop.state_->context)) {
    asio::error_code failure;
    state_->descriptor.assign(fd, failure);
    if (failure) {
        EVLOG_ERROR(ops(), "cannot watch descriptor {}: {}", fd, pub(failure.message()));
    }
}

RunLoop::Watch::~Watch() = default;

namespace {

// A callback that is due already when its watch goes away finds the state gone.
template <class WatchState>
void await(const std::shared_ptr<WatchState>& state, asio::posix::stream_descriptor::wait_type what,
           std::function<void()> callback) {
    if (!state->descriptor.is_open()) return;
    state->descriptor.async_wait(
        what, [weak = std::weak_ptr(state), callback = std::move(callback)](asio::error_code ec) {
            if (!ec && !weak.expired()) callback();
        });
}

}  // namespace

void RunLoop::Watch::awaitReadable(std::function<void()> callback) {
    await(state_, asio::posix::stream_descriptor::wait_read, std::move(callback));
}
void RunLoop::Watch::awaitWritable(std::function<void()> callback) {
    await(state_, asio::posix::stream_descriptor::wait_write, std::move(callback));
}
void RunLoop::Watch::awaitHangup(std::function<void()> callback) {
    await(state_, asio::posix::stream_descriptor::wait_error, std::move(callback));
}

struct RunLoop::Timer::State {
    asio::steady_timer timer;
    std::uint64_t starts = 0;  // an expiry that was queued before a later start or cancel is stale

    explicit State(asio::io_context& context) : timer(context) {}
};

RunLoop::Timer::Timer(RunLoop& loop) : state_(std::make_shared<State>(loop.state_->context)) {}
RunLoop::Timer::~Timer() = default;

void RunLoop::Timer::start(std::chrono::milliseconds delay, std::function<void()> callback) {
    state_->starts += 1;
    state_->timer.expires_after(delay);
    state_->timer.async_wait([weak = std::weak_ptr(state_), start = state_->starts,
                              callback = std::move(callback)](asio::error_code ec) {
        auto state = weak.lock();
        if (!ec && state && state->starts == start) callback();
    });
}

void RunLoop::Timer::cancel() {
    state_->starts += 1;
    state_->timer.cancel();
}

}  // namespace platform
