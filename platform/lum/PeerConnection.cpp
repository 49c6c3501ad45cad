#include "platform/lum/PeerConnection.h"

#include <fmt/format.h>

#include <algorithm>
#include <chrono>
#include <utility>

#include "platform/log/OpsLog.h"
#include "platform/lum/Limits.h"

namespace platform::lum {

namespace {

constexpr std::chrono::milliseconds kPauseWhileStarved{50};

}  // namespace

/// What a delivered request carries: its connection's turn and its place in the budgets, given back
/// on whichever thread drops the request's last copy.
class PeerConnection::Turn {
  public:
    explicit Turn(PeerConnection& connection)
        : connection_(connection.weak_from_this()),
          replyBudget_(connection.common_.replies),
          replies_(connection.replies_),
          requests_(connection.requests_) {}
    Turn(const Turn&) = delete;
    ~Turn() {
        if (auto connection = connection_.lock()) connection->endTurn();
        requests_->remove(counted_);
        replyBudget_->leave(*replies_);
        if (freeLater_) freeLater_();
    }

    /// Takes over bytes that count in the connection's share of requests.
    void carry(std::size_t counted) { counted_ += counted; }

    /// Has what was decoded freed where it was decoded: that takes as long.
    void freeLater(std::shared_ptr<Decoder> decoder, const Origin& origin, Dictionary contents) {
        freeLater_ = [decoder = std::move(decoder), origin,
                      contents = std::move(contents)]() mutable {
            decoder->async(origin, [contents = std::move(contents)] {});
        };
    }

  private:
    std::weak_ptr<PeerConnection> connection_;
    std::shared_ptr<ReplyBudget> replyBudget_;
    std::shared_ptr<Budget::Share> replies_;
    std::shared_ptr<Budget::Share> requests_;
    std::size_t counted_ = 0;
    std::function<void()> freeLater_;
};

/// The turn is the last to go.
struct PeerConnection::Decoded {
    std::shared_ptr<Turn> turn;
    DecodedPayload payload;
};

PeerConnection::PeerConnection(UniqueFd socket, AuditToken token, Pool::Share share,
                               SerialQueue& queue, Common common)
    : queue_(queue),
      loop_(queue.runLoop()),
      token_(std::move(token)),
      share_(std::move(share)),
      common_(std::move(common)),
      replies_(common_.replies->open(share_.origin())),
      requests_(common_.requests->open(share_.origin())),
      socket_(std::move(socket)),
      reader_(kMaxRequestPayload) {}

void PeerConnection::resume() {
    if (queue_.isCurrent()) return start();
    queue_.async([self = shared_from_this()] { self->start(); });
}

void PeerConnection::start() {
    queue_.assertCurrent();
    if (watch_ || invalid_) return;
    replies_->setHolder(weak_from_this());
    requests_->setHolder(weak_from_this());
    watch_.emplace(loop_, socket_.fd());
    awaitHangup();
    if (socket_.held() > 0) awaitWritable();
    proceed();
}

// The watch's callbacks run only while it exists, and it goes with this object: they may hold a
// bare pointer.

void PeerConnection::awaitHangup() {
    watch_->awaitHangup([self = shared_from_this()] { self->hungUp(); });
}

void PeerConnection::awaitReadable() {
    awaitsReadable_ = true;
    watch_->awaitReadable([this] { readable(); });
}

void PeerConnection::awaitWritable() {
    watch_->awaitWritable([this] { writable(); });
}

void PeerConnection::sendOn(bool isStarved) {
    if (!isStarved) return awaitWritable();
    if (!retry_) retry_.emplace(loop_);
    retry_->start(kPauseWhileStarved, [this] { writable(); });
}

void PeerConnection::readable() {
    awaitsReadable_ = false;
    auto self = shared_from_this();
    receiveSome();
    proceed();
}

void PeerConnection::hungUp() {
    if (socket_.hasOutOfBandData()) return breakOff("out-of-band data");
    // Nothing: a receive in between has dropped that, or the wake was for another socket, one that
    // had this one's place in the loop before.
    if (!socket_.isHungUp()) return awaitHangup();
    // What the peer sent last may still be worth an error line.
    while (mayReadOn() && receiveSome()) proceed();
    becomeInvalid("the peer closed the connection");
}

void PeerConnection::writable() {
    auto self = shared_from_this();
    const FrameSocket::Flushed flushed = socket_.flush();
    if (flushed.awaitWritable) sendOn(flushed.isStarved);
    peerReads_.progress(flushed.written);
    replies_->remove(flushed.freed);
    proceed();
}

bool PeerConnection::receiveSome() {
    // Uninitialised: only what was received is read.
    char buffer[64 * 1024];
    const auto count = socket_.receive(buffer, sizeof buffer);
    if (!count) return false;
    peerSends_.progress(*count);
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

bool PeerConnection::mayReadOn() {
    return !invalid_ && !ended_ && uncut_.empty() && hasRoomForRequests() && takeCounted();
}

std::size_t PeerConnection::countedBytes() const {
    const std::size_t bytes = waitingBytes_ + uncut_.size() + reader_.announced();
    return bytes - std::min(bytes, kFreeReceived);
}

bool PeerConnection::takeCounted() {
    const std::size_t wanted = countedBytes();
    if (wanted > counted_) {
        const std::size_t more = wanted - counted_;
        if (requests_->isWaiting() || !common_.requests->tryTake(*requests_, more)) {
            requests_->await(more);
            return false;
        }
        counted_ = wanted;
    }
    requests_->stopWaiting();
    return true;
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
    if (ended_ && !announcedEnd_ && !decoding_ && waiting_.empty() && uncut_.empty()) {
        announcedEnd_ = true;
        handler_(ConnectionError{ConnectionError::Kind::TerminationImminent,
                                 "the peer will send nothing more"});
    }
    if (mayReadOn() && !awaitsReadable_) awaitReadable();
    noteExpectations();
}

void PeerConnection::deliverWaiting() {
    while (!invalid_ && !waiting_.empty()) {
        auto turn = takeTurn();
        if (!turn) return;
        auto payload = std::move(waiting_.front());
        waiting_.pop_front();
        waitingBytes_ -= payload->size();
        const std::size_t stillCounted = std::min(counted_, countedBytes());
        turn->carry(std::exchange(counted_, stillCounted) - stillCounted);
        deliver(std::move(payload), std::move(turn));
    }
}

void PeerConnection::deliver(std::shared_ptr<const std::string> payload,
                             std::shared_ptr<Turn> turn) {
    if (payload->size() <= kMaxDecodedAtOnce) {
        auto decoded = decodePayload(std::move(payload), FrameKind::Request);
        return handOver({std::move(turn), std::move(decoded)});
    }
    // The connection's next request waits for the end of this one's turn: their order holds.
    decoding_ = true;
    const Origin& origin = share_.origin();
    common_.decoder->async(
        origin, [weak = weak_from_this(), decoder = common_.decoder, origin, pid = pid(),
                 &loop = loop_, payload = std::move(payload), turn = std::move(turn)]() mutable {
            auto decoded = std::make_shared<Decoded>();
            decoded->turn = std::move(turn);
            decoded->payload = decodePayload(std::move(payload), FrameKind::Request);
            if (auto* message = std::get_if<Message>(&decoded->payload))
                decoded->turn->freeLater(std::move(decoder), origin, message->contents());
            loop.post([weak = std::move(weak), pid, decoded = std::move(decoded)] {
                auto self = weak.lock();
                if (!self || self->invalid_) {
                    // Who is gone is none the less told of.
                    if (const auto* error = std::get_if<Error>(&decoded->payload))
                        EVLOG_ERROR(ops(), "client {} has gone, and left what is no request: {}",
                                    pid, pub(error->text));
                    return;
                }
                self->decoding_ = false;
                self->handOver(std::move(*decoded));
                self->proceed();
            });
        });
}

void PeerConnection::handOver(Decoded decoded) {
    if (auto* message = std::get_if<Message>(&decoded.payload)) {
        message->setTurn(std::move(decoded.turn));
        handler_(std::move(*message));
    } else if (auto* unknown = std::get_if<UnknownObject>(&decoded.payload)) {
        handler_(std::move(*unknown));
    } else {
        breakOff(std::get<Error>(decoded.payload).text);
    }
}

std::shared_ptr<PeerConnection::Turn> PeerConnection::takeTurn() {
    // Only this queue takes turns: a free one stays free. Held replies shrink on this queue too,
    // which then proceeds.
    if (socket_.held() > kMaxUnsentPerConnection) return nullptr;
    // A host that does not take its descriptors gets no more of them.
    if (socket_.held() > 0 && socket_.holdsDescriptor()) return nullptr;
    TurnState state = turn_;
    if (state == Taken && turn_.compare_exchange_strong(state, Awaited)) return nullptr;
    if (state == Awaited || replies_->isWaiting()) return nullptr;
    if (!common_.replies->tryEnter(*replies_)) {
        replies_->await();
        return nullptr;
    }
    replies_->stopWaiting();
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
    const FrameSocket::Sent sent = socket_.send(std::move(*frame), reply.takeDescriptor());
    if (sent.kept == 0) return;
    replies_->add(sent.kept);
    if (!sent.awaitWritable) return;
    loop_.post([weak = weak_from_this(), isStarved = sent.isStarved] {
        auto self = weak.lock();
        if (!self || !self->watch_) return;
        self->sendOn(isStarved);
        self->noteExpectations();
    });
}

void PeerConnection::noteExpectations() {
    peerReads_.expect(socket_.held() > 0);
    peerSends_.expect(awaitsReadable_ && reader_.insideFrame());
}

std::optional<StallClock::Time> PeerConnection::stalledSince(const Budget& budget) const {
    if (invalid_) return std::nullopt;
    // After a time in which this process did nothing it is not the peer who is behind.
    auto reads = socket_.isWritable() ? std::nullopt : peerReads_.since();
    if (&budget == common_.replies.get()) return reads;
    // Requests may also wait because the peer does not read the replies to those before them.
    if (waiting_.empty() || socket_.held() <= kMaxUnsentPerConnection) reads.reset();
    const auto sends = socket_.isReadable() ? std::nullopt : peerSends_.since();
    return reads && sends ? std::min(reads, sends) : reads ? reads : sends;
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
    retry_.reset();
    replies_->remove(socket_.close());
    replies_->stopWaiting();
    waiting_.clear();
    waitingBytes_ = 0;
    uncut_.clear();
    reader_ = FrameReader(kMaxRequestPayload);
    requests_->remove(std::exchange(counted_, 0));
    requests_->stopWaiting();
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
