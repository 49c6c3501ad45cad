// Plug-ins that are taken out of service.

#include <cerrno>
#include <csignal>
#include <fstream>

#include "tests/system/PlugInTest.h"

namespace test {

namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

constexpr std::uint64_t kApplication = zorvan::ZRHoldApplications, kPlugIn = zorvan::ZRHoldPlugIns;

class Hold : public PlugInTest {
  protected:
    /// `zrctl hold`, once it has written its token.
    std::unique_ptr<Process> holder(const char* kind, const std::string& path) {
        auto process = spawn(zrctlProgram_.c_str(), {"hold", kind, home_.path(path)});
        EXPECT_TRUE(waitUntil([&] { return !process->isRunning() || !process->out().empty(); }));
        return process;
    }
    std::string held() const {
        return "11 access to plugin com.test.upper denied: the plug-in is on hold";
    }
};

TEST_F(Hold, WhatIsHeldIsNeitherFoundNorMadeReadyNorStarted) {
    NEEDS_BUBBLEWRAP();
    EXPECT_EQ(ready(uuid_), "");
    const auto running = startPlugIn();
    ASSERT_TRUE(running) << zrd_->err();
    const auto holding = holder("--app", application_);
    EXPECT_THAT(match(), IsEmpty());
    EXPECT_EQ(ready(uuid_), held());
    EXPECT_FALSE(startPlugIn());
    EXPECT_EQ(failure_, EPERM) << "though it was made ready before";
    EXPECT_EQ(talk(*running, "on"), "ON") << "what runs goes on";
    EXPECT_EQ(zrctl({"run", uuid_.string()})->wait(), 3);

    holding->signal(SIGINT);
    EXPECT_EQ(holding->wait(), 0) << holding->err();
    EXPECT_THAT(match(), ElementsAre("com.test.upper 1"));
    EXPECT_EQ(ready(uuid_), "");
    EXPECT_TRUE(startPlugIn());
}

TEST_F(Hold, ItEndsWithItsReleaseAndWithItsClient) {
    const auto first = holder("--plugin", bundle_), second = holder("--plugin", bundle_);
    first->signal(SIGKILL);
    first->wait();
    EXPECT_EQ(ready(uuid_), held()) << "another has it still";
    const std::string token = second->out().substr(0, 36);
    EXPECT_EQ(zrctl({"release", token, token})->wait(), 0);
    EXPECT_EQ(ready(uuid_), "");

    for (int i = 0; i < 1000; ++i) ASSERT_EQ(errorOf(hold(kPlugIn, home_.path(bundle_))), "");
    EXPECT_EQ(ready(uuid_), held());
    client_ = ZRDaemonClient::initWithServiceName(nullptr);
    EXPECT_TRUE(waitUntil([&] { return ready(uuid_).empty(); }));

    const auto last = holder("--plugin", bundle_);
    stop(SIGKILL);
    EXPECT_EQ(last->wait(), 3);
    EXPECT_THAT(last->err(), HasSubstr("zrd went away"));
}

TEST_F(Hold, BusyPlugInsKeepTheirApplicationInServiceUntilTheyCrash) {
    NEEDS_BUBBLEWRAP();
    EXPECT_EQ(ready(uuid_), "");
    const auto running = startPlugIn();
    ASSERT_TRUE(running) << zrd_->err();
    EXPECT_EQ(talk(*running, "work"), "WORK");
    const auto reply = hold(kApplication, home_.path(application_));
    EXPECT_EQ(errorOf(reply), "14 plug-ins are busy");
    EXPECT_EQ(*std::get<platform::Message>(reply).find("conflicts"),
              Value(Array{Dictionary{{"bundle-identifier", "com.test.upper"}}}));
    const auto refused = holder("--app", application_);
    EXPECT_EQ(refused->wait(), 3);
    EXPECT_EQ(refused->err(), "zrctl: plug-ins are busy (Zorvan 14): com.test.upper\n");
    EXPECT_THAT(match(), ElementsAre("com.test.upper 1"));
    const std::string twin = home_.path("Twin.app");
    std::filesystem::copy(home_.path(application_), twin, std::filesystem::copy_options::recursive);
    EXPECT_EQ(add({twin}), "");
    EXPECT_EQ(errorOf(hold(kApplication, twin)), "") << "only the name is busy there";
    EXPECT_EQ(zrctl({"remove", twin})->wait(), 0);
    EXPECT_EQ(talk(*running, "on"), "ON") << "and only the name has gone";
    running->terminate();
    running->wait();
    EXPECT_EQ(errorOf(hold(kApplication, home_.path(application_))), "");
}

TEST_F(Hold, TheEndOfTheDaemonIsTheEndOfAllThatItStarted) {
    NEEDS_BUBBLEWRAP();
    for (const int signal : {SIGTERM, SIGINT, SIGKILL}) {
        if (!zrd_) start();
        EXPECT_EQ(ready(uuidOf("com.test.upper")), "");
        const auto running = startPlugIn();
        ASSERT_TRUE(running) << zrd_->err();
        EXPECT_EQ(talk(*running, "work"), "WORK");
        stop(signal);
        EXPECT_TRUE(hasClosed(*running)) << "nobody holds the other end";
        for (const char* suffix : {"", ".sandbox", ".spawnerd"})
            EXPECT_EQ(std::filesystem::exists(socket_ + suffix), signal == SIGKILL) << suffix;
    }
}

TEST_F(Hold, TheEndOfTheProcessThatKeepsPlugInsIsTheDaemonsToo) {
    NEEDS_BUBBLEWRAP();
    EXPECT_EQ(ready(uuid_), "");
    const auto running = startPlugIn();
    ASSERT_TRUE(running) << zrd_->err();
    const std::string number = std::to_string(zrd_->pid());
    std::ifstream children("/proc/" + number + "/task/" + number + "/children");
    std::string child, name;
    while (name != "zrd-keeper" && children >> child)
        std::ifstream("/proc/" + child + "/comm") >> name;
    ASSERT_EQ(name, "zrd-keeper");
    ::kill(std::stoi(child), SIGKILL);
    EXPECT_EQ(zrd_->wait(), 1);
    EXPECT_EQ(zrd_->errLines("the process that keeps plug-ins has ended"), 1u);
    EXPECT_TRUE(hasClosed(*running));
    EXPECT_FALSE(std::filesystem::exists(socket_));
    zrd_.reset();
}

}  // namespace

}  // namespace test
