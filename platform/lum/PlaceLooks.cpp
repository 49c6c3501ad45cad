#include "platform/lum/PlaceLooks.h"

#include <sys/sysmacros.h>

#include <atomic>
#include <compare>
#include <functional>
#include <map>
#include <mutex>
#include <set>
#include <utility>

#include "platform/system/MountTable.h"
#include "platform/threads/RunLoop.h"

namespace platform {

namespace {

using Members = std::vector<std::size_t>;

/// What was asked for at once.
struct Round {
    std::vector<PlaceLooks::Look> looks;
    std::vector<bool> done;  // the loop's
    PlaceLooks::Outcome outcome;
    std::size_t open = 0;  // file systems whose looks are not at their end

    /// Lets go of whoever asked: a look that hangs does not hold them.
    void leave() {
        if (--open == 0) std::exchange(outcome, nullptr)(done);
    }
};

/// Who waits for one another: looks at one file system, or, where it is the machine's own and so
/// hangs only with everything, at one path: what hangs there lies beneath that path.
struct Neighbourhood {
    dev_t device = 0;
    std::string path;  // empty: all of the file system

    static Neighbourhood of(const MountTable& mounts, const std::string& path) {
        const auto* const mount = mounts.of(path);
        const auto* const root = mounts.of("/");
        if (!mount) return {0, path};
        const bool isOwn = mount->device == root->device || major(mount->device) != 0;
        return {mount->device, isOwn ? path : std::string()};
    }
    /// Others of the same hash only wait longer.
    Origin origin() const {
        return {device, 1, static_cast<pid_t>(std::hash<std::string>()(path))};
    }

    auto operator<=>(const Neighbourhood&) const = default;  // NOLINT(modernize-use-nullptr)
};

}  // namespace

struct PlaceLooks::State : std::enable_shared_from_this<PlaceLooks::State> {
    State(RunLoop& runLoop, std::chrono::milliseconds time)
        : loop(runLoop), patience(time), looks(runLoop, time, 1) {}

    std::map<Neighbourhood, Members> byNeighbourhood(const std::vector<Look>& all);
    void begin(const std::shared_ptr<Round>& round,
               const std::map<Neighbourhood, Members>& members);
    void look(const std::shared_ptr<Round>& round, const Neighbourhood& place,
              const Members& members);

    RunLoop& loop;
    const std::chrono::milliseconds patience;
    std::set<Neighbourhood> silent;  // one that was given up still waits for these
    PeerLooks looks;
    std::mutex mutex;
    MountTable mounts;  // guarded by it
};

namespace {

/// One thread's time with a file system. It goes, on the loop, when the thread is back.
struct Visit {
    ~Visit() {
        if (whenBack) whenBack();
    }
    enum class Stage { Waiting, Begun, GivenUp };
    /// Whether it goes from waiting to another stage: that is once, be it by the thread, which
    /// begins, or by who gives it up, whose thread must not begin any more.
    bool leaveWaiting(Stage next) {
        Stage waiting = Stage::Waiting;
        return stage.compare_exchange_strong(waiting, next);
    }

    std::atomic<Stage> stage = Stage::Waiting;
    std::function<void()> whenBack;
};

}  // namespace

std::map<Neighbourhood, Members> PlaceLooks::State::byNeighbourhood(const std::vector<Look>& all) {
    std::map<Neighbourhood, Members> members;
    const std::lock_guard lock(mutex);
    mounts.refresh();
    for (std::size_t i = 0; i < all.size(); ++i)
        members[Neighbourhood::of(mounts, all[i].path)].push_back(i);
    return members;
}

void PlaceLooks::State::begin(const std::shared_ptr<Round>& round,
                              const std::map<Neighbourhood, Members>& members) {
    round->open = 1;
    for (const auto& [place, indices] : members)
        if (!silent.contains(place)) look(round, place, indices);
    round->leave();
}

void PlaceLooks::State::look(const std::shared_ptr<Round>& round, const Neighbourhood& place,
                             const Members& members) {
    ++round->open;
    const auto visit = std::make_shared<Visit>();
    looks.look(
        place.origin(),
        [round, members, visit, time = patience](PeerLooks::Pace& pace) {
            if (!visit->leaveWaiting(Visit::Stage::Begun)) return;
            // However well it gets on, those who wait behind it get their turn.
            const auto end = std::chrono::steady_clock::now() + time;
            for (const std::size_t index : members) {
                if (std::chrono::steady_clock::now() >= end) return;
                round->looks[index].work();
                pace.step();
            }
        },
        [this, round, members, place, weakVisit = std::weak_ptr(visit)](bool isDone,
                                                                        std::size_t steps) {
            const auto hung = isDone ? nullptr : weakVisit.lock();
            if (hung && !hung->leaveWaiting(Visit::Stage::GivenUp)) {
                silent.insert(place);
                hung->whenBack = [weak = weak_from_this(), place] {
                    if (const auto self = weak.lock()) self->silent.erase(place);
                };
            }
            for (std::size_t i = 0; i < steps; ++i) round->done[members[i]] = true;
            round->leave();
        });
}

PlaceLooks::PlaceLooks(RunLoop& loop, std::chrono::milliseconds patience)
    : state_(std::make_shared<State>(loop, patience)) {}

PlaceLooks::~PlaceLooks() = default;

void PlaceLooks::make(std::vector<Look> looks, Outcome outcome) {
    const auto round = std::make_shared<Round>();
    round->done.resize(looks.size());
    round->looks = std::move(looks);
    round->outcome = std::move(outcome);
    state_->loop.post(
        [weak = std::weak_ptr(state_), round, members = state_->byNeighbourhood(round->looks)] {
            if (const auto self = weak.lock()) self->begin(round, members);
        });
}

}  // namespace platform
