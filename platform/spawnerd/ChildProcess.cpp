#include "platform/spawnerd/ChildProcess.h"

#include <fcntl.h>
#include <linux/keyctl.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstddef>
#include <cstdint>

namespace platform::spawnerd {

namespace {

// What runs in the child before the program does allocates nothing, takes no lock and only makes
// system calls: this process has threads. The functions answer 0 or an errno.

// As the kernel has them; the headers of many systems are older.
constexpr long kLandlockCreateRuleset = 444, kLandlockRestrictSelf = 446;
constexpr unsigned kLandlockVersion = 1u << 0;
constexpr long kLeastVersionWithScopes = 6;
constexpr std::uint64_t kScopeAbstractSockets = 1u << 0;
struct LandlockRuleset {
    std::uint64_t files = 0, network = 0, scoped = kScopeAbstractSockets;
};

/// Abstract sockets belong to the network, not to the files, and desktops have powerful ones. What
/// has a network of its own loses nothing by this, and a kernel that cannot do it is no reason not
/// to run.
int leaveAbstractSockets() {
    if (::syscall(kLandlockCreateRuleset, nullptr, 0, kLandlockVersion) < kLeastVersionWithScopes)
        return 0;
    const LandlockRuleset ruleset;
    const auto fd =
        static_cast<int>(::syscall(kLandlockCreateRuleset, &ruleset, sizeof ruleset, 0));
    if (fd < 0 || ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) return errno;
    const int failure = ::syscall(kLandlockRestrictSelf, fd, 0) == 0 ? 0 : errno;
    ::close(fd);
    return failure;
}

/// The session's keys are a credential that a process inherits into every namespace. Where there
/// are no keys, or nobody may use them, there is nothing to leave.
int leaveSessionKeys() {
    if (::syscall(SYS_keyctl, KEYCTL_JOIN_SESSION_KEYRING, nullptr) >= 0) return 0;
    return errno == ENOSYS || errno == EPERM ? 0 : errno;
}

/// When memory runs out, what this child becomes goes first, and not what the user works with.
void yieldMemory() {
    const int file = ::open("/proc/self/oom_score_adj", O_WRONLY | O_CLOEXEC);
    (void)!::write(file, "500", 3);
    ::close(file);
}

void resetSignals() {
    struct sigaction byDefault {};
    byDefault.sa_handler = SIG_DFL;
    for (int signal = 1; signal < NSIG; ++signal) ::sigaction(signal, &byDefault, nullptr);
    sigset_t none;
    ::sigemptyset(&none);
    ::sigprocmask(SIG_SETMASK, &none, nullptr);
}

}  // namespace

bool ChildProcess::give(int source, int target) {
    // Out of the way: giving the child one of its descriptors then never closes the source of
    // another.
    given_.emplace_back(::fcntl(source, F_DUPFD_CLOEXEC, lastDescriptor_ + 1), target);
    return static_cast<bool>(given_.back().first);
}

void ChildProcess::begin(const char* program, char* const argv[], char* const environment[],
                         int failure) const {
    resetSignals();
    yieldMemory();
    int error = leaveSessionKeys();
    if (error == 0) error = leaveAbstractSockets();
    // They close when the program begins; what the child is given does not.
    if (error == 0 && ::close_range(0, ~0U, CLOSE_RANGE_CLOEXEC) != 0) error = errno;
    for (const auto& [source, target] : given_)
        if (error == 0 && ::dup2(source.get(), target) < 0) error = errno;
    if (error == 0) {
        ::execve(program, argv, environment);
        error = errno;
    }
    (void)!::write(failure, &error, sizeof error);
    ::_exit(127);
}

Result<pid_t> ChildProcess::run(const char* program, char* const argv[],
                                char* const environment[]) const {
    int ends[2];
    if (::pipe2(ends, O_CLOEXEC) != 0) return Error::posix(errno, program);
    UniqueFd readEnd(ends[0]), low(ends[1]);
    // Above what the child is given.
    UniqueFd failure(::fcntl(low.get(), F_DUPFD_CLOEXEC, lastDescriptor_ + 1));
    low.reset();
    if (!failure) return Error::posix(errno, program);

    // A handler of ours must not run in the child.
    sigset_t all, before;
    ::sigfillset(&all);
    ::pthread_sigmask(SIG_SETMASK, &all, &before);
    const pid_t pid = ::fork();
    if (pid == 0) begin(program, argv, environment, failure.get());
    int error = pid < 0 ? errno : 0;
    ::pthread_sigmask(SIG_SETMASK, &before, nullptr);
    failure.reset();
    // Nothing comes when the program runs: its end of the pipe is closed then.
    if (pid > 0 && ::read(readEnd.get(), &error, sizeof error) > 0) ::waitpid(pid, nullptr, 0);
    if (error != 0) return Error::posix(error, program);
    return pid;
}

}  // namespace platform::spawnerd
