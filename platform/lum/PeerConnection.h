#pragma once

#include <atomic>
#include <cstddef>
#include <deque>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/lum/Connection.h"
#include "platform/lum/Decoder.h"
#include "platform/lum/Frame.h"
#include "platform/lum/FrameSocket.h"
#include "platform/lum/Pool.h"
#include "platform/lum/ReceiveBudget.h"
#include "platform/lum/ReplyBudget.h"
#include "platform/lum/StallClock.h"
#include "platform/system/UniqueFd.h"
#include "platform/threads/RunLoop.h"
#include "platform/threads/SerialQueue.h"

namespace platform::lum {

/// The connection over a socket. Everything but `send` and the end of a turn happens on the queue;
/// members are the queue's unless they say otherwise.
///
/// What keeps it alive from `resume` to its invalid event is the callback that waits for the
/// hang-up. So a loop that is destroyed takes its connections along.
class PeerConnection final : public Connection,
                             public Budget::Holder,
                             public std::enable_shared_from_this<PeerConnection> {
  public:
    /// What all connections of a listener have in common.
    struct Common {
        std::shared_ptr<ReplyBudget> replies;
        std::shared_ptr<ReceiveBudget> requests;
        std::shared_ptr<Decoder> decoder;
    };
    PeerConnection(UniqueFd socket, AuditToken token, Pool::Share share, SerialQueue& queue,
                   Common common);

    pid_t pid() const override { return token_.pid(); }
    const AuditToken& auditToken() const override { return token_; }
    Origin origin() const override { return share_.origin(); }
    void setContext(std::shared_ptr<void> context) override { context_ = std::move(context); }
    void setEventHandler(EventHandler handler) override { handler_ = std::move(handler); }
    void resume() override;
    void send(const Message& reply) override;
    std::string description() const override;

    /// Becomes invalid because the service ends, and lets go of the handler and the context. The
    /// event is for the queue alone: off the queue, where the loop may not run, there is none.
    void abandon();

    void retry() override { proceed(); }
    std::optional<StallClock::Time> stalledSince(const Budget& budget) const override;
    void cutOff(const std::string& reason) override { breakOff(reason); }

  private:
    class Turn;
    struct Decoded;
    enum TurnState { Free, Taken, Awaited };

    void start();
    void readable();
    void hungUp();
    void writable();

    /// One receive; false when there was nothing more to be had.
    bool receiveSome();
    void cutFrames(std::string_view input);
    void endOfStream();

    /// Delivers what may be delivered, reads on when there is room: after every change.
    void proceed();
    void deliverWaiting();
    void deliver(std::shared_ptr<const std::string> payload, std::shared_ptr<Turn> turn);
    void handOver(Decoded decoded);
    bool hasRoomForRequests() const;
    bool mayReadOn();
    /// What counts in the budget of all connections of what has been received; whether that has
    /// room for it, else it is awaited.
    std::size_t countedBytes() const;
    bool takeCounted();
    void awaitHangup();
    void awaitReadable();
    void awaitWritable();
    /// Has what is unsent sent, once the socket is writable, or, starved, after a while.
    void sendOn(bool isStarved);

    std::shared_ptr<Turn> takeTurn();
    void endTurn();

    /// Whether the peer has to act for things to go on: after every change.
    void noteExpectations();

    void breakOff(const std::string& reason);
    void becomeInvalid(const std::string& reason);

    SerialQueue& queue_;
    RunLoop& loop_;
    const AuditToken token_;
    const Pool::Share share_;  // of the connections that there may be
    const Common common_;
    const std::shared_ptr<Budget::Share> replies_;
    const std::shared_ptr<Budget::Share> requests_;
    std::shared_ptr<void> context_;
    EventHandler handler_;

    FrameSocket socket_;  // its own mutex guards sending
    FrameReader reader_;
    std::optional<RunLoop::Watch> watch_;  // from `resume` to the invalid event
    std::optional<RunLoop::Timer> retry_;  // from the first time that the socket was starved
    bool invalid_ = false;
    bool ended_ = false;  // the peer sends nothing more
    bool announcedEnd_ = false;
    bool decoding_ = false;  // a request is on the decoder's thread
    bool awaitsReadable_ = false;

    // Requests that wait for their turn, still encoded, and bytes behind the last one that fitted.
    std::deque<std::shared_ptr<const std::string>> waiting_;
    std::size_t waitingBytes_ = 0;
    std::string uncut_;
    std::size_t counted_ = 0;  // in `requests_`, of what no turn carries yet

    StallClock peerReads_;
    StallClock peerSends_;  // the rest of a request

    std::atomic<TurnState> turn_ = Free;  // taken on the queue, given back on any thread
};

}  // namespace platform::lum
