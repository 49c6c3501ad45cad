#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "Zorvan/Keys.h"
#include "Zorvan/ZRPlugInProcess.h"
#include "Zorvan/ZRSandboxExtension.h"
#include "bench/Failure.h"
#include "bench/Frames.h"
#include "bench/InfoPlist.h"
#include "bench/Questions.h"
#include "bench/soak/Player.h"

namespace bench {

namespace {

namespace fs = std::filesystem;
using platform::Array;
using platform::Dictionary;
using platform::Value;
using zorvan::kProtocolVersion;

constexpr std::size_t kPlugIns = 10;  // of an application

std::string matchIn(const std::string& application) {
    return requestFrame({{"request", "match"},
                         {"version", kProtocolVersion},
                         {"rules", Dictionary{{zorvan::rule::kContainingApp, application}}}});
}

std::vector<platform::Uuid> plugInsOf(FrameClient& client, const std::string& application) {
    auto found = uuidsIn(client.exchange(matchIn(application)));
    if (found.size() != kPlugIns) fail("{} plug-ins instead of {}", found.size(), kPlugIns);
    return found;
}

/// The smallest request there is, over one connection.
Work beSmall(const World& world) {
    auto client = std::make_shared<FrameClient>(world.socketPath());
    return [client, request = smallRequest()] { expectSuccess(client->exchange(request)); };
}

/// Comes, asks for plug-ins, chooses one, and trades a token for its bundle; then goes.
Work ask(const World& world) {
    return [&world] {
        FrameClient client(world.socketPath());
        const auto plugIns = plugInsOf(client, applicationOf(world, kAsked));
        expectSuccess(client.exchange(annotateRequest(plugIns[0])));
        const Dictionary reply = bodyOf(client.exchange(requestFrame(
            {{"request", "access"}, {"version", kProtocolVersion}, {"uuids", Array{plugIns[1]}}})));
        const Value* tokens = reply.find(zorvan::message::kExtensions);
        if (!tokens || !tokens->array() || tokens->array()->size() != 1) fail("no token");
        const auto extension =
            zorvan::ZRSandboxExtension::initWithExtension((*tokens->array())[0].string()->string());
        extension->consume();
        if (extension->handle() == 0) fail("a token is refused");
    };
}

/// Has a plug-in made ready, starts it, and hears what it says.
Work start(const World& world) {
    auto client = std::make_shared<FrameClient>(world.socketPath());
    const std::string path =
        pathsIn(client->exchange(matchIn(applicationOf(world, kStarted)))).at(0);
    const std::string name = fs::path(path).stem();
    return [&world, client, executable = path + "/" + name] {
        const auto plugIns = plugInsOf(*client, applicationOf(world, kStarted));
        expectSuccess(client->exchange(readyRequest(plugIns[0])));
        std::optional<zorvan::ZRError> error;
        const auto plugIn = zorvan::ZRPlugInProcess::start(nullptr, executable, {}, error);
        if (!plugIn) fail("a plug-in is not started: {}", describe(*error));
        char byte;
        if (::read(plugIn->connection(), &byte, 1) != 1) fail("a plug-in has said nothing");
        plugIn->wait();
    };
}

/// Takes its application out of service, and back into it.
Work hold(const World& world) {
    auto client = std::make_shared<FrameClient>(world.socketPath());
    const std::string application = applicationOf(world, kHeld);
    const std::string request = requestFrame({{"request", "lock"},
                                              {"version", kProtocolVersion},
                                              {"paths", Array{application}},
                                              {"flags", zorvan::ZRHoldApplications}});
    return [client, application, request] {
        plugInsOf(*client, application);
        const Dictionary reply = bodyOf(client->exchange(request));
        const Value* tokens = reply.find(zorvan::message::kUuids);
        if (!tokens) fail("no token of a hold");
        if (!uuidsIn(client->exchange(matchIn(application))).empty()) fail("what is held is found");
        expectSuccess(client->exchange(requestFrame(
            {{"request", "lock"}, {"version", kProtocolVersion}, {"uuids", Array{*tokens}}})));
    };
}

/// Changes an application, takes it away and brings it back: no client, but work for the daemon.
Work come(const World& world) {
    const std::string application = applicationOf(world, kComing);
    const std::string away = world.runtimeDirectory() + "/away.app";
    return [application, away, changes = std::size_t{0}]() mutable {
        std::ofstream(application + "/Info.plist") << applicationInfo(++changes);
        fs::rename(application, away);
        fs::rename(away, application);
    };
}

}  // namespace

const std::vector<Part>& honestParts() {
    static const std::vector<Part> parts{{"small requests", true, 1, beSmall},
                                         {"asks and leaves", true, 10, ask},
                                         {"starts plug-ins", true, 100, start},
                                         {"holds", true, 20, hold},
                                         {"comes and goes", true, 200, come}};
    return parts;
}

}  // namespace bench
