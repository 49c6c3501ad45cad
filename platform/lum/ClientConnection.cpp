#include "platform/lum/ClientConnection.h"

#include <fmt/format.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <deque>
#include <map>
#include <mutex>
#include <optional>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/log/OpsLog.h"
#include "platform/lum/Frame.h"
#include "platform/lum/FrameSocket.h"
#include "platform/lum/Limits.h"
#include "platform/lum/Listener.h"
#include "platform/system/UniqueFd.h"
#include "platform/threads/RunLoop.h"

namespace platform {

namespace {

constexpr std::chrono::milliseconds kPauseWhileFull{10};

/// A connected socket; none while too many wait to be let in already. Nothing tells of an end of
/// that but another try.
Result<UniqueFd> connectTo(const std::string& path) {
    UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
    if (!socket) return Error::posix(errno, "no socket for " + path);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, path.data(), path.size());
    int outcome = -1;
    do {
        outcome =
            ::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address);
    } while (outcome != 0 && errno == EINTR);
    if (outcome == 0) return socket;
    if (errno == EAGAIN) return UniqueFd();
    return Error::posix(errno, "no service at " + path);
}

}  // namespace

struct ClientConnection::State : std::enable_shared_from_this<ClientConnection::State> {
    SerialQueue& queue;
    const Result<std::string> path;
    EventHandler eventHandler;  // set before `resume`, then the queue's

    std::mutex mutex;
    // Guarded by the mutex: why there is no connection (none while there is one), whether the owner
    // is gone, and the requests without a reply, by serial.
    std::optional<ConnectionError> broken{{ConnectionError::Kind::Invalid, "not resumed"}};
    bool closed = false;
    std::map<std::uint64_t, ReplyHandler> waiting;
    std::vector<SliceList> unsent;  // requests, while there is no socket
    std::atomic<std::uint64_t> lastSerial = 0;

    // Made once, under the mutex, by `resume` or on the queue. It guards its sending itself; the
    // rest of it, and what follows, is the queue's.
    std::optional<lum::FrameSocket> socket;
    std::optional<RunLoop::Timer> nextTry;  // while it has not been made
    lum::FrameReader reader{lum::kMaxReplyPayload};
    std::deque<UniqueFd> descriptors;  // each came before the end of the reply that it belongs to
    std::optional<RunLoop::Watch> watch;

    State(const Directories& directories, const std::string& serviceName, SerialQueue& eventQueue)
        : queue(eventQueue), path(lum::socketPath(directories, serviceName)) {}

    void connect();
    void start();
    void awaitReadable();
    void awaitWritable();
    void readable();
    void received(std::string_view input);
    void deliver(std::shared_ptr<const std::string> payload);
    void interrupted(const std::string& reason) {
        end({ConnectionError::Kind::Interrupted, reason});
    }
    void end(const ConnectionError& event);
    void shutDown();

    bool isClosed();
    void answerLater(ReplyHandler reply, ConnectionError error);
};

bool ClientConnection::State::isClosed() {
    std::lock_guard lock(mutex);
    return closed;
}

/// Makes the socket, with what has been sent meanwhile, or notes that there will be none.
void ClientConnection::State::connect() {
    auto connected = path ? connectTo(*path) : path.error();
    std::lock_guard lock(mutex);
    broken.reset();
    if (!connected) {
        broken = {ConnectionError::Kind::Invalid, connected.error().text};
    } else if (*connected) {
        socket.emplace(std::move(*connected));
        for (SliceList& frame : std::exchange(unsent, {})) socket->send(std::move(frame));
    }
}

void ClientConnection::State::start() {
    if (isClosed()) return;
    // The reason does not change any more.
    if (broken) return end(ConnectionError(*broken));
    if (!socket) {
        if (!nextTry) nextTry.emplace(queue.runLoop());
        return nextTry->start(kPauseWhileFull, [this] {
            connect();
            start();
        });
    }
    nextTry.reset();
    watch.emplace(queue.runLoop(), socket->fd());
    awaitReadable();
    if (socket->held() > 0) awaitWritable();
}

// The watch's callbacks run only while it exists, and it goes with this object: they may hold a
// bare pointer.

void ClientConnection::State::awaitReadable() {
    watch->awaitReadable([this] { readable(); });
}

void ClientConnection::State::awaitWritable() {
    watch->awaitWritable([this] {
        if (socket->flush().awaitWritable) awaitWritable();
    });
}

void ClientConnection::State::readable() {
    // A long reply is read in several steps, but not so many that the queue's other work waits.
    constexpr int kMostSteps = 16;
    auto self = shared_from_this();
    char buffer[64 * 1024];
    for (int i = 0; i < kMostSteps && watch; ++i) {
        UniqueFd descriptor;
        const auto count = socket->receive(buffer, sizeof buffer, descriptor);
        if (!count) break;
        if (descriptor) descriptors.push_back(std::move(descriptor));
        if (*count == 0) return interrupted("the service has gone away");
        received({buffer, *count});
        if (*count < sizeof buffer) break;
    }
    if (watch) awaitReadable();
}

void ClientConnection::State::received(std::string_view input) {
    while (watch) {
        auto payload = reader.take(input);
        if (!payload) {
            EVLOG_ERROR(ops(), "{}: {}", pub(*path), pub(payload.error().text));
            return interrupted(payload.error().text);
        }
        if (!*payload) return;
        deliver(std::move(*payload));
    }
}

void ClientConnection::State::deliver(std::shared_ptr<const std::string> payload) {
    auto decoded = lum::decodePayload(std::move(payload), lum::FrameKind::Reply);
    if (auto* error = std::get_if<Error>(&decoded)) {
        EVLOG_ERROR(ops(), "{}: {}", pub(*path), pub(error->text));
        return interrupted(error->text);
    }
    if (auto* unknown = std::get_if<UnknownObject>(&decoded)) {
        EVLOG_ERROR(ops(), "{} has sent what is no reply: {}", pub(*path), *unknown);
        return;
    }
    auto& message = std::get<Message>(decoded);
    const Value* withDescriptor = message.find(Message::kDescriptor);
    if (withDescriptor && equalsTrue(*withDescriptor) && !descriptors.empty()) {
        message.attach(std::move(descriptors.front()));
        descriptors.pop_front();
    }
    decltype(waiting)::node_type entry;
    {
        std::lock_guard lock(mutex);
        if (closed) return;
        entry = waiting.extract(message.serial());
    }
    if (!entry) {
        EVLOG_ERROR(ops(), "{} has replied to no request of ours: {}", pub(*path),
                    message.serial());
        return;
    }
    entry.mapped()(Reply(std::move(message)));
}

void ClientConnection::State::end(const ConnectionError& event) {
    decltype(waiting) unanswered;
    {
        std::lock_guard lock(mutex);
        if (closed) return;
        broken = event;
        unanswered.swap(waiting);
        unsent.clear();
    }
    watch.reset();
    nextTry.reset();
    if (socket) socket->close();
    if (auto handler = std::exchange(eventHandler, nullptr)) handler(event);
    for (auto& [serial, reply] : unanswered) {
        if (isClosed()) return;
        reply(Reply(event));
    }
}

void ClientConnection::State::shutDown() {
    watch.reset();
    nextTry.reset();
    if (socket) socket->close();
    eventHandler = nullptr;
}

void ClientConnection::State::answerLater(ReplyHandler reply, ConnectionError error) {
    queue.async([weak = weak_from_this(), reply = std::move(reply), error = std::move(error)] {
        auto self = weak.lock();
        if (self && !self->isClosed()) reply(Reply(error));
    });
}

ClientConnection::ClientConnection(const Directories& directories, const std::string& serviceName,
                                   SerialQueue& queue)
    : state_(std::make_shared<State>(directories, serviceName, queue)) {}

ClientConnection::~ClientConnection() {
    decltype(state_->waiting) unanswered;
    {
        std::lock_guard lock(state_->mutex);
        state_->closed = true;
        unanswered.swap(state_->waiting);
    }
    if (state_->queue.isCurrent()) {
        state_->shutDown();
    } else {
        state_->queue.async([state = state_] { state->shutDown(); });
    }
}

void ClientConnection::setEventHandler(EventHandler handler) {
    state_->eventHandler = std::move(handler);
}

void ClientConnection::resume() {
    state_->connect();
    state_->queue.async([weak = std::weak_ptr(state_)] {
        if (auto state = weak.lock()) state->start();
    });
}

void ClientConnection::sendWithReply(Message request, ReplyHandler reply) {
    State& state = *state_;
    const auto refuse = [&](const Error& error) {
        state.answerLater(std::move(reply), {ConnectionError::Kind::Refused, error.text});
    };
    if (auto wrong = lum::whatIsWrongWith(request.contents())) return refuse(*wrong);
    const std::uint64_t serial = ++state.lastSerial;
    request.setSerial(serial);
    auto frame = lum::encodeFrame(lum::FrameKind::Request, request, lum::kMaxRequestPayload);
    if (!frame) return refuse(frame.error());
    {
        std::unique_lock lock(state.mutex);
        if (state.broken) {
            ConnectionError error = *state.broken;
            lock.unlock();
            return state.answerLater(std::move(reply), std::move(error));
        }
        // Before sending: the reply may be here at once.
        state.waiting.emplace(serial, std::move(reply));
        if (!state.socket) {
            state.unsent.push_back(std::move(*frame));
            return;
        }
    }
    if (!state.socket->send(std::move(*frame)).awaitWritable) return;
    state.queue.async([weak = std::weak_ptr(state_)] {
        auto self = weak.lock();
        if (self && self->watch) self->awaitWritable();
    });
}

std::string ClientConnection::description() const {
    return fmt::format("<ClientConnection {} {}>", fmt::ptr(state_.get()),
                       state_->path ? *state_->path : describe(state_->path.error()));
}

}  // namespace platform
