// Requests of one client after another, as they come out of their frames. Each gets one reply. A
// part of an input that begins with "$" says how the world is from then on, by letters: see
// `World::set`; the user's preferences may follow after a space. One that begins with "-" is a
// request of a client that goes at once. Paths that begin with "@" lie where the plug-ins are.
// Covers: zrd/Transaction.cpp zrd/MatchRequest.cpp zrd/AnnotationRequests.cpp zrd/LockRequest.cpp
// Covers: zrd/ReadyAccessRequests.cpp zrd/RegistrationRequests.cpp zrd/MatchResult.cpp
// Covers: zrd/CandidateGates.cpp zrd/RequestPaths.cpp zrd/ZRDatabaseDiscovery.cpp
// Covers: zrd/HostRestriction.cpp

#include <fmt/format.h>

#include <future>

#include "Zorvan/Keys.h"
#include "fuzz/Support.h"
#include "platform/lum/Frame.h"
#include "platform/lum/PeerLooks.h"
#include "platform/services/Assertions.h"
#include "platform/services/Preferences.h"
#include "tests/zrd/Fakes.h"
#include "zrd/ZRDLumClient.h"
#include "zrd/ZRDServer.h"

using namespace platform;
using zorvan::ZRDServer;

namespace {

constexpr const char* kInfo =
    "<plist><dict><key>QFBundleIdentifier</key><string>com.a</string>"
    "<key>QFBundleExecutable</key><string>run</string></dict></plist>";

struct World {
    World() {
        services.directories = fuzz::directories();
        services.mainLoop = std::make_shared<RunLoop>();
        services.looks = services.pathLooks =
            std::make_shared<platform::PeerLooks>(*services.mainLoop);
        services.bundleLooks = std::make_shared<platform::PlaceLooks>(*services.mainLoop);
        services.workspace = workspace;
        services.codeSigning = codeSigning;
        services.sandbox = sandbox;
        services.launcher = launcher;
        services.assertions = assertions;
        services.notifications = notifications;
        services.types = std::make_shared<zorvan::FakeTypes>();
        install();
        assertions->reports.emplace("com.b", Dictionary());
        server = ZRDServer::initForService("zrd", std::nullopt, services);
        server->setCacheLimit(100);
        set("$");
    }

    /// "a" to "q" are plug-ins of many kinds; an input can name them. So many share resources that
    /// a match does not give them all their tokens at once.
    void install() const {
        const Dictionary plain{{"VXExtensionProtocol", "P"}, {"PrincipalClass", "C"}};
        const auto with = [&](const char* key, const Value& value) {
            Dictionary all = plain;
            all.set(key, value);
            return all;
        };
        add("com.a", "a", {}, plain);
        add("com.b", "b", {}, plain)->infoPlist = Dictionary{
            {"VXExtension", with("VXExtensionAttributes", Dictionary{{"VXExtensionVersion", "1"}})},
            {"QFBundleIdentifier", "com.b"}};
        add("com.a", "c", {{"VXExtensionVersion", "2"}}, plain);
        add("com.a", "d", {{"VXExtensionVersion", "2"}}, plain)->registrationDate = {5};
        add("com.a", "e", {{"VXExtensionVersion", 2}}, plain)->onSystemPartition = true;
        add("com.f", "f", {}, with("Dedicated", true));
        add("com.g", "g", {}, with("VXExtensionProtocol", "#Data"));
        add("com.h", "h", {}, with("VXExtensionHostEntitlement", "host"));
        add("com.i", "i", {}, plain)->entitlements =
            Dictionary{{"com.orbel.developer.replace-plugin", "com.b"}};
        add("com.j", "j", {}, plain)->entitlements =
            Dictionary{{"com.orbel.developer.replace-plugin", Array{"com.g", 1}}};
        add("com.k", "k", {}, plain)->bundlePath = "/usr/k";
        for (const char name : std::string_view("lmnopq"))
            add(fmt::format("com.{}", name).c_str(), {name}, {}, with("Shared", "x"));
    }

    std::shared_ptr<TDPlugInProxy> add(const char* identifier, const std::string& name,
                                       Dictionary attributes, const Dictionary& plugIn) const {
        const auto proxy = zorvan::makeProxy(identifier, std::move(attributes), plugIn);
        proxy->plugInUuid = *Uuid::parse("00000000-0000-0000-0000-0000000000" +
                                         fmt::format("{:02x}", name[0] - 'a' + 10));
        proxy->bundlePath = fuzz::home().makeDirectory(name);
        proxy->containingApplication = zorvan::makeApplication(fuzz::home().path());
        fuzz::home().write(name + "/Info.plist", kInfo);
        workspace->installed.push_back(proxy);
        return proxy;
    }

    void set(std::string_view settings) const {
        const std::string_view letters = settings.substr(1, settings.find(' ') - 1);
        const auto has = [&](char letter) { return letters.find(letter) != letters.npos; };
        sandbox->sandboxed = has('s');
        sandbox->unreadable.clear();
        if (has('u')) sandbox->unreadable.insert(fuzz::home().path("a"));
        codeSigning->entitlements = Dictionary();
        if (!has('m')) codeSigning->entitlements.set(zorvan::entitlement::kManager, true);
        if (has('a'))
            codeSigning->entitlements.set(zorvan::entitlement::kAllowedPlugIns,
                                          Dictionary{{"VXExtensionVersion", "1"}});
        if (has('A')) codeSigning->entitlements.set(zorvan::entitlement::kAllowedPlugIns, 1);
        workspace->queryFails = has('q');
        workspace->lostContainers = has('l');
        workspace->refused.clear();
        if (has('r')) workspace->refused = {fuzz::home().path("a"), fuzz::home().path("b")};
        sandbox->distant.clear();
        if (has('d')) sandbox->distant.insert({fuzz::home().path("a"), fuzz::home().path("q")});
        launcher->renews = has('R');
        launcher->refused.clear();
        if (has('L')) launcher->refused.insert(fuzz::home().path("a/run"));
        assertions->reports.clear();
        assertions->reports.emplace("com.b", Dictionary());
        if (has('b')) assertions->reports.emplace("com.b", busy_);
        static const std::string preferences =
            Preferences(services.directories).path(zorvan::kUserPreferences);
        const std::size_t space = std::min(settings.find(' '), settings.size() - 1);
        fuzz::home().write(preferences.substr(fuzz::home().path().size() + 1),
                           settings.substr(space + 1));
    }

    /// What the parts of the world keep of what they were asked.
    void forget() const {
        workspace->changes.clear();
        workspace->restored.clear();
        launcher->granted.clear();
        launcher->services.clear();
        launcher->takenBack.clear();
        notifications->posted.clear();
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
    std::shared_ptr<zorvan::FakeSandbox> sandbox = std::make_shared<zorvan::FakeSandbox>();
    std::shared_ptr<zorvan::FakeLauncher> launcher = std::make_shared<zorvan::FakeLauncher>();
    std::shared_ptr<zorvan::FakeAssertions> assertions = std::make_shared<zorvan::FakeAssertions>();
    std::shared_ptr<zorvan::FakeNotifications> notifications =
        std::make_shared<zorvan::FakeNotifications>();
    Services services;
    std::shared_ptr<ZRDServer> server;

  private:
    const Dictionary busy_{{kAssertionBundleIdentifier, "com.b"}};
};

std::optional<Message> requestIn(std::string_view payload) {
    const auto decoded =
        lum::decodePayload(std::make_shared<const std::string>(payload), lum::FrameKind::Request);
    const auto* message = std::get_if<Message>(&decoded);
    if (!message) return std::nullopt;
    Message request = *message;
    const Value* given = request.find(zorvan::message::kPaths);
    if (!given || !given->array()) return request;
    Array paths = *given->array();
    for (std::size_t i = 0; i < paths.size(); ++i) {
        const Text* path = paths[i].string();
        if (path && path->view().starts_with('@'))
            paths.set(i, fuzz::home().path(path->view().substr(1)));
    }
    request.set(zorvan::message::kPaths, std::move(paths));
    return request;
}

/// A client that goes when it is told to, and then another one.
class Client {
  public:
    explicit Client(const World& world) : world_(world) { connect(); }
    ~Client() { leave(); }

    void take(std::string_view part) {
        const auto request = requestIn(part);
        if (!request) return;
        ++requests_;
        connection_->deliver(*request);
        world_.awaitAnswer(*connection_);
    }

    /// Goes without waiting for the answer to its last request.
    void sendAndLeave(std::string_view part) {
        if (const auto request = requestIn(part)) connection_->deliver(*request);
        connection_->deliver(ConnectionError{ConnectionError::Kind::Invalid, "closed"});
        world_.drain();
        connect();
    }

  private:
    void connect() {
        requests_ = 0;
        connection_ = std::make_shared<zorvan::FakeConnection>();
        zorvan::ZRDLumClient::initWithConnection(
            connection_, world_.server,
            zorvan::HostExecutable::of(connection_->token, *world_.codeSigning));
    }

    void leave() {
        world_.drain();
        fuzz::require(connection_->sent.size() == requests_);
        for (const Message& reply : connection_->sent)
            fuzz::require(bool(lum::encodeFrame(lum::FrameKind::Reply, reply, 1u << 24)));
        connection_->deliver(ConnectionError{ConnectionError::Kind::Invalid, "closed"});
        world_.drain();
    }

    const World& world_;
    std::shared_ptr<zorvan::FakeConnection> connection_;
    std::size_t requests_ = 0;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const World world;
    world.set("$");
    world.forget();
    Client client(world);
    for (const std::string_view part : fuzz::parts(fuzz::text(data, size), 8)) {
        if (part.starts_with('$'))
            world.set(part);
        else if (part.starts_with('-'))
            client.sendAndLeave(part.substr(1));
        else if (!part.empty())
            client.take(part);
    }
    return 0;
}
