#include "platform/lum/PeerLooks.h"

#include <pthread.h>

#include <condition_variable>
#include <deque>
#include <map>
#include <mutex>
#include <optional>
#include <system_error>
#include <thread>
#include <utility>
#include <vector>

#include "platform/lum/Pool.h"
#include "platform/threads/RunLoop.h"

namespace platform {

namespace {

/// A look is looked after so often within its patience.
constexpr int kPeriods = 4;

struct Job {
    Job(RunLoop& loop, const Origin& from, PeerLooks::Look work, PeerLooks::Outcome then)
        : origin(from), look(std::move(work)), outcome(std::move(then)), timer(loop) {}

    const Origin origin;
    const PeerLooks::Look look;
    PeerLooks::Pace pace;
    // What follows is the loop's.
    PeerLooks::Outcome outcome;  // null once it was told
    RunLoop::Timer timer;
    std::size_t stepsSeen = 0;
    int periodsWithoutStep = 0;
    std::optional<Pool::Share> share;  // of the threads
};
using JobRef = std::shared_ptr<Job>;

}  // namespace

struct PeerLooks::State : std::enable_shared_from_this<PeerLooks::State> {
    State(RunLoop& runLoop, std::chrono::milliseconds time, std::size_t mostOfOne)
        : loop(runLoop), patience(time), pool(kMostThreads, mostOfOne) {}

    void begin(const JobRef& job);
    bool tryStart(const JobRef& job);
    void startWaiting();
    void watch(const JobRef& job);
    void finished(const JobRef& job);
    void tell(const JobRef& job, bool isDone);
    void addThread();
    void work();
    void close();

    RunLoop& loop;
    const std::chrono::milliseconds patience;
    // Of the loop:
    Pool pool;
    std::map<Origin, std::deque<JobRef>> lines;  // who waits for a thread; none is empty
    std::vector<std::thread> threads;

    std::mutex mutex;  // guards what follows
    std::condition_variable changed;
    std::deque<JobRef> ready;  // no more than there may be threads
    std::size_t idle = 0;
    bool closing = false;
};

void PeerLooks::State::begin(const JobRef& job) {
    if (tryStart(job)) return;
    watch(job);
    lines[job->origin].push_back(job);
}

bool PeerLooks::State::tryStart(const JobRef& job) {
    job->share = pool.draw(job->origin);
    if (!job->share) return false;
    job->periodsWithoutStep = 0;
    watch(job);
    bool isShort = false;
    {
        const std::lock_guard lock(mutex);
        ready.push_back(job);
        isShort = idle < ready.size();
    }
    if (isShort) addThread();
    changed.notify_one();
    return true;
}

void PeerLooks::State::addThread() {
    if (threads.size() == kMostThreads) return;
    try {
        threads.emplace_back([this] {
            pthread_setname_np(pthread_self(), "look");
            work();
        });
    } catch (const std::system_error&) {
        // Another thread may come to it, or it is given up in its time.
    }
}

void PeerLooks::State::work() {
    std::unique_lock lock(mutex);
    for (;;) {
        ++idle;
        changed.wait(lock, [this] { return closing || !ready.empty(); });
        --idle;
        if (closing) return;
        JobRef job = std::move(ready.front());
        ready.pop_front();
        lock.unlock();
        job->look(job->pace);
        loop.post([weak = weak_from_this(), job = std::move(job)] {
            if (auto self = weak.lock()) self->finished(job);
        });
        lock.lock();
    }
}

void PeerLooks::State::finished(const JobRef& job) {
    job->share.reset();
    tell(job, true);
    startWaiting();
}

void PeerLooks::State::startWaiting() {
    for (auto line = lines.begin(); line != lines.end();) {
        auto& jobs = line->second;
        while (!jobs.empty() && (!jobs.front()->outcome || tryStart(jobs.front())))
            jobs.pop_front();
        line = jobs.empty() ? lines.erase(line) : std::next(line);
    }
}

/// Gives the look up unless it gets on.
void PeerLooks::State::watch(const JobRef& job) {
    job->timer.start(
        patience / kPeriods, [weakSelf = weak_from_this(), weakJob = std::weak_ptr(job)] {
            const auto self = weakSelf.lock();
            const JobRef watched = weakJob.lock();
            if (!self || !watched) return;
            const std::size_t steps = watched->pace.steps();
            int& periods = watched->periodsWithoutStep;
            periods = std::exchange(watched->stepsSeen, steps) == steps ? periods + 1 : 0;
            if (periods < kPeriods) return self->watch(watched);
            self->tell(watched, false);
            self->startWaiting();  // drops it from its line
        });
}

void PeerLooks::State::tell(const JobRef& job, bool isDone) {
    job->timer.cancel();
    const Outcome outcome = std::exchange(job->outcome, nullptr);
    if (outcome) outcome(isDone, job->pace.steps());
}

void PeerLooks::State::close() {
    {
        const std::lock_guard lock(mutex);
        closing = true;
    }
    changed.notify_all();
    for (std::thread& thread : threads) thread.join();
    ready.clear();
    lines.clear();
}

PeerLooks::PeerLooks(RunLoop& loop, std::chrono::milliseconds patience, std::size_t mostOfOne)
    : state_(std::make_shared<State>(loop, patience, mostOfOne)) {}

PeerLooks::~PeerLooks() {
    state_->close();
}

void PeerLooks::look(const Origin& origin, Look look, Outcome outcome) {
    state_->begin(std::make_shared<Job>(state_->loop, origin, std::move(look), std::move(outcome)));
}

}  // namespace platform
