#pragma once

#include <chrono>
#include <functional>
#include <memory>

namespace platform {

/// Waits for file descriptors, timers and posted work on one thread, the one inside `run`. All
/// callbacks run there. `post`, `stop` and the making of watches may be called from any thread;
/// watches and timers are otherwise used on the loop's thread.
class RunLoop {
  public:
    RunLoop();
    RunLoop(const RunLoop&) = delete;
    ~RunLoop();

    /// Runs callbacks until `stop`. Work posted before is run first.
    void run();
    /// Makes `run` return soon; work that is still queued is not run.
    void stop();
    /// Makes `run` return once nothing is queued, watched or awaited any more.
    void finish();

    /// Runs what is ready, without waiting for more. For tests that step a loop. Answers how many
    /// callbacks ran.
    std::size_t poll();
    /// Waits at most `timeout` for one callback to be ready and runs it; answers whether one ran.
    bool runOnce(std::chrono::milliseconds timeout);

    /// Enqueues work; pieces of work run in the order in which they were posted.
    void post(std::function<void()> work);

    /// Whether the caller runs inside this loop.
    bool isCurrent() const;

    class Watch;
    class Timer;

  private:
    struct State;
    std::unique_ptr<State> state_;
};

/// Waits for events of one file descriptor, which it borrows: the owner keeps it open until the
/// watch is gone, and watches it only once at a time. Each await is for one event; awaiting again
/// replaces nothing and may be done from inside the callback. A callback may run although a
/// following read or write would block. Destroying the watch (on the loop's thread) drops its
/// callbacks without running them.
class RunLoop::Watch {
  public:
    Watch(RunLoop& loop, int fd);
    Watch(const Watch&) = delete;
    ~Watch();

    void awaitReadable(std::function<void()> callback);
    void awaitWritable(std::function<void()> callback);
    /// Both ends have closed, or the descriptor has an error.
    void awaitHangup(std::function<void()> callback);

  private:
    struct State;
    std::shared_ptr<State> state_;
};

/// A one-shot timer. Starting it again replaces the earlier start; destroying it drops the
/// callback.
class RunLoop::Timer {
  public:
    explicit Timer(RunLoop& loop);
    Timer(const Timer&) = delete;
    ~Timer();

    void start(std::chrono::milliseconds delay, std::function<void()> callback);
    void cancel();

  private:
    struct State;
    std::shared_ptr<State> state_;
};

}  // namespace platform
