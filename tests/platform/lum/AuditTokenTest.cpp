#include "platform/lum/AuditToken.h"

#include <fcntl.h>
#include <sched.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>

#include <fstream>

#include "platform/lum/Origin.h"
#include "tests/platform/lum/LumFixture.h"

namespace platform {
namespace {

namespace fs = std::filesystem;

using AuditTokenTest = lum::LumTest;

TEST_F(AuditTokenTest, DescribesThisProcess) {
    auto self = AuditToken::ofSelf();
    ASSERT_TRUE(self);
    EXPECT_EQ(self->pid(), getpid());
    EXPECT_EQ(self->uid(), geteuid());
    EXPECT_EQ(self->executablePath(), fs::read_symlink("/proc/self/exe").string());
    int pair[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair), 0);
    UniqueFd mine(pair[0]), other(pair[1]);
    auto peer = AuditToken::ofPeer(mine.get());
    ASSERT_TRUE(peer);
    EXPECT_EQ(peer->pid(), getpid());
    EXPECT_GE(peer->pidFd(), 0);
    EXPECT_GE(peer->procDirectory(), 0);
}

TEST_F(AuditTokenTest, NamesAnExecutableOnlyWhileItIsTheOneThatRuns) {
    const std::string program = directories.runtime + "/program";
    fs::copy_file("/bin/cat", program);
    int started[2];
    int input[2];
    ASSERT_EQ(pipe2(started, O_CLOEXEC) | pipe2(input, O_CLOEXEC), 0);
    UniqueFd listening = lum::unixSocket(directories.runtime + "/listening", ::bind);
    ASSERT_EQ(listen(listening.get(), 1), 0);

    const pid_t child = fork();
    if (child == 0) {
        UniqueFd socket = lum::unixSocket(directories.runtime + "/listening", ::connect);
        dup2(input[0], 0);
        fcntl(socket.get(), F_SETFD, 0);
        execl(program.c_str(), "program", nullptr);
        _exit(1);
    }
    UniqueFd connected(accept(listening.get(), nullptr, nullptr));
    char byte;
    UniqueFd startedEnd(started[0]);
    close(started[1]);
    EXPECT_EQ(read(startedEnd.get(), &byte, 1), 0);  // closed by the exec

    auto token = AuditToken::ofPeer(connected.get());
    ASSERT_TRUE(token);
    EXPECT_EQ(token->pid(), child);
    EXPECT_EQ(token->executablePath(), program);

    fs::rename(program, program + ".old");
    fs::copy_file("/bin/cat", program);
    EXPECT_EQ(AuditToken::ofPeer(connected.get())->executablePath(), program + ".old");
    fs::remove(program + ".old");
    EXPECT_EQ(AuditToken::ofPeer(connected.get())->executablePath(), std::nullopt);

    kill(child, SIGKILL);
    waitpid(child, nullptr, 0);
    EXPECT_FALSE(AuditToken::ofPeer(connected.get()));
    for (int fd : input) close(fd);
}

/// Goes into one user namespace after the other, and into a pid namespace in the end, each time in
/// a session of its own, with a process that stays behind and has connected.
[[noreturn]] void nestNamespaces(const std::string& meeting) {
    for (const int more : {CLONE_NEWUSER, CLONE_NEWUSER, CLONE_NEWUSER | CLONE_NEWPID, 0}) {
        const uid_t user = ::geteuid();
        const gid_t group = ::getegid();
        ::prctl(PR_SET_PDEATHSIG, SIGKILL);
        ::setsid();
        if (::unshare(more) != 0) ::_exit(1);
        // Who is nobody in there may make no more.
        std::ofstream("/proc/self/uid_map") << "0 " << user << " 1";
        std::ofstream("/proc/self/setgroups") << "deny";
        std::ofstream("/proc/self/gid_map") << "0 " << group << " 1";
        if (::fork() == 0) continue;
        const UniqueFd socket = lum::unixSocket(meeting, ::connect);
        for (;;) ::pause();
    }
    ::_exit(0);
}

TEST_F(AuditTokenTest, ASandboxIsOneOriginHoweverItNestsNamespaces) {
    const std::string meeting = directories.runtime + "/meeting";
    const UniqueFd listening = lum::unixSocket(meeting, ::bind);
    ASSERT_EQ(::listen(listening.get(), 8), 0);
    const timeval patience{10, 0};
    ::setsockopt(listening.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
    std::vector<Origin> sandboxes;
    for (int sandbox = 0; sandbox < 2; ++sandbox) {
        const pid_t child = ::fork();
        if (child == 0) nestNamespaces(meeting);
        for (int process = 0; process < 4; ++process) {
            const UniqueFd connected(::accept(listening.get(), nullptr, nullptr));
            const auto token = connected ? AuditToken::ofPeer(connected.get()) : std::nullopt;
            if (!token) GTEST_SKIP() << "no namespaces can be made here";
            const Origin origin = Origin::of(*token);
            EXPECT_NE(origin.inode, 0u);
            if (process == 0) sandboxes.push_back(origin);
            EXPECT_EQ(origin, sandboxes.back()) << process;
        }
        ::kill(child, SIGKILL);
        ::waitpid(child, nullptr, 0);
    }
    EXPECT_NE(sandboxes.at(0), sandboxes.at(1));
}

}  // namespace
}  // namespace platform
