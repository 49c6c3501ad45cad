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

// A peer takes some descriptors and a child process.
constexpr std::size_t kMostPeers = 32;
constexpr int kMostAcceptedAtOnce = 32;
// For a peer to say its token, and then for the mount to be made: file systems may be slow.
constexpr std::chrono::seconds kPatience{5};
constexpr std::chrono::seconds kGrace{1};
// For a peer to say its token when others wait to be let in.
constexpr std::chrono::milliseconds kPatienceWhenFull{50};
constexpr std::chrono::milliseconds kPauseAfterFailure{100};

using Clock = std::chrono::steady_clock;

struct Peer {
    UniqueFd socket;
    const pid_t pid;
    const std::optional<Pool::Share> share;  // of the peers that there may be; sandboxes have one
    const Clock::time_point since = Clock::now();
    RunLoop::Watch watch;
    RunLoop::Timer deadline;
    std::string received;
    UniqueFd outcome;  // of its grant, since it has sent a good token
    std::optional<RunLoop::Watch> outcomeWatch;

    Peer(RunLoop& loop, UniqueFd connected, pid_t process, std::optional<Pool::Share> drawn)
        : socket(std::move(connected)),
          pid(process),
          share(std::move(drawn)),
          watch(loop, socket.get()),
          deadline(loop) {}

    void refuse(int errnum) const {
        EVLOG_INFO(ops(), "sandbox extension for process {} refused: {}", pid,
                   pub(std::generic_category().message(errnum)));
        const std::string line = std::to_string(errnum) + "\n";
        (void)!::send(socket.get(), line.data(), line.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
    }
};

}  // namespace

struct SandboxBroker::State {
    RunLoop& loop;
    const SandboxTokens tokens;
    MountProcess mounts;
    lum::ServiceSocket socket;
    RunLoop::Watch watch{loop, socket.fd()};
    RunLoop::Timer pause{loop};
    Pool pool{kMostPeers};
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
    bool drawFor(int connected, std::optional<Pool::Share>& share);
    bool makeRoom();
    void drop(Place peer);
    void read(Place peer);
    void serve(Place peer, std::string_view token);
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
        if (!pid) continue;
        std::optional<Pool::Share> share;
        if (!drawFor(connected.get(), share)) continue;
        const Place peer =
            peers.emplace(peers.end(), loop, std::move(connected), *pid, std::move(share));
        peer->deadline.start(kPatience, [this, peer] { drop(peer); });
        read(peer);  // who wants access has usually said so by now
    }
    acceptOnceReadable();
}

/// One sandbox has its part and no more: whoever of it comes beyond that is gone at once, or a
/// plug-in could hold up everybody by those that wait to be accepted. Others wait for their turn,
/// and have no share.
bool SandboxBroker::State::drawFor(int connected, std::optional<Pool::Share>& share) {
    const auto token = AuditToken::ofPeer(connected);
    if (!token) return false;
    const Origin origin = Origin::of(*token);
    if (!origin.isSandbox()) return true;
    share = pool.draw(origin);
    return share.has_value();
}

/// Whoever holds back its token does not keep out those who send theirs: the one that has been
/// silent for longest goes, now or soon.
bool SandboxBroker::State::makeRoom() {
    if (peers.size() < kMostPeers) return true;
    const Place silent =
        std::find_if(peers.begin(), peers.end(), [](const Peer& peer) { return !peer.outcome; });
    if (silent == peers.end()) return false;
    const auto age =
        std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - silent->since);
    if (age < kPatienceWhenFull) {
        pause.start(kPatienceWhenFull - age, [this] { acceptSome(); });
        return false;
    }
    peers.erase(silent);
    return true;
}

void SandboxBroker::State::drop(Place peer) {
    peers.erase(peer);
    if (!std::exchange(full, false)) return;
    pause.cancel();
    acceptOnceReadable();
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
    const auto file = tokens.check(token);
    if (!file) {
        peer->refuse(EACCES);
        return drop(peer);
    }
    auto outcome = mounts.grant(*file, peer->socket.get());
    if (!outcome) {
        peer->refuse(outcome.error().code);
        return drop(peer);
    }
    // Who hangs in the kernel cannot be ended, and keeps its peer's place, or there would be ever
    // more of them; but nobody waits for it.
    peer->deadline.start(kPatience + kGrace, [peer] {
        peer->refuse(ETIMEDOUT);
        peer->socket.reset();
    });
    peer->outcome = std::move(*outcome);
    peer->outcomeWatch.emplace(loop, peer->outcome.get());
    peer->outcomeWatch->awaitReadable([this, peer] { finish(peer); });
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
