#include "bench/Child.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <limits>
#include <string>
#include <utility>

#include "bench/Failure.h"
#include "bench/Interrupt.h"

namespace bench {

namespace {

std::vector<char*> pointers(const std::vector<std::string>& texts) {
    std::vector<char*> result;
    for (const std::string& text : texts) result.push_back(const_cast<char*>(text.c_str()));
    result.push_back(nullptr);
    return result;
}

/// Runs between fork and exec, where only plain system calls are safe.
[[noreturn]] void execute(const char* program, char** arguments, char** environment, int log,
                          pid_t parent) {
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    // The parent may have died before the signal was asked for.
    if (::getppid() != parent) ::_exit(127);
    ::dup2(log, STDERR_FILENO);
    ::dup2(log, STDOUT_FILENO);
    ::execve(program, arguments, environment);
    ::_exit(127);
}

}  // namespace

Child::Child(const std::string& program, const std::vector<std::string>& arguments,
             const std::vector<std::string>& environment, const std::string& log) {
    std::vector<std::string> all{program};
    all.insert(all.end(), arguments.begin(), arguments.end());
    const std::vector<char*> argumentPointers = pointers(all);
    const std::vector<char*> environmentPointers = pointers(environment);
    platform::UniqueFd logFd(::open(log.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600));
    if (!logFd) failErrno(log);

    const pid_t parent = ::getpid();
    pid_ = ::fork();
    if (pid_ < 0) failErrno("fork");
    if (pid_ == 0) {
        execute(program.c_str(), const_cast<char**>(argumentPointers.data()),
                const_cast<char**>(environmentPointers.data()), logFd.get(), parent);
    }
    pidfd_.reset(static_cast<int>(::syscall(SYS_pidfd_open, pid_, 0)));
}

Child::Child(Child&& other) noexcept
    : pid_(std::exchange(other.pid_, -1)), pidfd_(std::move(other.pidfd_)) {}

Child::~Child() {
    stop();
}

bool Child::running() const {
    if (pid_ < 0) return false;
    pollfd descriptor{pidfd_.get(), POLLIN, 0};
    return ::poll(&descriptor, 1, 0) == 0;
}

void Child::stop() {
    if (pid_ < 0) return;
    ::kill(pid_, SIGTERM);
    pollfd descriptor{pidfd_.get(), POLLIN, 0};
    if (::poll(&descriptor, 1, 2000) <= 0) ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
    pid_ = -1;
}

void Child::waitUntilIdle() const {
    constexpr timespec kPause{0, 50'000'000};
    constexpr int kQuietPauses = 8;
    constexpr int kMostPauses = 1200;
    long before = -1;
    for (int i = 0, quiet = 0; i < kMostPauses && quiet < kQuietPauses; ++i) {
        checkInterrupted();
        const long ticks = cpuTicks();
        quiet = ticks == before ? quiet + 1 : 0;
        before = ticks;
        ::nanosleep(&kPause, nullptr);
    }
}

long Child::cpuTicks() const {
    std::ifstream stat(fmt::format("/proc/{}/stat", pid_));
    // The second field, the name in parentheses, may hold anything; user and system time are the
    // 12th and 13th after it.
    stat.ignore(std::numeric_limits<std::streamsize>::max(), ')');
    std::string skipped;
    for (int i = 0; i < 11; ++i) stat >> skipped;
    long user = 0, system = 0;
    if (!(stat >> user >> system)) fail("process {} is gone", pid_);
    return user + system;
}

double Child::residentMegabytes() const {
    std::ifstream status(fmt::format("/proc/{}/status", pid_));
    for (std::string word; status >> word;) {
        double kibibytes = 0;
        if (word == "VmRSS:" && status >> kibibytes) return kibibytes * 1024 / 1e6;
    }
    fail("the resident memory of process {} cannot be read", pid_);
}

long Child::sleeps() const {
    long sum = 0;
    const std::filesystem::directory_iterator threads(fmt::format("/proc/{}/task", pid_));
    for (const auto& thread : threads) {
        std::ifstream status(thread.path() / "status");
        for (std::string word; status >> word;) {
            long count = 0;
            if (word == "voluntary_ctxt_switches:" && status >> count) sum += count;
        }
    }
    return sum;
}

cpu_set_t allowedCpus() {
    cpu_set_t cpus;
    if (::sched_getaffinity(0, sizeof cpus, &cpus) < 0) failErrno("sched_getaffinity");
    return cpus;
}

void useCpus(const cpu_set_t& cpus) {
    if (::sched_setaffinity(0, sizeof cpus, &cpus) < 0) failErrno("sched_setaffinity");
}

cpu_set_t lastCpuOf(const cpu_set_t& cpus) {
    cpu_set_t result;
    CPU_ZERO(&result);
    for (int cpu = CPU_SETSIZE - 1; cpu >= 0; --cpu) {
        if (!CPU_ISSET(cpu, &cpus)) continue;
        CPU_SET(cpu, &result);
        break;
    }
    return result;
}

}  // namespace bench
