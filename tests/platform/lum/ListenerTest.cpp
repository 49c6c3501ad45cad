#include "platform/lum/Listener.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <algorithm>
#include <ctime>
#include <fstream>
#include <memory>

#include "platform/lum/PeerConnection.h"
#include "tests/platform/lum/LumFixture.h"

namespace platform::lum {
namespace {

using ::testing::ElementsAre;
using Kind = ConnectionError::Kind;

/// A listener whose connections write down their events and keep their requests until told to
/// answer them.
class ListenerTest : public LumTest {
  protected:
    void open() {
        auto made = Listener::make(directories, "test", queue);
        ASSERT_TRUE(made) << made.error().text;
        listener = std::move(*made);
        listener->setEventHandler([this](std::shared_ptr<Connection> connection) {
            accepted += 1;
            auto context = std::make_shared<int>();
            contexts.push_back(context);
            connection->setContext(context);
            // Handlers may hold the context, and what they hold may not leak.
            connection->setEventHandler(
                [this, context, weak = std::weak_ptr(connection)](const ConnectionEvent& event) {
                    handle(weak.lock(), event);
                });
            connection->resume();
        });
    }
    void openAndResume() {
        open();
        listener->resume();
    }

    void handle(const std::shared_ptr<Connection>& connection, const ConnectionEvent& event) {
        if (auto* message = std::get_if<Message>(&event)) {
            events.push_back("message " + std::to_string(message->serial()));
            if (replySize > 0) {
                answer(connection, *message);
            } else {
                kept.emplace_back(connection, *message);
            }
        } else if (auto* error = std::get_if<ConnectionError>(&event)) {
            events.push_back(error->kind == Kind::Invalid               ? "invalid"
                             : error->kind == Kind::TerminationImminent ? "imminent"
                                                                        : "interrupted");
        } else {
            events.push_back("unknown " + describe(std::get<UnknownObject>(event)));
        }
    }
    /// On another thread, as the daemon does.
    void answer(const std::shared_ptr<Connection>& connection, Message request) {
        service.async([this, connection, request = std::move(request), size = replySize] {
            Message reply = Message::replyTo(request);
            reply.set("data", Data(std::string(size, 'x')));
            connection->send(reply);
            answered += 1;
        });
    }
    void answerKept() {
        for (auto& [connection, request] : kept) answer(connection, std::move(request));
        kept.clear();
    }
    std::optional<Message> ask(RawPeer& peer, std::uint64_t serial) {
        peer.write(requestFrame(serial));
        std::optional<Message> reply;
        stepUntil([&] { return reply || (reply = peer.read()); });
        return reply;
    }

    std::size_t replySize = 0;  // 0: keep the requests
    std::size_t accepted = 0;
    std::atomic<std::size_t> answered = 0;
    std::vector<std::string> events;
    std::vector<std::weak_ptr<int>> contexts;
    std::vector<std::pair<std::shared_ptr<Connection>, Message>> kept;
    std::unique_ptr<Listener> listener;
    SerialQueue service{"service"};
};

TEST_F(ListenerTest, OwnsItsNamePrivately) {
    const mode_t before = umask(0);
    open();
    umask(before);
    struct stat status {};
    ASSERT_EQ(stat(path().c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777, 0600u);
    for (auto directory : {"/zorvan", "/zorvan/services"}) {
        ASSERT_EQ(stat((directories.runtime + directory).c_str(), &status), 0);
        EXPECT_EQ(status.st_mode & 07777, 0700u);
    }
    auto second = Listener::make(directories, "test", queue);
    ASSERT_FALSE(second);
    EXPECT_EQ(second.error().code, EADDRINUSE);
    EXPECT_TRUE(Listener::make(directories, "other", queue));

    // The first goes on undisturbed.
    replySize = 1;
    RawPeer early(path());
    loop.poll();
    EXPECT_EQ(accepted, 0u) << "nothing is accepted before resume";
    listener->resume();
    EXPECT_TRUE(ask(early, 1));

    listener.reset();
    EXPECT_FALSE(std::filesystem::exists(path()));
    open();
}

TEST_F(ListenerTest, ReplacesOnlyStaleSockets) {
    { open(); }
    listener.reset();
    UniqueFd stale = unixSocket(path(), ::bind);
    ASSERT_TRUE(stale);
    replySize = 1;
    openAndResume();
    RawPeer peer(path());
    EXPECT_TRUE(ask(peer, 1));
    listener.reset();

    std::ofstream(path()) << "somebody's file";
    EXPECT_FALSE(Listener::make(directories, "test", queue));
    EXPECT_TRUE(std::filesystem::exists(path()));

    std::filesystem::rename(directories.runtime + "/zorvan/services", directories.runtime + "/x");
    std::filesystem::create_directory_symlink("../x", directories.runtime + "/zorvan/services");
    EXPECT_FALSE(Listener::make(directories, "other", queue));
}

TEST_F(ListenerTest, RefusesNamesThatAreNoSocketNames) {
    for (const std::string& name : {std::string(), std::string("a/b"), std::string(".hidden"),
                                    std::string("a\0b", 3), std::string(108, 'n')})
        EXPECT_FALSE(Listener::make(directories, name, queue)) << name;
}

using PassedSocketTest = LumTest;  // without another thread, for the fork

TEST_F(PassedSocketTest, IsTakenOver) {
    UniqueFd byName = unixSocket(directories.runtime + "/by-name", ::bind);
    ASSERT_EQ(listen(byName.get(), 5), 0);
    // In a process of its own: passed descriptors have fixed numbers.
    EXPECT_EXIT(
        {
            dup2(byName.get(), 3);
            dup2(unixSocket(directories.runtime + "/another", ::bind).release(), 4);
            setenv("LISTEN_PID", std::to_string(getpid()).c_str(), 1);
            setenv("LISTEN_FDS", "2", 1);
            setenv("LISTEN_FDNAMES", "test:another", 1);
            RunLoop ownLoop;
            SerialQueue ownQueue("lum", ownLoop);
            int clients = 0;
            const auto beside = Listener::make(directories, "test.beside", ownQueue);
            auto taken = Listener::make(directories, "test", ownQueue);
            if (!taken || Listener::make(directories, "test", ownQueue)) _exit(1);
            (*taken)->setEventHandler([&](std::shared_ptr<Connection>) { clients += 1; });
            (*taken)->resume();
            RawPeer peer(directories.runtime + "/by-name");
            while (clients == 0) ownLoop.runOnce(std::chrono::milliseconds(100));
            if (getenv("LISTEN_FDS") || std::filesystem::exists(path())) _exit(2);
            // However often accepting fails, here on what is no socket, one line says so.
            RawPeer waiting(directories.runtime + "/by-name");
            dup2(UniqueFd(open("/dev/null", O_RDONLY)).get(), 3);
            for (int tries = 0; tries < 4;) tries += ownLoop.runOnce(std::chrono::seconds(1));
            _exit(errorLines("cannot accept") == 1 ? 0 : 3);
        },
        ::testing::ExitedWithCode(0), "");
}

TEST_F(ListenerTest, LetsNoOtherUserIn) {
    if (geteuid() != 0) GTEST_SKIP() << "only root can be somebody else";
    openAndResume();
    std::filesystem::permissions(directories.runtime, std::filesystem::perms::all);
    std::filesystem::permissions(directories.zorvanRuntime(), std::filesystem::perms::all);
    std::filesystem::permissions(directories.zorvanRuntime() + "/services",
                                 std::filesystem::perms::all);
    std::filesystem::permissions(path(), std::filesystem::perms::all);
    const pid_t child = fork();
    if (child == 0) {
        char byte;
        if (setuid(65534) != 0) _exit(1);
        RawPeer peer(path());
        _exit(peer.fd() >= 0 && ::recv(peer.fd(), &byte, 1, 0) == 0 ? 0 : 2);
    }
    int status = -1;
    EXPECT_TRUE(stepUntil([&] { return waitpid(child, &status, WNOHANG) == child; }));
    EXPECT_EQ(status, 0);
    EXPECT_EQ(accepted, 0u);
    EXPECT_EQ(errorLines("is not let in"), 1u);
}

TEST_F(ListenerTest, AMalformedFrameEndsItsConnectionAlone) {
    replySize = 1;
    openAndResume();
    RawPeer bystander(path());
    ASSERT_TRUE(ask(bystander, 1));
    const std::string head("\x00\x00\x00", 3);
    struct Case {
        std::string bytes;
        const char* reason;
        bool closes;
    };
    const std::string deep(130, '\x81');
    for (const auto& [bytes, reason, closes] : {
             Case{std::string("\x01\x00\x00\x01", 4), "over the limit", false},
             Case{"GET / HTTP/1.0\r\n\r\n", "over the limit", false},
             Case{head + std::string("\x00", 1), "", false},
             Case{head + "\x04" + std::string("\x83\x00\x01\xf6", 4), "", false},
             Case{head + "\x0a" + std::string("\x83\x00\x01\xa2\x61k\x01\x61k\x02", 10), "", false},
             Case{head + "\x07" + std::string("\x83\x00\x01\xa1\x61\xff\x01", 7), "", false},
             Case{head + "\x84\x83" + std::string("\0\1", 2) + deep.substr(1) + "\xa0", "", false},
             Case{requestFrame(1).substr(0, 6), "middle of a frame", true},
             Case{head, "middle of a frame", true},
         }) {
        const std::size_t lines = errorLines(), before = accepted;
        events.clear();
        RawPeer peer(path());
        peer.write(bytes);
        EXPECT_TRUE(stepUntil([&] { return accepted > before; }));
        if (closes) peer.close();
        EXPECT_TRUE(stepUntil([&] { return events.size() == 1; })) << reason;
        EXPECT_THAT(events, ElementsAre("invalid"));
        EXPECT_EQ(errorLines(), lines + 1);
        EXPECT_GE(errorLines(reason), 1u) << reason;
        EXPECT_TRUE(closes || peer.hasEnded());
    }
    events.clear();
    RawPeer peer(path());
    ASSERT_EQ(::send(peer.fd(), "!", 1, MSG_OOB), 1);
    EXPECT_TRUE(stepUntil([&] { return events.size() == 1; }));
    EXPECT_EQ(errorLines("out-of-band data"), 1u);
    EXPECT_TRUE(ask(bystander, 2));
}

TEST_F(ListenerTest, AWakeForNothingCutsNobodyOff) {
    int ends[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends), 0);
    RawPeer peer{UniqueFd(ends[1])};
    Pool pool(4);
    const PeerConnection::Common common{std::make_shared<ReplyBudget>(loop),
                                        std::make_shared<ReceiveBudget>(loop),
                                        std::make_shared<Decoder>()};
    const AuditToken self = *AuditToken::ofSelf();
    const auto connection = std::make_shared<PeerConnection>(
        UniqueFd(ends[0]), self, *pool.draw(Origin::of(self)), queue, common);
    connection->setEventHandler([&](const ConnectionEvent& event) { handle(connection, event); });
    connection->resume();
    while (loop.poll() > 0) continue;
    // The loop has been woken when somebody takes what woke it.
    ASSERT_EQ(::send(peer.fd(), "!", 1, MSG_OOB), 1);
    char byte = 0;
    loop.post([&] { EXPECT_EQ(::recv(ends[0], &byte, 1, MSG_OOB), 1); });
    while (loop.poll() > 0) continue;
    EXPECT_EQ(byte, '!');
    peer.write(requestFrame(1));
    EXPECT_TRUE(stepUntil([&] { return !events.empty(); }));
    EXPECT_THAT(events, ElementsAre("message 1"));
    ASSERT_EQ(::send(peer.fd(), "!", 1, MSG_OOB | MSG_NOSIGNAL), 1);
    EXPECT_TRUE(stepUntil([&] { return events.size() == 2; })) << "it is awaited again";
    EXPECT_EQ(errorLines("out-of-band data"), 1u);
}

TEST_F(ListenerTest, UnknownObjectsAreEventsAndNothingMore) {
    replySize = 1;
    openAndResume();
    RawPeer peer(path());
    peer.write(encodeFrame(FrameKind::Reply, Message(), 100)->string());
    EXPECT_TRUE(ask(peer, 7));
    ASSERT_EQ(events.size(), 2u);
    EXPECT_TRUE(events[0].starts_with("unknown ")) << events[0];
    EXPECT_EQ(events[1], "message 7");
    EXPECT_EQ(errorLines(), 0u);
}

TEST_F(ListenerTest, DeliversOneRequestAtATimeAndAnswersInOrder) {
    openAndResume();
    RawPeer peer(path());
    std::string requests;
    constexpr std::uint64_t kCount = 3000;  // more than wait cut, in less than one read
    for (std::uint64_t serial = 1; serial <= kCount; ++serial) requests += requestFrame(serial);
    ASSERT_EQ(peer.write(requests), requests.size());
    ASSERT_TRUE(stepUntil([&] { return !events.empty(); }));
    loop.poll();
    EXPECT_THAT(events, ElementsAre("message 1"));

    replySize = 1;
    answerKept();
    std::vector<std::uint64_t> serials;
    EXPECT_TRUE(stepUntil([&] {
        while (auto reply = peer.read()) serials.push_back(reply->serial());
        return serials.size() == kCount;
    }));
    EXPECT_TRUE(std::is_sorted(serials.begin(), serials.end()));
    EXPECT_EQ(events.size(), kCount);
}

/// How long a thread works at something, whatever else the machine does.
template <class Work>
double cpuSeconds(Work work) {
    const auto now = [] {
        timespec time{};
        clock_gettime(CLOCK_THREAD_CPUTIME_ID, &time);
        return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) * 1e-9;
    };
    const double begin = now();
    work();
    return now() - begin;
}

TEST_F(ListenerTest, LargeRequestsAreDecodedAndFreedElsewhereAndKeepTheirOrder) {
    replySize = 1;
    openAndResume();
    const std::string large =
        requestFrame(1, {{"b", Array(std::vector<Value>(kMaxRequestValues - 5, "text"))}});
    const double decoding = cpuSeconds([&] {
        decodePayload(std::make_shared<const std::string>(large.substr(4)), FrameKind::Request);
    });
    std::string broken = large;
    broken.back() = '\xff';
    RawPeer peer(path()), breaker(path());
    const std::string requests = large + requestFrame(2) + large + requestFrame(4);
    std::size_t written = 0, writtenBroken = 0;
    double longest = 0;
    const auto begin = std::chrono::steady_clock::now();
    while (events.size() < 6 &&
           std::chrono::steady_clock::now() - begin < std::chrono::seconds(20)) {
        written += peer.write(std::string_view(requests).substr(written));
        if (written == requests.size()) peer.halfClose();
        writtenBroken += breaker.write(std::string_view(broken).substr(writtenBroken));
        longest = std::max(longest, cpuSeconds([&] { loop.runOnce(std::chrono::seconds(1)); }));
        peer.read();
    }
    std::erase(events, "invalid");
    EXPECT_THAT(events,
                ElementsAre("message 1", "message 2", "message 1", "message 4", "imminent"));
    EXPECT_EQ(errorLines("not UTF-8"), 1u);
    EXPECT_LT(longest, decoding / 3);
    {
        RawPeer gone(path());
        for (std::size_t sent = 0; sent < broken.size(); loop.runOnce(std::chrono::milliseconds(1)))
            sent += gone.write(std::string_view(broken).substr(sent));
    }
    EXPECT_TRUE(stepUntil([&] { return errorLines("not UTF-8") == 2; })) << "who does not stay";
}

TEST_F(ListenerTest, AHalfClosedPeerStillGetsItsReplies) {
    openAndResume();
    RawPeer peer(path());
    peer.write(requestFrame(1) + requestFrame(2));
    peer.halfClose();
    ASSERT_TRUE(stepUntil([&] { return kept.size() == 1; }));
    loop.poll();
    EXPECT_THAT(events, ElementsAre("message 1")) << "the end never overtakes a message";
    replySize = 1;
    answerKept();
    std::size_t replies = 0;
    EXPECT_TRUE(stepUntil([&] { return (replies += peer.read() ? 1 : 0) == 2; }));
    EXPECT_TRUE(stepUntil([&] { return events.size() == 3; }));
    peer.close();
    EXPECT_TRUE(stepUntil([&] { return events.size() == 4; }));
    EXPECT_THAT(events, ElementsAre("message 1", "message 2", "imminent", "invalid"));
    EXPECT_TRUE(stepUntil([&] { return contexts[0].expired(); }));
}

TEST_F(ListenerTest, ADeadPeersWaitingRequestsAreDropped) {
    openAndResume();
    RawPeer peer(path());
    // More than are read: the hang-up is noticed all the same.
    std::string requests;
    for (std::uint64_t serial = 1; serial <= 80; ++serial) requests += requestFrame(serial);
    peer.write(requests);
    ASSERT_TRUE(stepUntil([&] { return kept.size() == 1; }));
    peer.close();
    ASSERT_TRUE(stepUntil([&] { return events.size() == 2; }));
    EXPECT_FALSE(contexts[0].expired()) << "somebody still has the connection";
    replySize = 1;
    answerKept();
    EXPECT_TRUE(stepUntil([&] { return contexts[0].expired(); }));
    EXPECT_THAT(events, ElementsAre("message 1", "invalid"));
    EXPECT_EQ(errorLines(), 0u);
}

/// It would take longer to find out who it was than to come again.
TEST_F(ListenerTest, APeerThatGoesBeforeItIsLetInTakesNoTime) {
    openAndResume();
    replySize = 1;
    for (int i = 0; i < 100; ++i) RawPeer(path()).write(requestFrame(1));
    RawPeer peer(path());
    EXPECT_TRUE(ask(peer, 2));
    EXPECT_EQ(accepted, 1);
}

TEST_F(ListenerTest, WhoNeverReadsIsNotServedOnAndHoldsUpNobody) {
    replySize = 1 << 20;
    openAndResume();
    RawPeer greedy(path());
    std::size_t written = 0;
    std::string requests;
    for (std::uint64_t serial = 1; serial <= 100; ++serial)
        requests += requestFrame(serial, {{"ballast", std::string(500'000, 'b')}});
    // Until its requests wait in the connection and, behind that, in the socket.
    std::size_t idle = 0;
    EXPECT_TRUE(stepUntil([&] {
        const std::size_t count = greedy.write(std::string_view(requests).substr(written));
        written += count;
        idle = count == 0 && loop.poll() == 0 && answered == events.size() ? idle + 1 : 0;
        return idle > 10;
    }));
    EXPECT_LT(written, requests.size() * 3 / 4);
    EXPECT_GE(events.size(), 8u);
    EXPECT_LE(events.size(), 11u);

    const std::size_t before = events.size();
    RawPeer other(path());
    for (std::uint64_t serial = 1; serial <= 20; ++serial) EXPECT_TRUE(ask(other, serial));
    EXPECT_EQ(events.size(), before + 20);

    // Once it reads, everything goes on, in order.
    std::vector<std::uint64_t> serials;
    EXPECT_TRUE(stepUntil([&] {
        while (auto reply = greedy.read()) serials.push_back(reply->serial());
        written += greedy.write(std::string_view(requests).substr(written));
        return serials.size() == 100;
    }));
    EXPECT_TRUE(std::is_sorted(serials.begin(), serials.end()));
}

TEST_F(ListenerTest, ServesBesideTwoHundredIdleClients) {
    replySize = 1;
    openAndResume();
    std::vector<UniqueFd> idle;
    for (int i = 0; i < 200; ++i) idle.push_back(unixSocket(path(), ::connect));
    RawPeer peer(path());
    EXPECT_TRUE(ask(peer, 1));
    EXPECT_EQ(accepted, 201u);
    idle.clear();
    EXPECT_TRUE(stepUntil([&] { return events.size() == 201; }));
}

TEST_F(ListenerTest, ClosesItsConnectionsWhereverItEnds) {
    for (const bool onQueue : {true, false}) {
        contexts.clear();
        events.clear();
        openAndResume();
        RawPeer busy(path()), idle(path());
        busy.write(requestFrame(1));
        ASSERT_TRUE(stepUntil([&] { return contexts.size() == 2 && !events.empty(); }));
        kept.clear();
        if (onQueue) {
            queue.async([&] { listener.reset(); });
            loop.poll();
            EXPECT_THAT(events, ElementsAre("message 1", "invalid", "invalid"));
        } else {
            listener.reset();
            EXPECT_THAT(events, ElementsAre("message 1")) << "nobody is on the queue";
        }
        for (const auto& context : contexts) EXPECT_TRUE(context.expired());
        EXPECT_TRUE(busy.hasEnded() && idle.hasEnded());
    }
}

TEST_F(ListenerTest, WaitsForDescriptors) {
    replySize = 1;
    openAndResume();
    loop.poll();
    std::vector<std::unique_ptr<RawPeer>> peers;
    for (int i = 0; i < 3; ++i) peers.push_back(std::make_unique<RawPeer>(path()));
    // Room for the reserve alone but one descriptor, then for one client more.
    rlimit before{};
    getrlimit(RLIMIT_NOFILE, &before);
    UniqueFd next(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    const auto lowest = static_cast<rlim_t>(next.get());
    next.reset();
    for (rlim_t room : {kReservedDescriptors - 1, kReservedDescriptors + 2}) {
        rlimit low{lowest + room, before.rlim_max};
        setrlimit(RLIMIT_NOFILE, &low);
        loop.runOnce(std::chrono::milliseconds(1000));
        loop.runOnce(std::chrono::milliseconds(1000));
    }
    EXPECT_EQ(accepted, 1u);
    setrlimit(RLIMIT_NOFILE, &before);
    for (auto& peer : peers) EXPECT_TRUE(ask(*peer, 1));
    EXPECT_EQ(accepted, 3u);
    EXPECT_EQ(errorLines("cannot accept"), 1u);
    EXPECT_EQ(errorLines(), 1u);
}

}  // namespace
}  // namespace platform::lum
