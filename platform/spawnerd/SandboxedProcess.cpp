#include "platform/spawnerd/SandboxedProcess.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/mman.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <iterator>
#include <string_view>

#include "platform/spawnerd/Protocol.h"

namespace platform::spawnerd {

namespace {

/// Descriptors of the child, behind the plug-in's connection. bubblewrap closes these three before
/// it runs the plug-in.
constexpr int kArgumentsFd = kConnectionDescriptor + 1;
constexpr int kInfoFd = kArgumentsFd + 1;
constexpr int kGateFd = kInfoFd + 1;

/// A duplicate with a number that is none of the child's: giving the child one of its descriptors
/// then never closes the source of another.
UniqueFd outOfTheWay(int fd) {
    return UniqueFd(::fcntl(fd, F_DUPFD_CLOEXEC, kGateFd + 1));
}

struct Pipe {
    UniqueFd readEnd, writeEnd;

    bool open() {
        int ends[2];
        if (::pipe2(ends, O_CLOEXEC) != 0) return false;
        readEnd.reset(ends[0]);
        writeEnd.reset(ends[1]);
        return true;
    }
};

void makeNonBlocking(const UniqueFd& fd) {
    ::fcntl(fd.get(), F_SETFL, ::fcntl(fd.get(), F_GETFL) | O_NONBLOCK);
}

/// The arguments as bubblewrap reads them from a descriptor: what a plug-in asks for never stands
/// in a command line of ours, nor in an environment.
UniqueFd fileOf(const std::vector<std::string>& arguments) {
    std::string bytes;
    for (const std::string& argument : arguments) bytes.append(argument).push_back('\0');
    UniqueFd file(::memfd_create("plug-in", MFD_CLOEXEC));
    if (!file) return file;
    std::string_view rest = bytes;
    while (!rest.empty()) {
        const ssize_t count = ::write(file.get(), rest.data(), rest.size());
        if (count < 0) return UniqueFd();
        rest.remove_prefix(static_cast<std::size_t>(count));
    }
    ::lseek(file.get(), 0, SEEK_SET);
    return file;
}

/// How the child begins: with these descriptors and no others, and with the signals as they are by
/// default, whatever this process ignores.
class SpawnPlan {
  public:
    SpawnPlan() {
        ::posix_spawn_file_actions_init(&files_);
        ::posix_spawnattr_init(&attributes_);
        sigset_t signals;
        ::sigemptyset(&signals);
        ::posix_spawnattr_setsigmask(&attributes_, &signals);
        ::sigfillset(&signals);
        ::posix_spawnattr_setsigdefault(&attributes_, &signals);
        ::posix_spawnattr_setflags(&attributes_, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
    }
    SpawnPlan(const SpawnPlan&) = delete;
    ~SpawnPlan() {
        ::posix_spawn_file_actions_destroy(&files_);
        ::posix_spawnattr_destroy(&attributes_);
    }

    /// Duplicates `source` for the child; false when there are no descriptors left.
    bool give(int source, int target) {
        sources_.push_back(outOfTheWay(source));
        return sources_.back() &&
               ::posix_spawn_file_actions_adddup2(&files_, sources_.back().get(), target) == 0;
    }
    int run(const char* program, char* const argv[], pid_t& pid) {
        static char path[] = "PATH=/usr/bin:/bin";
        static char* const environment[] = {path, nullptr};
        ::posix_spawn_file_actions_addclosefrom_np(&files_, kGateFd + 1);
        return ::posix_spawn(&pid, program, &files_, &attributes_, argv, environment);
    }

  private:
    posix_spawn_file_actions_t files_;
    posix_spawnattr_t attributes_;
    std::vector<UniqueFd> sources_;
};

}  // namespace

Result<SandboxedProcess> SandboxedProcess::spawn(const std::string& program,
                                                 const std::vector<std::string>& arguments,
                                                 const std::vector<std::string>& command,
                                                 const UniqueFd& connection) {
    if (::access(program.c_str(), X_OK) != 0)
        return Error::posix(errno, "cannot confine plug-ins without " + program);
    std::vector<std::string> words{program,
                                   "--args",
                                   std::to_string(kArgumentsFd),
                                   "--info-fd",
                                   std::to_string(kInfoFd),
                                   "--block-fd",
                                   std::to_string(kGateFd),
                                   "--"};
    words.insert(words.end(), command.begin(), command.end());
    std::vector<char*> argv;
    for (std::string& word : words) argv.push_back(word.data());
    argv.push_back(nullptr);

    Pipe info, gate, output;
    const UniqueFd file = fileOf(arguments);
    const UniqueFd null(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    SpawnPlan plan;
    const bool ready =
        file && null && info.open() && gate.open() && output.open() &&
        plan.give(null.get(), STDIN_FILENO) && plan.give(output.writeEnd.get(), STDOUT_FILENO) &&
        plan.give(output.writeEnd.get(), STDERR_FILENO) &&
        plan.give(connection.get(), kConnectionDescriptor) && plan.give(file.get(), kArgumentsFd) &&
        plan.give(info.writeEnd.get(), kInfoFd) && plan.give(gate.readEnd.get(), kGateFd);
    if (!ready) return Error::posix(errno, "cannot start " + program);

    SandboxedProcess process;
    if (const int failure = plan.run(program.c_str(), argv.data(), process.pid))
        return Error::posix(failure, "cannot start " + program);
    process.pidFd.reset(static_cast<int>(::syscall(SYS_pidfd_open, process.pid, 0)));
    if (!process.pidFd) {
        const int failure = errno;
        ::kill(process.pid, SIGKILL);
        ::waitpid(process.pid, nullptr, 0);
        return Error::posix(failure, "cannot watch " + program);
    }
    process.info = std::move(info.readEnd);
    process.gate = std::move(gate.writeEnd);
    process.output = std::move(output.readEnd);
    makeNonBlocking(process.info);
    makeNonBlocking(process.output);
    return process;
}

}  // namespace platform::spawnerd
