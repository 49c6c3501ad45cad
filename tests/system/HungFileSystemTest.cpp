// A file system that does not answer, which everybody can have who mounts one of his own.

#include <fcntl.h>
#include <sched.h>
#include <sys/mount.h>
#include <unistd.h>

#include <csignal>
#include <filesystem>

#include "platform/system/UniqueFd.h"
#include "tests/system/SystemTest.h"

namespace test {

namespace {

using testing::ElementsAre;
using testing::HasSubstr;

class HungFileSystem : public SystemTest {
  protected:
    void SetUp() override {
        home_.makeDirectory("hung");
        if (::geteuid() != 0 || ::access("/dev/fuse", R_OK | W_OK) != 0)
            GTEST_SKIP() << "only root mounts what does not answer";
        // Others look at the mounts as well.
        if (::unshare(CLONE_NEWNS) != 0 ||
            ::mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0)
            GTEST_SKIP() << "no mount namespaces";
        writePlugIn(plugInPath("A", "steady"), info("steady"));
        start();
    }
    void TearDown() override {
        // Also the end of the daemon waits for nobody.
        if (zrd_) stop(SIGTERM);
        fuse_.reset();  // those who wait for an answer get an error
        ::umount2(hung_.c_str(), MNT_DETACH);
        SystemTest::TearDown();
    }
    /// From now on whoever looks beneath it waits.
    void hang() {
        fuse_.reset(::open("/dev/fuse", O_RDWR | O_CLOEXEC));
        const std::string options =
            "rootmode=40000,user_id=0,group_id=0,fd=" + std::to_string(fuse_.get());
        ASSERT_EQ(::mount("hung", hung_.c_str(), "fuse", MS_NOSUID | MS_NODEV, options.c_str()), 0);
    }
    void expectService() {
        const auto start = std::chrono::steady_clock::now();
        EXPECT_THAT(match({{"VXExtensionIdentifier", "steady"}}), ElementsAre("steady 1"));
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(1));
    }

    const std::string hung_ = home_.path("hung");
    platform::UniqueFd fuse_;
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
    EXPECT_EQ(zrd_->errLines("cannot start " + bundle), 1u);
    starting.send(request);
}

}  // namespace

}  // namespace test
