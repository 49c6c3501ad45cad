#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>

#include <functional>

#include "platform/lum/PeerConnection.h"
#include "platform/values/Cbor.h"
#include "tests/platform/lum/LumFixture.h"

namespace platform::lum {
namespace {

using ::testing::ElementsAre;

struct FakeHolder final : Budget::Holder {
    std::function<void()> onRetry;
    std::function<void()> onCutOff;
    std::optional<StallClock::Time> stalled;

    void retry() override { onRetry(); }
    std::optional<StallClock::Time> stalledSince(const Budget&) const override { return stalled; }
    void cutOff(const std::string&) override { onCutOff(); }
};

/// As many origins as there are numbers.
Origin origin(pid_t session) {
    return {0, 0, session};
}

constexpr std::size_t kQuarterOfReplies = kMaxUnsentTotal / 4;
constexpr std::size_t kQuarterOfRequests = kMaxReceivedTotal / 4;

TEST(ReplyBudget, LetsRequestsInWhileTheirRepliesFit) {
    RunLoop loop;
    auto budget = std::make_shared<ReplyBudget>(loop);
    std::vector<std::shared_ptr<Budget::Share>> shares;
    for (pid_t session : {1, 2, 3, 4, 5}) shares.push_back(budget->open(origin(session)));
    const auto enterAll = [&] {
        std::vector<std::size_t> entered;
        for (const auto& share : shares) {
            entered.push_back(0);
            while (budget->tryEnter(*share)) entered.back() += 1;
        }
        return entered;
    };
    EXPECT_THAT(enterAll(), ElementsAre(8, 8, 8, 8, 0));

    // The first reply shows that replies are large: from now on one request at a time.
    shares[0]->add(kMaxUnsentTotal);
    for (int i = 0; i < 32; ++i) budget->leave(*shares[i / 8]);
    EXPECT_THAT(enterAll(), ElementsAre(0, 1, 0, 0, 0)) << "nor one of who holds its quarter";
    budget->leave(*shares[1]);

    for (int i : {1, 2, 3}) shares[i]->add(kQuarterOfReplies);
    shares[4]->add(1);
    EXPECT_FALSE(budget->tryEnter(*shares[4]));
    std::string order;
    std::vector<std::pair<std::shared_ptr<FakeHolder>, std::shared_ptr<Budget::Share>>> line;
    for (char name : {'a', 'b', 'x', 'c'}) {
        auto& [holder, waiting] =
            line.emplace_back(std::make_shared<FakeHolder>(), budget->open(origin(name)));
        holder->onRetry = [&order, &budget, name, share = waiting.get()] {
            if (budget->tryEnter(*share)) order += name;
        };
        waiting->setHolder(holder);
        waiting->await();
    }
    line[2].second->stopWaiting();
    loop.poll();
    EXPECT_EQ(order, "");
    shares[4]->remove(1);
    EXPECT_FALSE(budget->tryEnter(*shares[4])) << "those who wait come first";
    loop.poll();
    EXPECT_EQ(order, "a");
    budget->leave(*line[0].second);
    loop.poll();
    EXPECT_EQ(order, "ab");
    shares.clear();
    budget->leave(*line[1].second);
    loop.poll();
    EXPECT_EQ(order, "abc");

    budget->leave(*line[3].second);
    shares.push_back(budget->open(origin(1)));
    EXPECT_THAT(enterAll(), ElementsAre(8)) << "large replies forgotten";
}

TEST(Budget, WhoHasUsedUpItsQuarterStandsInItsOwnWayAlone) {
    RunLoop loop;
    auto budget = std::make_shared<ReceiveBudget>(loop, std::chrono::milliseconds(20));
    std::string events;
    struct Member {
        std::shared_ptr<FakeHolder> holder = std::make_shared<FakeHolder>();
        std::shared_ptr<Budget::Share> share;
    };
    const auto join = [&](char name, pid_t session, std::size_t holds) {
        Member member;
        member.share = budget->open(origin(session));
        member.share->setHolder(member.holder);
        member.holder->stalled = std::chrono::steady_clock::now() - std::chrono::hours(1);
        member.holder->onRetry = [&events, name] { events += name; };
        member.holder->onCutOff = [&events, share = member.share.get(), holds, name] {
            events += std::string("-") + name;
            share->remove(holds);
        };
        EXPECT_TRUE(budget->tryTake(*member.share, holds)) << name;
        return member;
    };
    Member small = join('s', 1, 1), hoarder = join('h', 1, kQuarterOfRequests - 1);
    Member waiting = join('w', 1, 0), other = join('o', 2, kMaxRequestPayload);
    EXPECT_FALSE(budget->tryTake(*waiting.share, 1));
    waiting.share->await(1);
    EXPECT_TRUE(budget->tryTake(*other.share, kMaxRequestPayload)) << "a stranger's line";
    loop.poll();
    loop.poll();
    EXPECT_EQ(events, "-hw");
}

TEST(Budget, CutsOffTheLargestOfTheStalledUntilThereIsRoom) {
    RunLoop loop;
    const std::chrono::milliseconds patience(20);
    auto budget = std::make_shared<ReplyBudget>(loop, patience);
    const auto longAgo = std::chrono::steady_clock::now() - std::chrono::hours(1);
    std::string cut;
    struct Member {
        std::shared_ptr<FakeHolder> holder = std::make_shared<FakeHolder>();
        std::shared_ptr<Budget::Share> share;
    };
    std::vector<Member> members;
    const auto join = [&](char name, std::size_t holds, std::optional<StallClock::Time> stalled) {
        Member& member = members.emplace_back();
        member.share = budget->open(origin(name));
        member.share->setHolder(member.holder);
        member.share->add(holds);
        member.holder->stalled = stalled;
        member.holder->onCutOff = [&cut, share = std::weak_ptr(member.share), holds, name] {
            cut += name;
            share.lock()->remove(holds);
        };
    };
    join('a', kMaxUnsentTotal / 8, longAgo);
    join('b', kMaxUnsentTotal / 4, longAgo);
    join('c', kMaxUnsentTotal / 4, std::nullopt);  // reads
    join('d', kMaxUnsentTotal / 4, longAgo);
    join('e', kMaxUnsentTotal / 4, std::nullopt);
    join('f', kMaxUnsentTotal, std::nullopt);  // counts as a quarter
    loop.poll();
    EXPECT_EQ(cut, "") << "nobody waits";

    bool entered = false;
    Member waiting{std::make_shared<FakeHolder>(), budget->open(origin('w'))};
    waiting.holder->onRetry = [&] { entered = budget->tryEnter(*waiting.share); };
    waiting.share->setHolder(waiting.holder);
    waiting.share->await();
    loop.poll();
    EXPECT_TRUE(cut == "bd" || cut == "db") << cut;
    loop.poll();
    EXPECT_TRUE(entered);

    // Over the limit once more, by those whose time is not up: the budget looks again by itself.
    budget->leave(*waiting.share);
    members[1].share->add(kMaxUnsentTotal / 4);
    members[1].holder->stalled = std::nullopt;
    for (Member& member : {std::ref(members[0]), std::ref(members[4])})
        member.holder->stalled = std::chrono::steady_clock::now();
    waiting.share->await();
    entered = false;
    const auto begin = std::chrono::steady_clock::now();
    while (!entered && std::chrono::steady_clock::now() - begin < std::chrono::seconds(20))
        loop.runOnce(patience);
    EXPECT_TRUE(entered);
    EXPECT_EQ(cut.substr(2), "e");
}

TEST(Budget, WhoeverStallsInTurnIsNotGivenAllThePatienceInTurn) {
    RunLoop loop;
    const std::chrono::milliseconds patience(200);
    auto budget = std::make_shared<ReplyBudget>(loop, patience);
    auto staller = std::make_shared<FakeHolder>(), waiting = std::make_shared<FakeHolder>();
    auto stalled = budget->open(origin(1)), waits = budget->open(origin(1));
    stalled->setHolder(staller);
    waits->setHolder(waiting);
    stalled->add(kMaxUnsentTotal + 1);
    int cut = 0;
    const auto begin = std::chrono::steady_clock::now();
    staller->stalled = begin;
    // As if another one had got the room and stalled as well.
    staller->onCutOff = [&] {
        staller->stalled = std::chrono::steady_clock::now();
        if (++cut == 10) stalled->remove(kMaxUnsentTotal + 1);
    };
    bool entered = false;
    waiting->onRetry = [&] { entered = budget->tryEnter(*waits); };
    waits->await();
    while (!entered && std::chrono::steady_clock::now() - begin < std::chrono::seconds(20))
        loop.runOnce(patience);
    EXPECT_TRUE(entered);
    EXPECT_LT(std::chrono::steady_clock::now() - begin, 5 * patience);
}

/// Connections of this process with itself, over budgets with little patience.
class SharedBudgetsTest : public LumTest {
  protected:
    struct Pair {
        std::shared_ptr<PeerConnection> connection;
        std::unique_ptr<RawPeer> peer;
    };
    ~SharedBudgetsTest() override { decoder->close(); }

    /// Each comes from elsewhere.
    Pair connect() {
        Pair pair = pairOf(++origins);
        queue.async([connection = pair.connection] { connection->resume(); });
        loop.poll();
        return pair;
    }
    Pair pairOf(pid_t session) {
        int ends[2];
        if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0) return {};
        auto peer = std::make_unique<RawPeer>(UniqueFd(ends[1]));
        auto connection = std::make_shared<PeerConnection>(
            UniqueFd(ends[0]), *AuditToken::ofSelf(), *Pool(4).draw(origin(session)), queue,
            PeerConnection::Common{replies, requests, decoder});
        connection->setEventHandler(
            [this, weak = std::weak_ptr(connection)](const ConnectionEvent& event) {
                auto self = weak.lock();
                if (auto* message = std::get_if<Message>(&event)) {
                    served += 1;
                    if (keeps) kept.emplace_back(*message).set("b", 0);  // its turn matters
                    self->send(Message::replyTo(*message));
                }
            });
        return {std::move(connection), std::move(peer)};
    }
    bool isAnswered(Pair& pair, std::string_view request) {
        std::size_t written = 0;
        return stepUntil([&] {
            written += pair.peer->write(request.substr(written));
            return pair.peer->read().has_value();
        });
    }

    static constexpr std::chrono::milliseconds kLittlePatience{30};
    std::shared_ptr<ReplyBudget> replies = std::make_shared<ReplyBudget>(loop, kLittlePatience);
    std::shared_ptr<ReceiveBudget> requests =
        std::make_shared<ReceiveBudget>(loop, kLittlePatience);
    std::shared_ptr<Decoder> decoder = std::make_shared<Decoder>();
    pid_t origins = 0;
    std::size_t served = 0;
    bool keeps = false;
    std::vector<Message> kept;
};

TEST_F(SharedBudgetsTest, WhoDoesNotReadRepliesIsCutOffWhenOthersWait) {
    Dictionary large{{"data", Data(std::string(16u << 20, 'x'))}};
    keepCborEncoded(large);
    Message reply;
    reply.set("shared", large);
    std::vector<Pair> hoarders;
    for (std::size_t i = 0; i < kMaxUnsentTotal / (16u << 20); ++i) {
        hoarders.push_back(connect());
        hoarders.back().connection->send(reply);
    }
    Pair modest = connect();
    EXPECT_TRUE(isAnswered(modest, requestFrame(1)));
    EXPECT_EQ(errorLines("does not read its replies"), 1u);
    for (auto& [connection, peer] : hoarders) connection->abandon();
    modest.connection->abandon();
}

TEST_F(SharedBudgetsTest, UnfinishedRequestsOfAllConnectionsAreBounded) {
    const std::string large = requestFrame(1, {{"b", std::string(kMaxRequestPayload - 64, 'b')}});
    std::vector<Pair> hoarders;
    // All but the last announce a request and send little of it.
    for (std::size_t i = 0; i <= kMaxReceivedTotal / kMaxRequestPayload; ++i) {
        hoarders.push_back(connect());
        hoarders.back().peer->write(std::string_view(large).substr(0, 10'000));
        loop.poll();
    }
    Pair modest = connect();
    for (std::uint64_t serial = 1; serial < 10; ++serial)
        EXPECT_TRUE(isAnswered(modest, requestFrame(serial, {{"b", std::string(60'000, 'b')}})));

    // The last waits, and those who hold it up are cut off, until there is room.
    EXPECT_TRUE(isAnswered(hoarders.back(), std::string_view(large).substr(10'000)));
    EXPECT_GE(errorLines("do not go on"), 1u);
    EXPECT_LT(errorLines("do not go on"), hoarders.size());
    for (auto& [connection, peer] : hoarders) connection->abandon();
    modest.connection->abandon();
}

TEST_F(SharedBudgetsTest, ARequestCountsUntilItIsServedToItsEnd) {
    const std::string large = requestFrame(1, {{"b", std::string(kMaxRequestPayload - 64, 'b')}});
    keeps = true;
    std::vector<Pair> busy;
    for (std::size_t i = 0; i < kMaxReceivedTotal / kMaxRequestPayload; ++i) {
        busy.push_back(connect());
        EXPECT_TRUE(isAnswered(busy.back(), large));
    }
    // Neither the end of its connection nor patience ends a request in service.
    busy.front().connection->abandon();
    Pair next = connect();
    std::size_t written = 0;
    const auto begin = std::chrono::steady_clock::now();
    stepUntil([&] {
        written += next.peer->write(std::string_view(large).substr(written));
        return std::chrono::steady_clock::now() - begin > 3 * kLittlePatience;
    });
    EXPECT_EQ(served, busy.size());
    EXPECT_LT(written, 1u << 20);
    EXPECT_EQ(errorLines(), 0u);
    kept.erase(kept.begin());
    EXPECT_TRUE(isAnswered(next, std::string_view(large).substr(written)));
    for (auto& [connection, peer] : busy) connection->abandon();
    next.connection->abandon();
}

TEST_F(SharedBudgetsTest, AWakeThatWasForAnotherSocketEndsNobody) {
    Pair gone = connect(), next;
    int ends[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
    const UniqueFd watched(ends[0]), written(ends[1]);
    RunLoop::Watch watch(loop, watched.get());
    // While the end of the one is known to the loop already, another takes its place there.
    watch.awaitReadable([&] {
        gone.connection->abandon();
        next = pairOf(++origins);
        next.connection->resume();
    });
    loop.poll();
    ASSERT_EQ(::write(written.get(), "x", 1), 1);
    gone.peer->close();
    loop.poll();
    EXPECT_TRUE(isAnswered(next, requestFrame(1)));
    EXPECT_EQ(errorLines(), 0u);
    next.peer->close();
    EXPECT_TRUE(stepUntil([&] { return next.connection.use_count() == 1; })) << "it still listens";
}

TEST(Pool, OneOriginHasAQuarterAtTheMost) {
    std::optional<Pool> pool(std::in_place, 8);
    const Origin mine = Origin::of(*AuditToken::ofSelf()), other{0, 0, 7}, sandbox{1, 1, 0};
    EXPECT_EQ(mine, (Origin{0, 0, ::getsid(0)}));
    auto first = pool->draw(mine);
    auto second = pool->draw(mine);
    ASSERT_TRUE(first && second);
    EXPECT_FALSE(pool->draw(mine));
    EXPECT_TRUE(pool->draw(other));
    EXPECT_TRUE(pool->draw(sandbox));
    first.reset();
    auto again = pool->draw(mine);
    EXPECT_TRUE(again);
    EXPECT_FALSE(pool->draw(mine));
    pool.reset();
    again.reset();  // outlives what it was drawn from
}

}  // namespace
}  // namespace platform::lum
