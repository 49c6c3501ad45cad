#include "platform/lum/Listener.h"

#include <sys/socket.h>

#include <cerrno>
#include <chrono>
#include <optional>
#include <system_error>
#include <utility>

#include "platform/Log.h"
#include "platform/RunLoop.h"
#include "platform/UniqueFd.h"
#include "platform/lum/PeerConnection.h"
#include "platform/lum/ReplyBudget.h"
#include "platform/lum/ServiceSocket.h"

namespace platform {

namespace {

constexpr std::chrono::milliseconds kPauseWithoutDescriptors{100};
// Accepted at once; then the loop's other work has its turn.
constexpr int kMostAcceptedAtOnce = 32;

const Log& ops() {
    static const Log& handle = Log::make("com.orbel.Zorvan", "ops");
    return handle;
}

bool isExhaustion(int errnum) {
    return errnum == EMFILE || errnum == ENFILE || errnum == ENOBUFS || errnum == ENOMEM;
}

}  // namespace

struct Listener::State : std::enable_shared_from_this<Listener::State> {
    SerialQueue& queue;
    lum::ServiceSocket socket;
    std::shared_ptr<lum::ReplyBudget> budget;
    EventHandler handler;
    std::optional<RunLoop::Watch> watch;  // since `resume`
    RunLoop::Timer pause;
    bool exhausted = false;  // no descriptors were left at the last try
    UniqueFd undecided;      // accepted when no descriptors were left to look at its peer

    State(SerialQueue& eventQueue, lum::ServiceSocket serviceSocket)
        : queue(eventQueue),
          socket(std::move(serviceSocket)),
          budget(std::make_shared<lum::ReplyBudget>(eventQueue.runLoop())),
          pause(eventQueue.runLoop()) {}

    void awaitConnections() {
        watch->awaitReadable([this] { acceptSome(); });
    }

    void acceptSome();
    void acceptFailed(int errnum);
    void admit(UniqueFd connected);
};

void Listener::State::acceptSome() {
    queue.assertCurrent();
    auto self = shared_from_this();
    for (int i = 0; i < kMostAcceptedAtOnce && watch; ++i) {
        UniqueFd connected = std::move(undecided);
        if (!connected)
            connected.reset(accept4(socket.fd(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
        if (connected) {
            admit(std::move(connected));
            if (undecided) return acceptFailed(EMFILE);
            exhausted = false;
        } else if (errno != ECONNABORTED && errno != EINTR) {
            return acceptFailed(errno);
        }
    }
    if (watch) awaitConnections();
}

void Listener::State::acceptFailed(int errnum) {
    if (errnum == EAGAIN) return awaitConnections();
    const bool first = !std::exchange(exhausted, true);
    if (first || !isExhaustion(errnum)) {
        EVLOG_ERROR(ops(), "cannot accept connections for now: {}",
                    pub(std::generic_category().message(errnum)));
    }
    pause.start(kPauseWithoutDescriptors, [this] { acceptSome(); });
}

void Listener::State::admit(UniqueFd connected) {
    ucred peer{};
    socklen_t size = sizeof peer;
    if (getsockopt(connected.get(), SOL_SOCKET, SO_PEERCRED, &peer, &size) != 0) return;
    if (peer.uid != geteuid() && peer.uid != 0) {
        EVLOG_ERROR(ops(), "client {} of user {} is not let in", peer.pid, peer.uid);
        return;
    }
    errno = 0;
    auto token = AuditToken::ofPeer(connected.get());
    if (!token && isExhaustion(errno)) {
        undecided = std::move(connected);
        return;
    }
    if (!token) {
        EVLOG_ERROR(ops(), "client {} is not let in: it cannot be told who it is", peer.pid);
        return;
    }
    handler(std::make_shared<lum::PeerConnection>(std::move(connected), std::move(*token), queue,
                                                  budget));
}

Result<std::unique_ptr<Listener>> Listener::make(const Directories& directories,
                                                 const std::string& serviceName,
                                                 SerialQueue& queue) {
    auto socket = lum::ServiceSocket::make(directories, serviceName);
    if (!socket) return socket.error();
    return std::unique_ptr<Listener>(
        new Listener(std::make_shared<State>(queue, std::move(*socket))));
}

Listener::Listener(std::shared_ptr<State> state) : state_(std::move(state)) {}

Listener::~Listener() {
    state_->pause.cancel();
    state_->watch.reset();
}

void Listener::setEventHandler(EventHandler handler) {
    state_->handler = std::move(handler);
}

void Listener::resume() {
    state_->queue.async([weak = std::weak_ptr(state_)] {
        auto state = weak.lock();
        if (!state || state->watch) return;
        state->watch.emplace(state->queue.runLoop(), state->socket.fd());
        state->acceptSome();
    });
}

}  // namespace platform
