#include <sys/epoll.h>

#include <iterator>
#include <utility>

#include "bench/EchoServer.h"
#include "bench/Failure.h"
#include "bench/Figures.h"
#include "bench/Frames.h"
#include "bench/Interrupt.h"
#include "bench/LibraryClient.h"
#include "bench/Measure.h"
#include "bench/Questions.h"
#include "bench/StreamDecode.h"

namespace bench {

namespace {

Plan planFor(const Run& run, int rounds, int block) {
    return {rounds, block, run.quick ? 0.3 : 2.5};
}

/// Fewer rounds for larger replies, which need fewer to settle.
Plan planForMatches(const Run& run, std::size_t matches) {
    if (matches >= 1000) return planFor(run, 200, 5);
    if (matches >= 100) return planFor(run, 1000, 10);
    return planFor(run, 3000, 20);
}

Target ratio(double limit) {
    return {Target::Kind::RatioAtMost, limit};
}

/// A reply that is known to be right, to be echoed.
std::string checkedReply(const World& world, const Question& question) {
    FrameClient client(world.socketPath());
    const std::string reply(client.exchange(question.frame));
    expectAnswered(question, reply);
    return reply;
}

std::string checkedSmallReply(const World& world) {
    FrameClient client(world.socketPath());
    const std::string reply(client.exchange(smallRequest()));
    expectSuccess(reply);
    return reply;
}

Round exchangeRound(const std::string& socketPath, const std::string& request) {
    auto client = std::make_shared<FrameClient>(socketPath);
    return timed([client, request] { client->exchange(request); });
}

/// The new connection's reply goes into a buffer that is there already, as it does on a warm one.
Round connectRound(const std::string& socketPath, const std::string& request) {
    return timed([socketPath, request, buffer = std::vector<char>(64u << 10)]() mutable {
        const platform::UniqueFd socket = connectTo(socketPath);
        sendAll(socket.get(), request);
        receive(socket.get(), buffer);
    });
}

void measureSmall(const Run& run) {
    if (!run.report.wants({"small/p50", "connect+small/p50", "connect+small/connect+echo/p50"}))
        return;
    const std::string socketPath = run.largest().socketPath();
    const std::string request = smallRequest();
    const std::string reply = checkedSmallReply(run.largest());
    const EchoServer server(run.scratch, "small", reply, EchoKind::Blocking);
    const auto warm = medianOfEach(
        planFor(run, 20000, 200),
        {exchangeRound(socketPath, request), exchangeRound(server.socketPath(), request)});
    run.report.add({.key = "small/p50",
                    .title = "small request, warm connection, p50",
                    .value = warm[0],
                    .besideSource = "echo",
                    .beside = warm[1],
                    .now = ratio(4),
                    .goal = ratio(2)});

    const EchoServer other(run.scratch, "connect", reply, EchoKind::Blocking);
    const auto fresh =
        medianOfEach(planFor(run, 5000, 50), {connectRound(socketPath, request),
                                              exchangeRound(server.socketPath(), request),
                                              connectRound(other.socketPath(), request)});
    run.report.add({.key = "connect+small/p50",
                    .title = "connect + small request, p50 (warm echo)",
                    .value = fresh[0],
                    .besideSource = "echo",
                    .beside = fresh[1],
                    .now = ratio(8),
                    .goal = ratio(2.5)});
    run.report.add({.key = "connect+small/connect+echo/p50",
                    .title = "  the same beside connect + echo",
                    .value = fresh[0],
                    .besideSource = "echo",
                    .beside = fresh[2]});
}

/// Replies a second when `clients` connections each ask again as soon as they are answered.
double rateOf(const std::string& socketPath, const std::string& request, std::size_t clients,
              double seconds) {
    std::vector<FrameClient> connections;
    platform::UniqueFd epoll(::epoll_create1(EPOLL_CLOEXEC));
    for (std::size_t i = 0; i < clients; ++i) {
        connections.emplace_back(socketPath);
        epoll_event event{};
        event.events = EPOLLIN;
        event.data.u64 = i;
        ::epoll_ctl(epoll.get(), EPOLL_CTL_ADD, connections[i].socket(), &event);
        connections[i].exchange(request);
    }
    std::vector<char> buffer(64u << 10);
    std::size_t replies = 0;
    const double start = now();
    for (const FrameClient& client : connections) sendAll(client.socket(), request);
    epoll_event events[32];
    while (now() < start + seconds * 1e6) {
        const int count = ::epoll_wait(epoll.get(), events, std::size(events), 60'000);
        if (count <= 0) fail("no reply for any of {} clients", clients);
        for (int i = 0; i < count; ++i) {
            const int socket = connections[events[i].data.u64].socket();
            receive(socket, buffer);
            ++replies;
            sendAll(socket, request);
        }
    }
    const double elapsed = now() - start;
    for (const FrameClient& client : connections) receive(client.socket(), buffer);
    return static_cast<double>(replies) / elapsed * 1e6;
}

void measureRate(const Run& run, std::size_t clients, Target now, Target goal) {
    const std::string key = fmt::format("{}conn/small/rate", clients);
    if (!run.report.wants({key})) return;
    const double seconds = run.quick ? 0.1 : 0.5;
    const std::string request = smallRequest();
    const EchoServer server(run.scratch, "many", checkedSmallReply(run.largest()), EchoKind::Many);
    std::vector<double> zrd, echo;
    for (int i = 0; i < 3; ++i) {
        checkInterrupted();
        zrd.push_back(rateOf(run.largest().socketPath(), request, clients, seconds));
        echo.push_back(rateOf(server.socketPath(), request, clients, seconds));
    }
    run.report.add({.key = key,
                    .title = fmt::format("{} client{}, small requests a second", clients,
                                         clients == 1 ? "" : "s"),
                    .value = median(std::move(zrd)),
                    .unit = "1/s",
                    .besideSource = "echo",
                    .beside = median(std::move(echo)),
                    .now = now,
                    .goal = goal});
}

void measureMatch(const Run& run, std::size_t matches, Target now, Target goal) {
    const std::string key = fmt::format("match-{}/p50", matches);
    const std::string sizeKey = fmt::format("match-{}/reply-bytes", matches);
    if (!run.report.wants({key, sizeKey})) return;
    const Question question = Question::byPoint(matches);
    const std::string reply = checkedReply(run.largest(), question);
    const EchoServer server(run.scratch, "match", reply, EchoKind::Blocking);
    const auto p50 = medianOfEach(planForMatches(run, matches),
                                  {exchangeRound(run.largest().socketPath(), question.frame),
                                   exchangeRound(server.socketPath(), question.frame)});
    run.report.add({.key = key,
                    .title = fmt::format("match of {} by extension point, p50", matches),
                    .value = p50[0],
                    .besideSource = "echo",
                    .beside = p50[1],
                    .now = now,
                    .goal = goal});
    run.report.add({.key = sizeKey,
                    .title = "  its reply",
                    .value = static_cast<double>(reply.size()),
                    .unit = "B"});
}

/// Through the client library, beside an echo of the same bytes and their bare streaming decode.
void measureDecoded(const Run& run, LibraryClient& library, const Question& question,
                    const std::string& name, Target now, Target goal) {
    if (!run.report.wants({name + "+decode/p50"})) return;
    const std::string reply = checkedReply(run.largest(), question);
    const EchoServer server(run.scratch, "decode", reply, EchoKind::Blocking);
    FrameClient echo(server.socketPath());
    const auto p50 = medianOfEach(planForMatches(run, question.answers),
                                  {[&] { return library.matchAndVisit(question); }, timed([&] {
                                       if (streamDecode(echo.exchange(question.frame)) == 0)
                                           fail("an empty reply");
                                   })});
    run.report.add({.key = name + "+decode/p50",
                    .title = name + " through the library, p50",
                    .value = p50[0],
                    .besideSource = "echo",
                    .beside = p50[1],
                    .now = now,
                    .goal = goal});
}

/// The same match in worlds of different sizes, all at once.
void measureSizes(const Run& run) {
    if (!run.report.wants({"match-10/of-", "match-10/10000-against-1000"})) return;
    const Question question = Question::byPoint(10);
    std::vector<Round> rounds;
    for (const World& world : run.worlds) {
        checkedReply(world, question);
        rounds.push_back(exchangeRound(world.socketPath(), question.frame));
    }
    const auto p50 = medianOfEach(planForMatches(run, 10), rounds);
    const Target limit{Target::Kind::ValueAtMost, 1.5};
    for (std::size_t i = 0; i < p50.size(); ++i) {
        const std::size_t size = run.worlds[i].plugIns();
        const Target now{Target::Kind::ValueAtMost, i > 0 ? limit.limit * p50[i - 1] : 0};
        run.report.add({.key = fmt::format("match-10/of-{}/p50", size),
                        .title = fmt::format("match of 10 with {} installed, p50", size),
                        .value = p50[i],
                        .now = i > 0 ? now : Target{}});
    }
    const std::size_t last = p50.size() - 1;
    run.report.add(
        {.key = fmt::format("match-10/{}-against-{}", run.worlds[last].plugIns(),
                            run.worlds[last - 1].plugIns()),
         .title = fmt::format("match of 10, {} against {} installed", run.worlds[last].plugIns(),
                              run.worlds[last - 1].plugIns()),
         .value = p50[last] / p50[last - 1],
         .unit = "x",
         .now = limit,
         .goal = limit});
}

}  // namespace

void measureReplies(const Run& run) {
    std::vector<Child> daemons;
    for (const World& world : run.worlds) {
        daemons.push_back(world.startDaemon());
        waitForSocket(world.socketPath(), daemons.back());
        daemons.back().waitUntilIdle();
    }
    struct Size {
        std::size_t matches;
        double now;
        double goal;
    };
    std::vector<Size> sizes{{10, 8, 2.5}, {100, 5, 2}, {1000, 4, 1.5}};
    while (sizes.back().matches * 10 > run.largest().plugIns()) sizes.pop_back();

    measureSmall(run);
    measureRate(run, 1, {}, {});
    measureRate(run, 16, {Target::Kind::RatioAtLeast, 0.2}, {Target::Kind::RatioAtLeast, 0.5});
    for (const Size& size : sizes) {
        measureMatch(run, size.matches, ratio(size.now), ratio(size.goal));
    }
    LibraryClient library(run.largest());
    for (const Size& size : sizes) {
        measureDecoded(run, library, Question::byPoint(size.matches),
                       fmt::format("match-{}", size.matches), {}, ratio(2));
    }
    measureDecoded(run, library, Question::byRareAttribute(), "match-10-by-rule",
                   {Target::Kind::ValueAtMost, 20e3}, {Target::Kind::ValueAtMost, 1e3});
    measureDecoded(run, library, Question::byOrder(), "match-10-by-rule/order",
                   {Target::Kind::ValueAtMost, 20e3}, {Target::Kind::ValueAtMost, 3e3});
    measureSizes(run);
}

}  // namespace bench
