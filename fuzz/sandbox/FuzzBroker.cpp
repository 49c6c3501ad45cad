// What peers send to the broker of tokens. Each part of an input is sent by the peer that came
// last, unless its first letter says something else: see `take`. "@" stands for the token, "~" for
// that of a bundle that is gone.
// Covers: platform/sandbox/SandboxBroker.cpp

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cstring>
#include <deque>

#include "fuzz/Support.h"
#include "platform/lum/Listener.h"
#include "platform/sandbox/SandboxBroker.h"
#include "platform/threads/RunLoop.h"
#include "tests/support/KnownDirectory.h"

using namespace platform;

namespace {

constexpr std::size_t kMaxPeers = 72;  // more than one origin may have
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
        send(part);
    }

    /// Whoever has sent something that is whole has its answer soon.
    void end() {
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
        UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        std::strncpy(address.sun_path, broker_.socket.c_str(), sizeof address.sun_path - 1);
        fuzz::require(
            ::connect(socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) == 0);
        all_.push_back({std::move(socket)});
        broker_.settle();
    }

    void send(std::string_view part) {
        if (all_.empty()) return;
        std::string bytes(part);
        if (const std::size_t at = bytes.find('@'); at != bytes.npos)
            bytes.replace(at, 1, broker_.token);
        if (const std::size_t at = bytes.find('~'); at != bytes.npos)
            bytes.replace(at, 1, broker_.stale);
        (void)::send(all_.back().socket.get(), bytes.data(), bytes.size(),
                     MSG_NOSIGNAL | MSG_DONTWAIT);
        all_.back().hasAsked |= bytes.ends_with('\n');
        broker_.settle();
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
