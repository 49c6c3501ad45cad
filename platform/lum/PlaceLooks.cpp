#include "platform/lum/PlaceLooks.h"

#include <fcntl.h>
#include <sys/sysmacros.h>

#include <atomic>
#include <cerrno>
#include <compare>
#include <functional>
#include <map>
#include <set>
#include <utility>

#include "platform/system/FileIdentity.h"
#include "platform/system/Files.h"
#include "platform/system/OpenBeneath.h"
#include "platform/threads/RunLoop.h"

namespace platform {

namespace {

using Members = std::vector<std::size_t>;

/// The file system that a look at a path would wait for: that of the nearest directory above which
/// the kernel can find without asking. Mounts are always in its memory, so that is none above; but
/// one that is only made when somebody comes is charged to what it will lie in.
dev_t fileSystemOf(std::string path) {
    // A mount that is made meanwhile, anywhere, makes one try fail.
    constexpr int kMostAttempts = 8;
    for (;; path = parentPath(path)) {
        for (int attempt = 0; attempt < kMostAttempts; ++attempt) {
            const auto found = openWithoutLinks(AT_FDCWD, path, O_PATH, Wait::Never);
            const auto identity = found ? FileIdentity::ofOpen(found->get()) : std::nullopt;
            if (identity) return identity->device;
            if (!found && found.error().code != EAGAIN) break;
        }
        if (path.size() <= 1) return 0;
    }
}

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

    static Neighbourhood of(const std::string& path) {
        static const dev_t root = FileIdentity::at(AT_FDCWD, "/").device;
        const dev_t device = fileSystemOf(path);
        const bool isOwn = device == root || major(device) != 0;
        return {device, isOwn ? path : std::string()};
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

    void begin(const std::shared_ptr<Round>& round,
               const std::map<Neighbourhood, Members>& members);
    void look(const std::shared_ptr<Round>& round, const Neighbourhood& place,
              const Members& members);

    RunLoop& loop;
    const std::chrono::milliseconds patience;
    std::set<Neighbourhood> silent;  // one that was given up still waits for these
    PeerLooks looks;
};

namespace {

/// One thread's time with a file system. It goes, on the loop, when the thread is back.
struct Visit {
    ~Visit() {
        if (whenBack) whenBack();
    }
    std::atomic<bool> hasBegun = false;
    std::function<void()> whenBack;
};

}  // namespace

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
            visit->hasBegun = true;
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
            if (hung && hung->hasBegun) {
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
    std::map<Neighbourhood, Members> members;
    for (std::size_t i = 0; i < round->looks.size(); ++i)
        members[Neighbourhood::of(round->looks[i].path)].push_back(i);
    state_->loop.post([weak = std::weak_ptr(state_), round, members = std::move(members)] {
        if (const auto self = weak.lock()) self->begin(round, members);
    });
}

}  // namespace platform
