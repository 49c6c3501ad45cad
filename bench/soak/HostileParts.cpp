#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <list>
#include <random>

#include "Zorvan/Keys.h"
#include "bench/Failure.h"
#include "bench/Frames.h"
#include "bench/Questions.h"
#include "bench/soak/Player.h"

namespace bench {

namespace {

using platform::Array;
using platform::Dictionary;
using platform::UniqueFd;
using zorvan::kProtocolVersion;

void sendSome(int socket, std::string_view bytes) {
    (void)!::send(socket, bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
}

/// Sends what is nearly a request, a different one each time, to a service of the daemon.
Work garble(const std::string& socketPath, std::string request) {
    return [socketPath, request, random = std::minstd_rand(1)]() mutable {
        const auto socket = tryConnect(socketPath);
        if (!socket) return;
        std::string garbled = request;
        for (int i = 0; i < 3; ++i)
            garbled[random() % garbled.size()] = static_cast<char>(random());
        sendSome(socket->get(), request + garbled);
        ::shutdown(socket->get(), SHUT_WR);
    };
}

/// Takes every connection that it can get, and keeps them all.
Work occupy(const World& world) {
    auto taken = std::make_shared<std::list<UniqueFd>>();
    return [&world, taken] {
        constexpr std::size_t kMost = 800;
        if (taken->size() >= kMost) taken->clear();
        if (auto socket = tryConnect(world.socketPath())) taken->push_back(std::move(*socket));
    };
}

/// Asks for more than it will ever read.
Work overask(const World& world) {
    const std::string request = Question::ofAll(0).frame;
    std::string requests;
    for (int i = 0; i < 60; ++i) requests += request;
    auto socket = std::make_shared<std::optional<UniqueFd>>();
    return [&world, requests, socket, rounds = 0]() mutable {
        if (++rounds % 100 == 1) *socket = tryConnect(world.socketPath());
        if (*socket) sendSome((*socket)->get(), requests);
    };
}

/// Announces the largest request, and sends it byte by byte.
Work dawdle(const World& world) {
    auto sockets = std::make_shared<std::list<UniqueFd>>();
    return [&world, sockets] {
        constexpr std::size_t kMost = 20;
        if (sockets->size() >= kMost) sockets->pop_front();
        if (auto socket = tryConnect(world.socketPath())) {
            sendSome(socket->get(), std::string_view("\x01\x00\x00\x00", 4));
            sockets->push_back(std::move(*socket));
        }
        for (const UniqueFd& socket : *sockets) sendSome(socket.get(), "\x83");
    };
}

/// The most rules that a request may have, each of which nearly fits everything.
Work demand(const World& world) {
    Array patterns;
    for (int i = 0; i < 1000; ++i) patterns.append("=org.example.point-" + std::to_string(i));
    const Dictionary rules{{zorvan::key::kShortVersion, patterns},
                           {zorvan::key::kBundleIdentifier, patterns},
                           {zorvan::key::kExtensionVersion, patterns}};
    const std::string request =
        requestFrame({{"request", "match"}, {"version", kProtocolVersion}, {"rules", rules}});
    auto client = std::make_shared<FrameClient>(world.socketPath());
    return [client, request] { client->exchange(request); };
}

/// Makes a large request of small values.
Work enlarge(const World& world) {
    Array values;
    for (int i = 0; i < 100'000; ++i) values.append(i);
    const std::string request = requestFrame({{"request", "match"},
                                              {"version", kProtocolVersion},
                                              {"rules", Dictionary{{"a", values}}}});
    auto client = std::make_shared<FrameClient>(world.socketPath());
    return [client, request] { client->exchange(request); };
}

/// Holds somebody's plug-ins, many times, and leaves without giving them back.
Work seize(const World& world) {
    const std::string request = requestFrame({{"request", "lock"},
                                              {"version", kProtocolVersion},
                                              {"paths", Array{applicationOf(world, kAttacked)}},
                                              {"flags", zorvan::ZRHoldApplications}});
    return [&world, request] {
        FrameClient client(world.socketPath());
        for (int i = 0; i < 20; ++i) client.exchange(request);
    };
}

/// Stores as much with somebody's plug-ins as it may.
Work hoard(const World& world) {
    FrameClient client(world.socketPath());
    const std::string found(client.exchange(requestFrame(
        {{"request", "match"},
         {"version", kProtocolVersion},
         {"rules", Dictionary{{zorvan::rule::kContainingApp, applicationOf(world, kAttacked)}}}})));
    const Dictionary annotations{{"extension", Dictionary{{"hoard", std::string(100'000, 'x')}}}};
    Array plugIns;
    for (const auto& uuid : uuidsIn(found)) plugIns.append(uuid);
    // Somebody holds them. What is stored has to be there before memory is looked at first.
    if (plugIns.empty()) fail("nothing to store anything with");
    const std::string request = requestFrame({{"request", "annotate"},
                                              {"version", kProtocolVersion},
                                              {"uuids", plugIns},
                                              {"annotations", annotations}});
    return [&world, request] { FrameClient(world.socketPath()).exchange(request); };
}

}  // namespace

const std::vector<Part>& hostileParts() {
    static const std::vector<Part> parts{
        {"garbles requests", false, 2,
         [](const World& world) { return garble(world.socketPath(), smallRequest()); }},
        {"garbles starts", false, 2,
         [](const World& world) {
             return garble(world.socketPath() + ".spawnerd",
                           requestFrame({{"request", "start"}, {"executable", "/bin/sh"}}));
         }},
        {"garbles tokens", false, 2,
         [](const World& world) {
             return garble(world.socketPath() + ".sandbox", "7a7264.2f.1.1.00.00\n");
         }},
        {"occupies", false, 1, occupy},
        {"asks and reads not", false, 10, overask},
        {"dawdles", false, 50, dawdle},
        {"demands", false, 5, demand},
        {"sends much", false, 50, enlarge},
        {"seizes", false, 20, seize},
        {"hoards", false, 500, hoard}};
    return parts;
}

}  // namespace bench
