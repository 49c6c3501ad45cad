// What peers send to the broker of tokens. Each part of an input is sent by the peer that came
// last, unless its first letter says something else: see `take`. "@" stands for the token, "~" for
// that of a bundle that is gone. Crowds of other sessions fill the broker: they are other origins.
// Covers: platform/sandbox/SandboxBroker.cpp

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstring>
#include <deque>
#include <vector>

#include "fuzz/Support.h"
#include "platform/lum/Listener.h"
#include "platform/sandbox/SandboxBroker.h"
#include "platform/threads/RunLoop.h"
#include "tests/support/KnownDirectory.h"

using namespace platform;

namespace {

constexpr std::size_t kMaxPeers = 72;  // more than one origin may have
constexpr std::size_t kCrowd = 64, kMaxCrowds = 4;
constexpr std::chrono::milliseconds kStep{10};

struct Broker {
    void settle() {
        while (loop.poll() > 0) continue;
    }

    std::string tokenOf(const char* bundle) const {
        return *tokens.issue(test::known(fuzz::home().makeDirectory(bundle)), ".");
    }

    RunLoop loop;
    const SandboxTokens tokens = *SandboxTokens::make("zrd");
    const std::string token = tokenOf("A.appex");
    const std::string stale = [this] {
        std::string old = tokenOf("B.appex");
        std::filesystem::remove(fuzz::home().path("B.appex"));
        return old;
    }();
    const std::unique_ptr<SandboxBroker> broker =
        std::move(*SandboxBroker::make(fuzz::directories(), "zrd", tokens, loop));
    const std::string socket = *lum::socketPath(fuzz::directories(), sandboxServiceName("zrd"));
};

class Peers {
  public:
    explicit Peers(Broker& broker) : broker_(broker) { connect(); }

    void take(std::string_view part) {
        if (part.starts_with('+')) return connect(), send(part.substr(1));
        if (part.starts_with('-')) return leave();
        if (part.starts_with('!')) return await();
        if (part.starts_with('*')) return crowd(part.substr(1));
        send(part);
    }

    /// Whoever has sent something that is whole has its answer soon.
    void end() {
        strangers_.clear();
        broker_.settle();
        while (!all_.empty()) {
            ::shutdown(all_.front().socket.get(), SHUT_WR);
            broker_.settle();
            await();
            leave();
        }
    }

  private:
    struct Peer {
        UniqueFd socket;
        bool hasAsked = false;
    };

    void connect() {
        if (all_.size() == kMaxPeers) return;
        UniqueFd socket = makeSocket();
        if (connectsToBroker(socket)) all_.push_back({std::move(socket)});
        broker_.settle();
    }

    static UniqueFd makeSocket() {
        return UniqueFd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    }

    /// Whether there is room among those that wait: nobody is let in until the next step of the
    /// loop.
    bool connectsToBroker(const UniqueFd& socket) const {
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        std::strncpy(address.sun_path, broker_.socket.c_str(), sizeof address.sun_path - 1);
        const auto* place = reinterpret_cast<const sockaddr*>(&address);
        const bool isConnected = ::connect(socket.get(), place, sizeof address) == 0;
        fuzz::require(isConnected || errno == EAGAIN);
        return isConnected;
    }

    /// As many as one origin may be, of a session of their own, who all say the same.
    void crowd(std::string_view part) {
        if (crowds_++ == kMaxCrowds) return;
        std::vector<UniqueFd> sockets;
        while (sockets.size() < kCrowd) sockets.push_back(makeSocket());
        const pid_t leader = ::fork();
        if (leader == 0) {
            ::setsid();
            for (const UniqueFd& socket : sockets) connectsToBroker(socket);
            ::raise(SIGSTOP);
            ::_exit(0);
        }
        fuzz::require(leader > 0);
        await(leader, WUNTRACED);
        broker_.settle();
        const std::string bytes = withTokens(part);
        for (UniqueFd& socket : sockets) {
            (void)::send(socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
            strangers_.push_back(std::move(socket));
        }
        broker_.settle();
        ::kill(leader, SIGKILL);
        await(leader, 0);
    }

    /// The fuzzer has a timer, which interrupts.
    static void await(pid_t process, int options) {
        while (::waitpid(process, nullptr, options) < 0) fuzz::require(errno == EINTR);
    }

    void send(std::string_view part) {
        if (all_.empty()) return;
        const std::string bytes = withTokens(part);
        (void)::send(all_.back().socket.get(), bytes.data(), bytes.size(),
                     MSG_NOSIGNAL | MSG_DONTWAIT);
        all_.back().hasAsked |= bytes.ends_with('\n');
        broker_.settle();
    }

    std::string withTokens(std::string_view part) const {
        std::string bytes(part);
        if (const std::size_t at = bytes.find('@'); at != bytes.npos)
            bytes.replace(at, 1, broker_.token);
        if (const std::size_t at = bytes.find('~'); at != bytes.npos)
            bytes.replace(at, 1, broker_.stale);
        return bytes;
    }

    void leave() {
        if (!all_.empty()) all_.pop_front();
        broker_.settle();
    }

    /// Until the one that came first is answered.
    void await() {
        if (all_.empty() || !all_.front().hasAsked) return;
        pollfd state{all_.front().socket.get(), POLLIN, 0};
        for (int i = 0; i < 6 && patience_ > 0 && ::poll(&state, 1, 0) == 0; ++i, --patience_)
            broker_.loop.runOnce(kStep);
        broker_.settle();
    }

    Broker& broker_;
    std::deque<Peer> all_;
    std::vector<UniqueFd> strangers_;
    std::size_t crowds_ = 0;
    int patience_ = 20;  // steps that an input may take in all
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static Broker broker;
    Peers peers(broker);
    for (const std::string_view part : fuzz::parts(fuzz::text(data, size), kMaxPeers))
        if (!part.empty()) peers.take(part);
    peers.end();
    return 0;
}
