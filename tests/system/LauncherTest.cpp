// The launcher's service beside the daemon's.

#include <fcntl.h>
#include <sys/file.h>

#include <cerrno>
#include <csignal>
#include <filesystem>

#include "Zorvan/ZRPlugInProcess.h"
#include "platform/system/UniqueFd.h"
#include "tests/system/SystemTest.h"

namespace test {

namespace {

class Launcher : public SystemTest {
  protected:
    zorvan::ZRError startError() {
        std::optional<zorvan::ZRError> error;
        EXPECT_FALSE(zorvan::ZRPlugInProcess::start(nullptr, "/usr/bin/true", {}, error));
        return error.value_or(zorvan::ZRError());
    }
    const std::string service_ = socket_ + ".spawnerd";
};

TEST_F(Launcher, StartsNothingThatWasNotMadeReady) {
    start();
    EXPECT_THAT(match(), testing::IsEmpty());
    EXPECT_EQ(startError().code, EPERM);
    RawClient broken(service_);
    broken.send(RawClient::frame("\xff"));
    EXPECT_TRUE(broken.isClosed());
    EXPECT_EQ(startError().code, EPERM);
    EXPECT_THAT(match(), testing::IsEmpty());
}

TEST_F(Launcher, TheDaemonGoesOnWithoutItsService) {
    std::filesystem::create_directories(home_.path("run/zorvan/services"));
    const platform::UniqueFd lock(::open((service_ + ".lock").c_str(), O_RDWR | O_CREAT, 0600));
    ASSERT_EQ(::flock(lock.get(), LOCK_EX | LOCK_NB), 0);
    writePlugIn(plugInPath("A", "one"), info("one"));
    start();
    EXPECT_THAT(match(), testing::ElementsAre("one 1"));
    EXPECT_EQ(zrd_->errLines("no plug-in will be started: "), 1u);
    EXPECT_EQ(startError().domain, zorvan::kZRErrorDomain);
}

}  // namespace

}  // namespace test
