#include "platform/lum/Listener.h"

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <climits>
#include <optional>
#include <string_view>
#include <system_error>
#include <utility>
#include <vector>

#include <fmt/format.h>

#include "platform/log/OpsLog.h"
#include "platform/lum/Limits.h"
#include "platform/lum/PeerConnection.h"
#include "platform/lum/Pool.h"
#include "platform/lum/ReceiveBudget.h"
#include "platform/lum/ReplyBudget.h"
#include "platform/lum/ServiceSocket.h"
#include "platform/system/UniqueFd.h"
#include "platform/threads/RunLoop.h"

namespace platform {

namespace {

constexpr std::chrono::milliseconds kPauseAfterFailure{100};
// Accepted at once; then the loop's other work has its turn.
constexpr int kMostAcceptedAtOnce = 32;
constexpr std::chrono::seconds kBetweenRefusalLines{10};

bool isExhaustion(int errnum) {
    return errnum == EMFILE || errnum == ENFILE || errnum == ENOBUFS || errnum == ENOMEM;
}

/// Whether the process could open that many descriptors more. They are counted from the top, where
/// the free ones are: usually the first that are looked at suffice.
bool hasFreeDescriptors(int count) {
    rlimit limit{};
    if (getrlimit(RLIMIT_NOFILE, &limit) != 0) return true;
    auto fd = static_cast<int>(std::min<rlim_t>(limit.rlim_cur, INT_MAX));
    // The lowest are given out first: while one well below the top is free, so are those above it.
    if (fd > 4 * count && fcntl(fd - 4 * count, F_GETFD) < 0) return true;
    while (count > 0 && fd > 0) count -= fcntl(--fd, F_GETFD) < 0 ? 1 : 0;
    return count == 0;
}

std::size_t mostConnections() {
    rlimit limit{};
    if (getrlimit(RLIMIT_NOFILE, &limit) != 0) return lum::kMaxConnections;
    const auto descriptors = std::max<rlim_t>(limit.rlim_cur, lum::kReservedDescriptors);
    return std::min<rlim_t>(
        (descriptors - lum::kReservedDescriptors) / lum::kDescriptorsOfConnection,
        lum::kMaxConnections);
}

/// What this process's descriptors allow, whichever listener accepts: as many as at the first.
Pool& connectionPool() {
    static Pool pool{mostConnections()};
    return pool;
}

}  // namespace

struct Listener::State : std::enable_shared_from_this<Listener::State> {
    SerialQueue& queue;
    lum::ServiceSocket socket;
    const lum::PeerConnection::Common common;
    Pool& pool = connectionPool();
    EventHandler handler;
    std::optional<RunLoop::Watch> watch;  // since `resume`
    // To be closed at the end. Those that are gone are dropped when the list is full.
    std::vector<std::weak_ptr<lum::PeerConnection>> connections;
    RunLoop::Timer pause;
    bool failing = false;  // accepting has failed, and hosts have waited since then
    bool closed = false;
    UniqueFd undecided;       // accepted when no descriptors were left to look at its peer
    std::size_t refused = 0;  // since the log was told
    std::chrono::steady_clock::time_point nextRefusalLine{};

    State(SerialQueue& eventQueue, lum::ServiceSocket serviceSocket)
        : queue(eventQueue),
          socket(std::move(serviceSocket)),
          common{std::make_shared<lum::ReplyBudget>(eventQueue.runLoop()),
                 std::make_shared<lum::ReceiveBudget>(eventQueue.runLoop()),
                 std::make_shared<lum::Decoder>()},
          pause(eventQueue.runLoop()) {}

    void awaitConnections() {
        watch->awaitReadable([this] { acceptSome(); });
    }

    void acceptSome();
    void acceptFailed(int errnum);
    void admit(UniqueFd connected);
    std::optional<Pool::Share> drawFor(const AuditToken& token);
    void refuse(pid_t client, std::string_view reason);
    void remember(const std::shared_ptr<lum::PeerConnection>& connection);
    void close();
};

void Listener::State::acceptSome() {
    queue.assertCurrent();
    auto self = shared_from_this();
    for (int i = 0; i < kMostAcceptedAtOnce && watch; ++i) {
        if (!hasFreeDescriptors(lum::kReservedDescriptors)) return acceptFailed(EMFILE);
        UniqueFd connected = std::move(undecided);
        if (!connected)
            connected.reset(accept4(socket.fd(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
        if (connected) {
            admit(std::move(connected));
            if (undecided) return acceptFailed(EMFILE);
        } else if (errno != ECONNABORTED && errno != EINTR) {
            return acceptFailed(errno);
        }
    }
    if (watch) awaitConnections();
}

void Listener::State::acceptFailed(int errnum) {
    if (errnum == EAGAIN) {
        failing = false;
        return awaitConnections();
    }
    if (!std::exchange(failing, true)) {
        EVLOG_ERROR(ops(), "cannot accept connections for now: {}",
                    pub(std::generic_category().message(errnum)));
    }
    pause.start(kPauseAfterFailure, [this] { acceptSome(); });
}

void Listener::State::admit(UniqueFd connected) {
    const auto peer = lum::admittedPeer(connected.get());
    if (!peer) return;
    errno = 0;
    auto token = AuditToken::ofPeer(connected.get());
    if (!token && isExhaustion(errno)) {
        undecided = std::move(connected);
        return;
    }
    if (!token) return refuse(*peer, "it cannot be told who it is");
    auto share = drawFor(*token);
    if (!share) return;
    // Not in one piece with its count: what is remembered of it would keep its memory.
    const std::shared_ptr<lum::PeerConnection> connection(new lum::PeerConnection(
        std::move(connected), std::move(*token), std::move(*share), queue, common));
    remember(connection);
    handler(connection);
}

/// None when those of the peer's origin have their part already.
std::optional<Pool::Share> Listener::State::drawFor(const AuditToken& token) {
    auto share = pool.draw(Origin::of(token));
    if (!share)
        refuse(token.pid(), fmt::format("there are too many connections, or it and those it "
                                        "belongs with have too many, {} are the most",
                                        pool.mostOfOne()));
    return share;
}

/// With a line at times: whoever connects again and again, and from ever new origins, does not fill
/// the log.
void Listener::State::refuse(pid_t client, std::string_view reason) {
    ++refused;
    const auto now = std::chrono::steady_clock::now();
    if (now < nextRefusalLine) return;
    nextRefusalLine = now + kBetweenRefusalLines;
    EVLOG_ERROR(ops(), "client {} is not let in: {} ({} refused since the last such line)", client,
                pub(reason), std::exchange(refused, 0));
}

void Listener::State::remember(const std::shared_ptr<lum::PeerConnection>& connection) {
    if (connections.size() == connections.capacity()) {
        std::erase_if(connections, [](const auto& weak) { return weak.expired(); });
        connections.reserve(std::max<std::size_t>(2 * connections.size(), 16));
    }
    connections.push_back(connection);
}

void Listener::State::close() {
    // What the connections let go of may be what keeps this alive.
    auto self = shared_from_this();
    pause.cancel();
    watch.reset();
    undecided.reset();
    closed = true;
    for (const auto& weak : std::exchange(connections, {}))
        if (auto connection = weak.lock()) connection->abandon();
    common.decoder->close();
    common.replies->close();
    common.requests->close();
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
    close();
}

void Listener::close() {
    state_->close();
}

void Listener::setEventHandler(EventHandler handler) {
    state_->handler = std::move(handler);
}

void Listener::resume() {
    state_->queue.async([weak = std::weak_ptr(state_)] {
        auto state = weak.lock();
        if (!state || state->watch || state->closed) return;
        state->watch.emplace(state->queue.runLoop(), state->socket.fd());
        state->acceptSome();
    });
}

}  // namespace platform
