#include "bench/soak/Player.h"

#include <poll.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <exception>
#include <utility>

#include "bench/Failure.h"
#include "bench/Measure.h"

namespace bench {

namespace {

constexpr int kNiceOfHostile = 19;
/// The slowest rounds, of which the one in a hundred is one, as long as there are not more rounds
/// than a hundred times as many.
constexpr std::size_t kMostKept = 1u << 20;

/// Pauses, unless it is over: then the other end has been shut. (A signal would break into a
/// round.)
bool isOver(int parent, int pause) {
    pollfd shut{parent, POLLIN, 0};
    return ::poll(&shut, 1, pause) != 0;
}

Tally rounds(const Part& part, const World& world, int parent) {
    Tally tally;
    std::vector<float> times;
    Work work;
    do {
        const double start = now();
        try {
            if (!work) work = part.begin(world);
            work();
        } catch (const std::exception& failure) {
            work = nullptr;
            std::strncpy(tally.failure, failure.what(), sizeof tally.failure - 1);
            if (part.isHonest) break;
        }
        ++tally.rounds;
        if (times.size() < kMostKept) times.push_back(static_cast<float>(now() - start));
    } while (!isOver(parent, part.pause));
    if (times.empty()) return tally;
    std::ranges::sort(times);
    tally.p99 = times[times.size() * 99 / 100];
    tally.most = times.back();
    return tally;
}

[[noreturn]] void play(const Part& part, const World& world, int parent) {
    ::signal(SIGINT, SIG_IGN);
    ::signal(SIGTERM, SIG_IGN);
    ::signal(SIGPIPE, SIG_IGN);
    ::setsid();
    if (!part.isHonest && ::nice(kNiceOfHostile) == -1) ::_exit(1);
    const Tally tally = rounds(part, world, parent);
    (void)!::write(parent, &tally, sizeof tally);
    ::_exit(0);
}

}  // namespace

std::string applicationOf(const World& world, Ground ground) {
    return fmt::format("{}/Application{:04}.app", world.applications(), static_cast<int>(ground));
}

Player::Player(const Part& part, const World& world) {
    int ends[2];
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0) failErrno("socketpair");
    child_.reset(ends[0]);
    const platform::UniqueFd parent(ends[1]);
    const pid_t self = ::getpid();
    pid_ = ::fork();
    if (pid_ < 0) failErrno("fork");
    if (pid_ > 0) return;
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    if (::getppid() != self) ::_exit(1);
    child_.reset();
    play(part, world, parent.get());
}

Player::Player(Player&& other) noexcept
    : pid_(std::exchange(other.pid_, -1)), child_(std::move(other.child_)) {}

Player::~Player() {
    if (pid_ < 0) return;
    ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
}

Tally Player::stop() {
    constexpr int kPatience = 60'000;
    ::shutdown(child_.get(), SHUT_WR);
    Tally tally;
    pollfd ready{child_.get(), POLLIN, 0};
    if (::poll(&ready, 1, kPatience) <= 0 ||
        ::read(child_.get(), &tally, sizeof tally) != sizeof tally)
        std::strcpy(tally.failure, "it does not end, or has ended too soon");
    return tally;
}

}  // namespace bench
