// Requests of one client after another, as they come out of their frames. Each gets one reply.
// Covers: zrd/Transaction.cpp zrd/MatchRequest.cpp zrd/AnnotationRequests.cpp zrd/LockRequest.cpp
// Covers: zrd/ReadyAccessRequests.cpp zrd/RegistrationRequests.cpp zrd/MatchResult.cpp
// Covers: zrd/CandidateGates.cpp zrd/RequestPaths.cpp

#include <future>

#include "fuzz/Support.h"
#include "platform/lum/Frame.h"
#include "platform/lum/PeerLooks.h"
#include "tests/zrd/Fakes.h"
#include "zrd/ZRDLumClient.h"
#include "zrd/ZRDServer.h"

using namespace platform;
using zorvan::ZRDServer;

namespace {

struct World {
    World() {
        services.directories = fuzz::directories();
        services.mainLoop = std::make_shared<RunLoop>();
        services.looks = services.pathLooks =
            std::make_shared<platform::PeerLooks>(*services.mainLoop);
        services.bundleLooks = std::make_shared<platform::PlaceLooks>(*services.mainLoop);
        services.workspace = workspace;
        services.codeSigning = codeSigning;
        services.sandbox = std::make_shared<zorvan::FakeSandbox>();
        services.launcher = std::make_shared<zorvan::FakeLauncher>();
        services.assertions = std::make_shared<zorvan::FakeAssertions>();
        services.notifications = std::make_shared<zorvan::FakeNotifications>();
        services.types = std::make_shared<zorvan::FakeTypes>();
        const Dictionary plugIn{{"VXExtensionProtocol", "P"}, {"PrincipalClass", "C"}};
        for (const char* identifier : {"com.a", "com.b"}) {
            const auto proxy = zorvan::makeProxy(identifier, {}, plugIn);
            // So that an input can name them.
            proxy->plugInUuid =
                *Uuid::parse(std::string("00000000-0000-0000-0000-00000000000") + identifier[4]);
            proxy->bundlePath = fuzz::home().makeDirectory(identifier);
            proxy->containingApplication = zorvan::makeApplication(fuzz::home().path());
            workspace->installed.push_back(proxy);
        }
        codeSigning->entitlements.set("com.orbel.private.zorvan.manager", true);
        std::filesystem::current_path(fuzz::home().path());
        server = ZRDServer::initForService("zrd", std::nullopt, services);
        server->setCacheLimit(100);
    }
    void drain() const {
        std::promise<void> reached;
        server->submitWork([&] { reached.set_value(); });
        reached.get_future().wait();
    }

    void awaitAnswer(zorvan::FakeConnection& connection) const {
        for (drain(); !connection.isAnswered.exchange(false); drain())
            services.mainLoop->runOnce(std::chrono::milliseconds(1));
    }

    std::shared_ptr<zorvan::FakeWorkspace> workspace = std::make_shared<zorvan::FakeWorkspace>();
    std::shared_ptr<zorvan::FakeCodeSigning> codeSigning =
        std::make_shared<zorvan::FakeCodeSigning>();
    Services services;
    std::shared_ptr<ZRDServer> server;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const World world;
    const auto connection = std::make_shared<zorvan::FakeConnection>();
    zorvan::ZRDLumClient::initWithConnection(
        connection, world.server,
        zorvan::HostExecutable::of(connection->token, *world.codeSigning));
    std::size_t requests = 0;
    for (const std::string_view part : fuzz::parts(fuzz::text(data, size), 4)) {
        const auto payload = std::make_shared<const std::string>(part);
        const auto decoded = lum::decodePayload(payload, lum::FrameKind::Request);
        const auto* message = std::get_if<Message>(&decoded);
        if (!message) continue;
        ++requests;
        connection->deliver(*message);
        world.awaitAnswer(*connection);
    }
    world.drain();
    fuzz::require(connection->sent.size() == requests);
    for (const Message& reply : connection->sent)
        fuzz::require(bool(lum::encodeFrame(lum::FrameKind::Reply, reply, 1u << 24)));
    connection->deliver(ConnectionError{ConnectionError::Kind::Invalid, "closed"});
    world.drain();
    return 0;
}
