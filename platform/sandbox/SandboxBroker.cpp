#include "platform/sandbox/SandboxBroker.h"

#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <list>
#include <optional>
#include <system_error>
#include <utility>

#include "platform/log/OpsLog.h"
#include "platform/lum/AuditToken.h"
#include "platform/lum/Pool.h"
#include "platform/lum/ServiceSocket.h"
#include "platform/sandbox/MountProcess.h"
#include "platform/system/Directories.h"
#include "platform/system/UniqueFd.h"
#include "platform/threads/RunLoop.h"

namespace platform {

namespace {

// Who is connected, and for how many of them a mount is made at a time, which takes a process and a
// pipe. One origin has a quarter of either, or whoever fills it would keep the others out.
constexpr std::size_t kMostPeers = 256, kMostMounts = 32;
constexpr int kMostAcceptedAtOnce = 32;
// For a peer to say its token, then for its turn to come, and then for the mount to be made: file
// systems may be slow.
constexpr std::chrono::seconds kPatience{5};
constexpr std::chrono::seconds kGrace{1};
// For a peer to say its token when others wait to be let in.
constexpr std::chrono::milliseconds kPatienceWhenFull{50};
constexpr std::chrono::milliseconds kPauseAfterFailure{100};

using Clock = std::chrono::steady_clock;

void refuse(const UniqueFd& socket, pid_t pid, int errnum) {
    EVLOG_INFO(ops(), "sandbox extension for process {} refused: {}", pid,
               pub(std::generic_category().message(errnum)));
    const std::string line = std::to_string(errnum) + "\n";
    (void)!::send(socket.get(), line.data(), line.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
}

struct Peer {
    UniqueFd socket;
    const pid_t pid;
    const Pool::Share place;
    const Clock::time_point since = Clock::now();
    RunLoop::Watch watch;
    RunLoop::Timer deadline;
    std::string received;
    std::optional<SandboxTokens::File> file;  // since it has sent a good token
    std::optional<Pool::Share> turn;          // since its mount is being made
    UniqueFd outcome;                         // of that
    std::optional<RunLoop::Watch> outcomeWatch;

    Peer(RunLoop& loop, UniqueFd connected, pid_t process, Pool::Share drawn)
        : socket(std::move(connected)),
          pid(process),
          place(std::move(drawn)),
          watch(loop, socket.get()),
          deadline(loop) {}

    bool isSilent() const { return !file; }
    bool waits() const { return file && !turn; }
    void refuse(int errnum) const { platform::refuse(socket, pid, errnum); }
};

}  // namespace

struct SandboxBroker::State {
    RunLoop& loop;
    const SandboxTokens tokens;
    MountProcess mounts;
    lum::ServiceSocket socket;
    RunLoop::Watch watch{loop, socket.fd()};
    RunLoop::Timer pause{loop};
    Pool places{kMostPeers}, turns{kMostMounts};
    std::list<Peer> peers;  // in the order in which they came
    bool full = false;      // nobody is accepted until a peer goes, or has been silent for too long

    using Place = std::list<Peer>::iterator;

    State(RunLoop& runLoop, const SandboxTokens& issued, MountProcess mounting,
          lum::ServiceSocket listening)
        : loop(runLoop), tokens(issued), mounts(std::move(mounting)), socket(std::move(listening)) {
        acceptOnceReadable();
    }

    void acceptOnceReadable() {
        watch.awaitReadable([this] { acceptSome(); });
    }
    void acceptSome();
    void admit(UniqueFd connected, pid_t pid);
    Place firstSilent(const std::optional<Origin>& origin);
    bool makeRoom();
    void turnOut(Place silent);
    void remove(Place peer);
    void drop(Place peer);
    void read(Place peer);
    void serve(Place peer, std::string_view token);
    void tellTurns();
    bool mount(Place peer);
    void finish(Place peer);
};

void SandboxBroker::State::acceptSome() {
    full = false;
    for (int i = 0; i < kMostAcceptedAtOnce; ++i) {
        if (i > 0 && peers.size() == kMostPeers) break;  // perhaps nobody waits
        if (!makeRoom()) {
            full = true;
            return;
        }
        UniqueFd connected(::accept4(socket.fd(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
        if (!connected && errno == EAGAIN) break;
        if (!connected && errno != ECONNABORTED && errno != EINTR) {
            pause.start(kPauseAfterFailure, [this] { acceptSome(); });
            return;
        }
        const auto pid = connected ? lum::admittedPeer(connected.get()) : std::nullopt;
        if (pid) admit(std::move(connected), *pid);
    }
    acceptOnceReadable();
}

/// Of an origin that has its part, the one that has been silent for longest goes; when all have
/// sent their tokens, the one that comes. So nobody has to wait to be accepted for long.
void SandboxBroker::State::admit(UniqueFd connected, pid_t pid) {
    const auto token = AuditToken::ofPeer(connected.get());
    if (!token) return refuse(connected, pid, EAGAIN);
    const Origin origin = Origin::of(*token);
    auto share = places.draw(origin);
    if (!share) {
        const Place silent = firstSilent(origin);
        if (silent == peers.end()) return refuse(connected, pid, EAGAIN);
        turnOut(silent);
        share = places.draw(origin);
    }
    if (!share) return refuse(connected, pid, EAGAIN);
    const Place peer =
        peers.emplace(peers.end(), loop, std::move(connected), pid, std::move(*share));
    peer->deadline.start(kPatience, [this, peer] { drop(peer); });
    read(peer);  // who wants access has usually said so by now
}

/// The one that has been silent for longest, of one origin or of all.
SandboxBroker::State::Place SandboxBroker::State::firstSilent(const std::optional<Origin>& origin) {
    return std::ranges::find_if(peers, [&](const Peer& peer) {
        return peer.isSilent() && (!origin || peer.place.origin() == *origin);
    });
}

void SandboxBroker::State::turnOut(Place silent) {
    silent->refuse(EAGAIN);
    peers.erase(silent);
}

/// Whoever holds back its token does not keep out those who send theirs: the one that has been
/// silent for longest goes, now or soon.
bool SandboxBroker::State::makeRoom() {
    if (peers.size() < kMostPeers) return true;
    const Place silent = firstSilent(std::nullopt);
    if (silent == peers.end()) return false;
    const auto age =
        std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - silent->since);
    if (age < kPatienceWhenFull) {
        pause.start(kPatienceWhenFull - age, [this] { acceptSome(); });
        return false;
    }
    turnOut(silent);
    return true;
}

void SandboxBroker::State::remove(Place peer) {
    peers.erase(peer);
    if (!std::exchange(full, false)) return;
    pause.cancel();
    acceptOnceReadable();
}

/// Its turn may be another's.
void SandboxBroker::State::drop(Place peer) {
    remove(peer);
    tellTurns();
}

void SandboxBroker::State::read(Place peer) {
    char buffer[SandboxTokens::kMaxLength + 1];
    std::string& received = peer->received;
    const ssize_t count =
        ::recv(peer->socket.get(), buffer, sizeof buffer - received.size(), MSG_DONTWAIT);
    if (count > 0) received.append(buffer, static_cast<std::size_t>(count));
    const std::size_t end = received.find('\n');
    if (end != std::string::npos && end + 1 == received.size())
        return serve(peer, std::string_view(received).substr(0, end));
    const bool more = count > 0 || (count < 0 && (errno == EAGAIN || errno == EINTR));
    if (!more || end != std::string::npos || received.size() == sizeof buffer) return drop(peer);
    peer->watch.awaitReadable([this, peer] { read(peer); });
}

void SandboxBroker::State::serve(Place peer, std::string_view token) {
    peer->file = tokens.check(token);
    if (!peer->file) {
        peer->refuse(EACCES);
        return drop(peer);
    }
    peer->deadline.start(kPatience, [this, peer] {
        peer->refuse(ETIMEDOUT);
        drop(peer);
    });
    tellTurns();
}

/// Has mounts made for those who wait, as far as their origins may have more of them.
void SandboxBroker::State::tellTurns() {
    for (Place next = peers.begin(); next != peers.end();) {
        const Place peer = next++;
        if (!peer->waits()) continue;
        peer->turn = turns.draw(peer->place.origin());
        if (peer->turn && !mount(peer)) remove(peer);
    }
}

/// False when that cannot even begin.
bool SandboxBroker::State::mount(Place peer) {
    auto outcome = mounts.grant(*peer->file, peer->socket.get());
    if (!outcome) {
        peer->refuse(outcome.error().code);
        return false;
    }
    // Who hangs in the kernel cannot be ended, and keeps its peer's turn, or there would be ever
    // more of them; but nobody of another origin waits for it.
    peer->deadline.start(kPatience + kGrace, [peer] {
        peer->refuse(ETIMEDOUT);
        peer->socket.reset();
    });
    peer->outcome = std::move(*outcome);
    peer->outcomeWatch.emplace(loop, peer->outcome.get());
    peer->outcomeWatch->awaitReadable([this, peer] { finish(peer); });
    return true;
}

void SandboxBroker::State::finish(Place peer) {
    const int errnum = MountProcess::outcomeAt(peer->outcome);
    if (errnum != 0 && peer->socket) peer->refuse(errnum);
    drop(peer);
}

Result<std::unique_ptr<SandboxBroker>> SandboxBroker::make(const Directories& directories,
                                                           const std::string& serviceName,
                                                           const SandboxTokens& tokens,
                                                           RunLoop& loop) {
    auto mounts = MountProcess::make(kPatience);
    if (!mounts) return mounts.error();
    auto socket = lum::ServiceSocket::make(directories, sandboxServiceName(serviceName));
    if (!socket) return socket.error();
    return std::unique_ptr<SandboxBroker>(new SandboxBroker(
        std::make_unique<State>(loop, tokens, std::move(*mounts), std::move(*socket))));
}

SandboxBroker::SandboxBroker(std::unique_ptr<State> state) : state_(std::move(state)) {}

SandboxBroker::~SandboxBroker() = default;

}  // namespace platform
