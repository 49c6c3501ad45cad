#include "platform/lum/PeerConnection.h"

#include <fmt/format.h>

#include <utility>

#include "platform/Log.h"
#include "platform/lum/Limits.h"

namespace platform::lum {

namespace {

const Log& ops() {
    static const Log& handle = Log::make("com.orbel.Zorvan", "ops");
    return handle;
}

}  // namespace

/// What a delivered request carries: its connection's turn and its place in the budget, given back
/// on whichever thread drops the request's last copy.
class PeerConnection::Turn {
  public:
    explicit Turn(PeerConnection& connection)
        : connection_(connection.weak_from_this()), budget_(connection.budget_) {}
    Turn(const Turn&) = delete;
    ~Turn() {
        if (auto connection = connection_.lock()) connection->endTurn();
        budget_->leave();
    }

  private:
    std::weak_ptr<PeerConnection> connection_;
    std::shared_ptr<ReplyBudget> budget_;
};

PeerConnection::PeerConnection(UniqueFd socket, AuditToken token, SerialQueue& queue,
                               std::shared_ptr<ReplyBudget> budget)
    : queue_(queue),
      loop_(queue.runLoop()),
      token_(std::move(token)),
      budget_(std::move(budget)),
      socket_(std::move(socket)),
      reader_(kMaxRequestPayload) {}

PeerConnection::~PeerConnection() {
    budget_->remove(socket_.held());
}

void PeerConnection::resume() {
    if (queue_.isCurrent()) return start();
    queue_.async([self = shared_from_this()] { self->start(); });
}

void PeerConnection::start() {
    queue_.assertCurrent();
    if (watch_ || invalid_) return;
    watch_.emplace(loop_, socket_.fd());
    watch_->awaitHangup([self = shared_from_this()] { self->hungUp(); });
    if (socket_.held() > 0) awaitWritable();
    proceed();
}

// The watch's callbacks run only while it exists, and it goes with this object: they may hold a
// bare pointer.

void PeerConnection::awaitReadable() {
    awaitsReadable_ = true;
    watch_->awaitReadable([this] { readable(); });
}

void PeerConnection::awaitWritable() {
    watch_->awaitWritable([this] { writable(); });
}

void PeerConnection::readable() {
    awaitsReadable_ = false;
    auto self = shared_from_this();
    receiveSome();
    proceed();
}

void PeerConnection::hungUp() {
    // What wakes us is a hang-up or out-of-band data, which a receive in between may have dropped.
    if (socket_.hasOutOfBandData() || !socket_.isHungUp()) return breakOff("out-of-band data");
    // What the peer sent last may still be worth an error line.
    while (mayReadOn() && receiveSome()) proceed();
    becomeInvalid("the peer closed the connection");
}

void PeerConnection::writable() {
    auto self = shared_from_this();
    const FrameSocket::Flushed flushed = socket_.flush();
    if (flushed.awaitWritable) awaitWritable();
    budget_->remove(flushed.freed);
    proceed();
}

bool PeerConnection::receiveSome() {
    // Uninitialised: only what was received is read.
    char buffer[64 * 1024];
    const auto count = socket_.receive(buffer, sizeof buffer);
    if (!count) return false;
    if (*count > 0) {
        cutFrames({buffer, *count});
    } else {
        endOfStream();
    }
    return *count > 0;
}

void PeerConnection::endOfStream() {
    ended_ = true;
    if (reader_.insideFrame()) {
        breakOff("the stream ended in the middle of a frame");
    } else if (socket_.isHungUp()) {
        becomeInvalid("the peer closed the connection");
    }
}

void PeerConnection::cutFrames(std::string_view input) {
    while (hasRoomForRequests()) {
        auto payload = reader_.take(input);
        if (!payload) return breakOff(payload.error().text);
        if (!*payload) return;
        waitingBytes_ += (*payload)->size();
        waiting_.push_back(std::move(*payload));
    }
    uncut_.assign(input);
}

bool PeerConnection::hasRoomForRequests() const {
    return waiting_.size() < kMaxWaitingRequests && waitingBytes_ < kMaxWaitingBytes;
}

bool PeerConnection::mayReadOn() const {
    return !invalid_ && !ended_ && uncut_.empty() && hasRoomForRequests();
}

void PeerConnection::proceed() {
    if (!watch_) return;
    deliverWaiting();
    // Only when nothing waits: cutting the rest one by one would move it again and again.
    while (!invalid_ && !uncut_.empty() && waiting_.empty()) {
        cutFrames(std::exchange(uncut_, {}));
        deliverWaiting();
    }
    if (invalid_) return;
    if (ended_ && !announcedEnd_ && waiting_.empty() && uncut_.empty()) {
        announcedEnd_ = true;
        handler_(ConnectionError{ConnectionError::Kind::TerminationImminent,
                                 "the peer will send nothing more"});
    }
    if (mayReadOn() && !awaitsReadable_) awaitReadable();
}

void PeerConnection::deliverWaiting() {
    while (!invalid_ && !waiting_.empty()) {
        auto turn = takeTurn();
        if (!turn) return;
        auto payload = std::move(waiting_.front());
        waiting_.pop_front();
        waitingBytes_ -= payload->size();
        deliver(std::move(payload), std::move(turn));
    }
}

void PeerConnection::deliver(std::shared_ptr<const std::string> payload,
                             std::shared_ptr<void> turn) {
    DecodedPayload decoded = decodePayload(std::move(payload), FrameKind::Request);
    if (auto* message = std::get_if<Message>(&decoded)) {
        message->setTurn(std::move(turn));
        handler_(std::move(*message));
    } else if (auto* unknown = std::get_if<UnknownObject>(&decoded)) {
        handler_(std::move(*unknown));
    } else {
        breakOff(std::get<Error>(decoded).text);
    }
}

std::shared_ptr<void> PeerConnection::takeTurn() {
    // Only this queue takes turns: a free one stays free. Held replies shrink on this queue too,
    // which then proceeds.
    if (socket_.held() > kMaxUnsentPerConnection) return nullptr;
    TurnState state = turn_;
    if (state == Taken && turn_.compare_exchange_strong(state, Awaited)) return nullptr;
    if (state == Awaited || awaitsBudget_) return nullptr;
    if (!budget_->tryEnter()) {
        awaitsBudget_ = true;
        budget_->await([weak = weak_from_this()] {
            auto self = weak.lock();
            if (!self) return;
            self->awaitsBudget_ = false;
            self->proceed();
        });
        return nullptr;
    }
    turn_ = Taken;
    return std::make_shared<Turn>(*this);
}

void PeerConnection::endTurn() {
    if (turn_.exchange(Free) != Awaited) return;
    loop_.post([weak = weak_from_this()] {
        if (auto self = weak.lock()) self->proceed();
    });
}

void PeerConnection::send(const Message& reply) {
    Result<SliceList> frame = encodeFrame(FrameKind::Reply, reply, kMaxReplyPayload);
    if (!frame) {
        loop_.post([weak = weak_from_this(), reason = frame.error().text] {
            if (auto self = weak.lock()) self->breakOff(reason);
        });
        return;
    }
    const FrameSocket::Sent sent = socket_.send(std::move(*frame));
    if (sent.kept == 0) return;
    budget_->add(sent.kept);
    if (!sent.awaitWritable) return;
    loop_.post([weak = weak_from_this()] {
        auto self = weak.lock();
        if (self && self->watch_) self->awaitWritable();
    });
}

void PeerConnection::breakOff(const std::string& reason) {
    if (!invalid_) EVLOG_ERROR(ops(), "client {} is cut off: {}", pid(), pub(reason));
    becomeInvalid(reason);
}

void PeerConnection::becomeInvalid(const std::string& reason) {
    if (invalid_) return;
    invalid_ = true;
    auto self = shared_from_this();
    watch_.reset();
    budget_->remove(socket_.close());
    waiting_.clear();
    waitingBytes_ = 0;
    uncut_.clear();
    // Its closures may hold the context, which may hold anything: let go of it after the event.
    auto handler = std::exchange(handler_, nullptr);
    if (handler) handler(ConnectionError{ConnectionError::Kind::Invalid, reason});
}

void PeerConnection::abandon() {
    auto self = shared_from_this();
    if (!queue_.isCurrent()) handler_ = nullptr;
    becomeInvalid("the service has ended");
    context_.reset();
}

std::string PeerConnection::description() const {
    return fmt::format("<Connection {} pid={}>", fmt::ptr(this), pid());
}

}  // namespace platform::lum
