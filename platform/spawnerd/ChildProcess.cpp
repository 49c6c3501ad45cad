#include "platform/spawnerd/ChildProcess.h"

#include <fcntl.h>
#include <linux/keyctl.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>

namespace platform::spawnerd {

namespace {

/// Above all numbers that a child is given.
constexpr int kHigh = 64;

/// The session's keys are a credential that a process inherits into every namespace. Where there
/// are no keys, or nobody may use them, there is nothing to leave.
int leaveSessionKeys() {
    if (::syscall(SYS_keyctl, KEYCTL_JOIN_SESSION_KEYRING, nullptr) >= 0) return 0;
    return errno == ENOSYS || errno == EPERM ? 0 : errno;
}

/// When memory runs out, what this child becomes goes first, and not what the user works with.
void yieldMemory() {
    const UniqueFd file(::open("/proc/self/oom_score_adj", O_WRONLY | O_CLOEXEC));
    (void)!::write(file.get(), "500", 3);
}

void resetSignals() {
    struct sigaction byDefault {};
    byDefault.sa_handler = SIG_DFL;
    for (int signal = 1; signal < NSIG; ++signal) ::sigaction(signal, &byDefault, nullptr);
    sigset_t none;
    ::sigemptyset(&none);
    ::sigprocmask(SIG_SETMASK, &none, nullptr);
}

/// Also when the parent is gone already.
int endWith(pid_t parent) {
    if (::prctl(PR_SET_PDEATHSIG, SIGKILL) != 0) return errno;
    return ::getppid() == parent ? 0 : ESRCH;
}

}  // namespace

bool ChildProcess::give(int source, int target) {
    // Out of the way: giving the child one of its descriptors then never closes the source of
    // another.
    given_.emplace_back(::fcntl(source, F_DUPFD_CLOEXEC, kHigh), target);
    return static_cast<bool>(given_.back().first);
}

void ChildProcess::begin(char* const argv[], int failure) const {
    resetSignals();
    yieldMemory();
    int error = leaveSessionKeys();
    // They close when the program begins; what the child is given does not.
    if (error == 0 && ::close_range(0, ~0U, CLOSE_RANGE_CLOEXEC) != 0) error = errno;
    for (const auto& [source, target] : given_)
        if (error == 0 && ::dup2(source.get(), target) < 0) error = errno;
    if (error == 0) {
        static char path[] = "PATH=/usr/bin:/bin";
        static char* const environment[] = {path, nullptr};
        ::execve(argv[0], argv, environment);
        error = errno;
    }
    (void)!::write(failure, &error, sizeof error);
    ::_exit(127);
}

Result<pid_t> ChildProcess::run(const std::vector<std::string>& words) const {
    std::vector<char*> argv;
    argv.reserve(words.size() + 1);
    for (const std::string& word : words) argv.push_back(const_cast<char*>(word.c_str()));
    argv.push_back(nullptr);
    int ends[2];
    if (::pipe2(ends, O_CLOEXEC) != 0) return Error::posix(errno, words.front());
    UniqueFd readEnd(ends[0]), low(ends[1]);
    UniqueFd failure(::fcntl(low.get(), F_DUPFD_CLOEXEC, kHigh));
    low.reset();
    if (!failure) return Error::posix(errno, words.front());
    const pid_t parent = ::getpid();
    const pid_t pid = ::fork();
    if (pid == 0) {
        if (endWith(parent) != 0) ::_exit(127);
        begin(argv.data(), failure.get());
    }
    int error = pid < 0 ? errno : 0;
    failure.reset();
    // Nothing comes when the program runs: its end of the pipe is closed then.
    if (pid > 0 && ::read(readEnd.get(), &error, sizeof error) > 0) ::waitpid(pid, nullptr, 0);
    if (error != 0) return Error::posix(error, words.front());
    return pid;
}

}  // namespace platform::spawnerd
