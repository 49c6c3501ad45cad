#include "platform/lum/AuditToken.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>

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

}  // namespace
}  // namespace platform
