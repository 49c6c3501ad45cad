// A file system that does not answer, which everybody can have who mounts one of his own.

#include <cerrno>
#include <csignal>
#include <filesystem>
#include <thread>

#include "Zorvan/ZRPlugInProcess.h"
#include "tests/support/HungMount.h"
#include "tests/system/SystemTest.h"

namespace test {

namespace {

using testing::ElementsAre;
using testing::HasSubstr;

class HungFileSystem : public SystemTest {
  protected:
    void SetUp() override {
        home_.makeDirectory("hung");
        if (!HungMount::isPossible()) GTEST_SKIP() << "only root mounts what does not answer";
        writePlugIn(plugInPath("A", "steady"), info("steady"));
        start();
    }
    void TearDown() override {
        // Also the end of the daemon waits for nobody.
        if (zrd_) stop(SIGTERM);
        mount_.end();
        SystemTest::TearDown();
    }
    /// From now on whoever looks beneath it waits.
    void hang() { ASSERT_TRUE(mount_.begin(hung_)); }
    static void expectQuick(const std::function<void()>& work) {
        const auto start = std::chrono::steady_clock::now();
        work();
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(1));
    }
    void expectService() {
        const Dictionary steady{{"VXExtensionIdentifier", "steady"}};
        expectQuick([&] { EXPECT_THAT(match(steady), ElementsAre("steady 1")); });
    }

    const std::string hung_ = home_.path("hung");
    HungMount mount_;
};

TEST_F(HungFileSystem, APathOnItHoldsUpItsSenderAlone) {
    hang();
    const Array paths{home_.path(), hung_ + "/a", home_.path()};
    RawClient adding(socket_), holding(socket_);
    adding.send(RawClient::request({{"request", "add"}, {"version", 3}, {"paths", paths}}));
    holding.send(
        RawClient::request({{"request", "lock"}, {"version", 3}, {"flags", 1}, {"paths", paths}}));
    {
        RawClient gone(socket_);
        gone.send(RawClient::request({{"request", "lock"}, {"version", 3}, {"paths", paths}}));
    }
    for (int i = 0; i < 20; ++i) expectService();
    EXPECT_EQ(add({home_.path(plugInPath("A", "steady"))}), "");
    EXPECT_THAT(adding.receive(), HasSubstr("unable to register plug-in at " + home_.path()));
    EXPECT_THAT(holding.receive(), HasSubstr("invalid path: " + hung_ + "/a"));
    adding.send(RawClient::request({{"request", "add"}, {"version", 3}, {"paths", Array{hung_}}}));
    EXPECT_THAT(adding.receive(), HasSubstr("invalid plugin path: " + hung_));
}

TEST_F(HungFileSystem, ARegisteredBundleOnItHoldsUpWhoAsksForItAlone) {
    const std::string bundle = "hung/H.app/PlugIns/far.appex";
    Dictionary far = info("far");
    far.set("QFBundleExecutable", "run");
    writePlugIn(bundle, far);
    std::filesystem::copy_file("/bin/true", home_.path(bundle + "/run"));
    ASSERT_EQ(add({home_.path("hung/H.app")}), "");
    const auto idOf = [&](const char* name) {
        return *platform::Uuid::parse(
            *forms({{"VXExtensionIdentifier", name}}).at(0).find("uuid")->string());
    };
    const platform::Uuid steady = idOf("steady"), uuid = idOf("far");
    const auto ready = [&](const platform::Uuid& plugIn) {
        return errorOf(
            ask([&](auto& client, auto& reply) { client.readyPlugIns({plugIn}, 0, reply); }));
    };
    ASSERT_EQ(ready(uuid), "");
    const std::string refusal = ready(steady);  // it has no executable
    hang();
    const auto asking = [&](Dictionary request) {
        auto client = std::make_unique<RawClient>(socket_);
        request.set("version", 3);
        client->send(RawClient::request(request));
        return client;
    };
    const auto readying = asking({{"request", "ready"}, {"uuids", Array{uuid}}});
    const auto accessing = asking({{"request", "access"}, {"uuids", Array{steady, uuid}}});
    const auto matching = asking({{"request", "match"}});
    std::thread starting([&] {
        std::optional<zorvan::ZRError> error;
        EXPECT_FALSE(
            zorvan::ZRPlugInProcess::start(nullptr, home_.path(bundle + "/run"), {}, error));
        EXPECT_EQ(error ? error->code : 0, ETIMEDOUT);
    });
    const Dictionary near{{"VXExtensionIdentifier", "steady"}};
    for (int i = 0; i < 20; ++i) {
        expectQuick([&] { EXPECT_THAT(match(near), ElementsAre("steady 1")); });
        expectQuick([&] { EXPECT_EQ(ready(steady), refusal); });
    }
    EXPECT_THAT(readying->receive(), HasSubstr("unable to enable plug-in far"));
    EXPECT_THAT(accessing->receive(), HasSubstr("cannot create extension to " + home_.path(bundle) +
                                                ": " + std::to_string(ETIMEDOUT)));
    const std::string found = matching->receive();
    EXPECT_THAT(found, testing::AllOf(HasSubstr("steady"), HasSubstr("far.appex")));
    starting.join();
    // Nobody waits for what is known not to answer.
    for (int i = 0; i < 3; ++i)
        expectQuick([&] { EXPECT_THAT(match(), ElementsAre("far 1", "steady 1")); });
    // The registry goes on, and so does a new start.
    EXPECT_THAT(add({home_.path("hung/H.app")}), HasSubstr("invalid plugin path"));
    writePlugIn(plugInPath("B", "new"), info("new"));
    EXPECT_TRUE(waitUntil([&] { return match({{"VXExtensionIdentifier", "new"}}).size() == 1; }));
    std::filesystem::remove_all(home_.path(plugInPath("B", "new")));
    EXPECT_TRUE(waitUntil([&] { return match({{"VXExtensionIdentifier", "new"}}).empty(); }));
    stop(SIGTERM);
    start();
    EXPECT_THAT(match(), ElementsAre("far 1", "steady 1"));
    expectQuick([&] { EXPECT_EQ(add({home_.path(plugInPath("A", "steady"))}), ""); });
    mount_.end();
    EXPECT_TRUE(waitUntil([&] { return ready(uuid).empty(); }));
    for (const Dictionary& form : forms())
        EXPECT_TRUE(form.find("extensions")->dictionary()->contains("."));
}

TEST_F(HungFileSystem, AHostOnItHoldsUpItselfAlone) {
    std::filesystem::copy_file("/usr/bin/perl", hung_ + "/host");
    const std::string request =
        home_.write("request", RawClient::request({{"request", "match"}, {"version", 3}}));
    const auto host =
        spawn((hung_ + "/host").c_str(),
              {"-e",
               "use Socket; $| = 1; print 'ready';"
               "select(undef, undef, undef, 0.01) until -e $ARGV[0];"
               "socket(S, AF_UNIX, SOCK_STREAM, 0); connect(S, sockaddr_un($ARGV[1]));"
               "open(F, $ARGV[2]); sysread(F, $r, 4096); syswrite(S, $r);"
               "sysread(S, $r, 4096); print $r",
               home_.path("go"), socket_, request});
    ASSERT_TRUE(waitUntil([&] { return host->out() == "ready"; })) << host->err();
    hang();
    home_.write("go", "");
    for (int i = 0; i < 20; ++i) expectService();
    EXPECT_TRUE(waitUntil([&] { return host->out() != "ready"; }));
    EXPECT_THAT(host->out(), HasSubstr("matches")) << "it is served, if with nothing";
    EXPECT_EQ(zrd_->errLines("goes without bundle and entitlements"), 1u);
}

TEST_F(HungFileSystem, APlugInOnItHoldsUpWhoStartsItAlone) {
    Dictionary plugIn = info("hung");
    plugIn.set("QFBundleExecutable", "run");
    const std::string bundle = writePlugIn("hung/H.app/PlugIns/hung.appex", plugIn);
    std::filesystem::copy_file("/bin/true", bundle + "/run");
    ASSERT_EQ(add({bundle}), "");
    const auto found = forms({{"VXExtensionIdentifier", "hung"}});
    const auto uuid = platform::Uuid::parse(*found.at(0).find("uuid")->string()).value();
    ASSERT_EQ(
        errorOf(ask([&](auto& client, auto& reply) { client.readyPlugIns({uuid}, 0, reply); })),
        "");
    hang();
    const std::string service = socket_ + ".spawnerd";
    const std::string request =
        RawClient::request({{"request", "start"}, {"executable", bundle + "/run"}});
    RawClient starting(service), ending(service);
    starting.send(request);
    for (int i = 0; i < 20; ++i) expectService();
    // A number that it can only have guessed.
    ending.send(RawClient::request({{"request", "terminate"}, {"instance", 1}}));
    EXPECT_THAT(ending.receive(), HasSubstr("status"));
    EXPECT_THAT(starting.receive(), HasSubstr("the sandbox of " + bundle));
    { RawClient(service).send(request); }  // gone before it is answered
    starting.send(request);
    for (int i = 0; i < 20; ++i) expectService();
    EXPECT_THAT(starting.receive(), HasSubstr(bundle + ": Connection timed out"));
    EXPECT_EQ(zrd_->errLines("cannot start " + bundle), 1u) << zrd_->err();
    starting.send(request);
}

}  // namespace

}  // namespace test
