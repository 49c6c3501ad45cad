// Hosts that are other processes than the launcher's.

#include <linux/sched.h>
#include <sys/syscall.h>

#include "platform/system/Files.h"
#include "tests/platform/spawnerd/LauncherFixture.h"

namespace platform::spawnerd {

namespace {

/// A child process that connects to a socket and then waits for its end; SIGKILL when it goes.
class Child {
  public:
    /// `pid`, unless 0, is the number that it gets; `run` is what it does, after it has connected.
    explicit Child(const std::string& socket, pid_t pid = 0, void (*run)(int fd) = nullptr) {
        clone_args arguments{};
        arguments.exit_signal = SIGCHLD;
        arguments.set_tid = pid ? reinterpret_cast<std::uint64_t>(&pid) : 0;
        arguments.set_tid_size = pid ? 1 : 0;
        pid_ = static_cast<pid_t>(::syscall(SYS_clone3, &arguments, sizeof arguments));
        if (pid_ != 0) return;
        const int fd = lum::unixSocket(socket, ::connect).release();
        if (run) run(fd);
        for (;;) ::pause();
    }
    ~Child() { end(); }

    pid_t pid() const { return pid_; }
    void end() {
        if (pid_ > 0) ::kill(pid_, SIGKILL);
        if (pid_ > 0) ::waitpid(pid_, nullptr, 0);
        pid_ = -1;
    }

  private:
    pid_t pid_;
};

class HostTest : public LauncherTest {
  protected:
    HostTest() { ::listen(listening_.get(), 8); }
    /// Who has connected to `meeting`; and that connection, to tell it to go on.
    AuditToken meet() {
        accepted_.reset(::accept4(listening_.get(), nullptr, nullptr, SOCK_CLOEXEC));
        return *AuditToken::ofPeer(accepted_.get());
    }
    void goOn() { ASSERT_EQ(::write(accepted_.get(), "", 1), 1); }

    const std::string meeting_ = directories.runtime + "/meeting";
    const UniqueFd listening_ = lum::unixSocket(meeting_, ::bind);
    UniqueFd accepted_;
};

// What a child does has no arguments.
std::string childsService;
std::string childsRequest;

void startPlugIn(int meeting) {
    char byte;
    if (::read(meeting, &byte, 1) != 1) return;
    const int service = lum::unixSocket(childsService, ::connect).release();
    if (::write(service, childsRequest.data(), childsRequest.size()) < 0) return;
    char reply[4096];
    const ssize_t count = ::read(service, reply, sizeof reply);
    if (count <= 0 || ::write(meeting, reply, static_cast<std::size_t>(count)) < 0) return;
    // The connections to the service and to the plug-in go; the host stays.
    ::close(service);
}

TEST_F(HostTest, APlugInEndsWithItsHostHoweverItHasForked) {
    container("one");
    const std::string executable =
        plugIn("one", "(trap '' TERM HUP; setsid sh -c 'while :; do sleep 1000; done' " +
                          home.path() + "/left &)\nsleep 1000");
    childsService = path("test.spawnerd");
    childsRequest = lum::requestFrame(1, {{"request", "start"}, {"executable", executable}});
    Child host(meeting_, 0, startPlugIn);
    const AuditToken token = meet();
    EXPECT_EQ(launcher->addExternalService(token, service(executable), overlay()), 0);
    // Somebody else has not been granted anything by that.
    EXPECT_EQ(number(start(executable), kErrorCode), EPERM);
    goOn();
    EXPECT_TRUE(stepUntil([&] { return !processesWith(home.path() + "/left").empty(); }));
    // Its connections have gone; it has not, and neither have its plug-ins.
    lum::RawPeer peer(std::move(accepted_));
    std::optional<Message> reply;
    EXPECT_TRUE(stepUntil([&] { return (reply = peer.read()).has_value(); }));
    EXPECT_EQ(number(*reply, kInstance), 1);
    loop.poll();
    EXPECT_FALSE(processesWith(executable).empty());
    EXPECT_EQ(number(ask({{"request", "terminate"}, {"instance", 1}}), kErrorCode), ESRCH);
    host.end();
    EXPECT_TRUE(stepUntil([&] { return processesWith(home.path()).empty(); }));
    EXPECT_EQ(launcher->addExternalService(token, service(executable), overlay()), ESRCH);
}

void startMany(int meeting) {
    char reply[4096];
    if (::read(meeting, reply, 1) != 1) return;
    const int service = lum::unixSocket(childsService, ::connect).release();
    for (std::size_t i = 0; i < kMaxInstancesPerHost; ++i)
        if (::write(service, childsRequest.data(), childsRequest.size()) < 0 ||
            ::read(service, reply, sizeof reply) <= 0)
            return;
    (void)!::write(meeting, "", 1);
}

TEST_F(HostTest, HostsThatBelongTogetherHaveAQuarterOfTheInstances) {
    const std::string executable = plugIn("one", "exec sleep 1000");
    childsService = path("test.spawnerd");
    childsRequest = lum::requestFrame(1, {{"request", "start"}, {"executable", executable}});
    std::vector<std::unique_ptr<Child>> hosts;
    for (std::size_t left = kMaxInstances / 4; left > 0; left -= kMaxInstancesPerHost) {
        hosts.push_back(std::make_unique<Child>(meeting_, 0, startMany));
        EXPECT_EQ(launcher->addExternalService(meet(), service(executable), overlay()), 0);
        goOn();
        char done;
        EXPECT_TRUE(
            stepUntil([&] { return ::recv(accepted_.get(), &done, 1, MSG_DONTWAIT) == 1; }));
    }
    EXPECT_EQ(grant(executable), 0);
    const Message refused = start(executable);
    ASSERT_EQ(number(refused, kErrorCode), EAGAIN);
    EXPECT_NE(refused.find(kError)->string()->view().find("belongs with"), std::string_view::npos);
    hosts.clear();
    EXPECT_TRUE(stepUntil([&] { return processesWith(executable).empty(); }));
    EXPECT_GT(number(start(executable), kInstance), 0);
}

TEST_F(HostTest, AnotherProcessWithTheNumberOfADeadHostIsAnother) {
    const auto hosts = std::make_shared<GrantedHosts>(queue, [](const auto&) {});
    Grant granted;
    granted.executable = "/x";
    Child first(meeting_);
    const AuditToken old = meet();
    const pid_t pid = first.pid();
    EXPECT_EQ(hosts->add(old, granted), 0);
    ASSERT_NE(hosts->find(old), nullptr);
    first.end();
    EXPECT_EQ(hosts->find(old), nullptr);
    Child second(meeting_, pid);
    if (second.pid() != pid) GTEST_SKIP() << "may not choose process numbers";
    const AuditToken now = meet();
    ASSERT_EQ(now.pid(), pid);
    // The loop has not even heard of the death.
    EXPECT_EQ(hosts->find(now), nullptr);
    EXPECT_EQ(hosts->add(now, granted), 0);
    loop.poll();
    EXPECT_NE(hosts->find(now), nullptr);
    EXPECT_EQ(hosts->find(old), nullptr);
}

}  // namespace

}  // namespace platform::spawnerd
