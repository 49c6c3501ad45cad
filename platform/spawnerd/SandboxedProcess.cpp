#include "platform/spawnerd/SandboxedProcess.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <iterator>
#include <string_view>

#include "platform/spawnerd/ChildProcess.h"
#include "platform/spawnerd/Protocol.h"
#include "platform/spawnerd/SandboxProfile.h"
#include "platform/spawnerd/SystemCallFilter.h"

namespace platform::spawnerd {

namespace {

/// Descriptors of the child, behind the plug-in's connection. bubblewrap closes them, and the
/// directories, before it runs the plug-in.
constexpr int kArgumentsFd = kConnectionDescriptor + 1;
constexpr int kInfoFd = kArgumentsFd + 1;
constexpr int kGateFd = kInfoFd + 1;
constexpr int kFilterFd = kGateFd + 1;
static_assert(kFilterFd < kFirstDirectoryDescriptor);

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

/// A file to be read from its beginning.
UniqueFd fileWith(std::string_view rest) {
    UniqueFd file(::memfd_create("plug-in", MFD_CLOEXEC));
    if (!file) return file;
    while (!rest.empty()) {
        const ssize_t count = ::write(file.get(), rest.data(), rest.size());
        if (count < 0) return UniqueFd();
        rest.remove_prefix(static_cast<std::size_t>(count));
    }
    ::lseek(file.get(), 0, SEEK_SET);
    return file;
}

/// The arguments as bubblewrap reads them from a descriptor: what a plug-in asks for never stands
/// in a command line of ours, nor in an environment.
UniqueFd fileOf(const std::vector<std::string>& arguments) {
    std::string bytes;
    for (const std::string& argument : arguments) bytes.append(argument).push_back('\0');
    return fileWith(bytes);
}

}  // namespace

Result<SandboxedProcess> SandboxedProcess::spawn(const std::string& program,
                                                 const SandboxSetup& setup,
                                                 const std::vector<std::string>& command,
                                                 const UniqueFd& connection) {
    if (::access(program.c_str(), X_OK) != 0)
        return Error::posix(errno, "cannot confine plug-ins without " + program);
    const Result<std::string>& systemCalls = systemCallFilter();
    if (!systemCalls) return systemCalls.error();
    std::vector<std::string> words{program,
                                   "--args",
                                   std::to_string(kArgumentsFd),
                                   "--info-fd",
                                   std::to_string(kInfoFd),
                                   "--block-fd",
                                   std::to_string(kGateFd),
                                   "--seccomp",
                                   std::to_string(kFilterFd),
                                   "--"};
    words.insert(words.end(), command.begin(), command.end());
    std::vector<char*> argv;
    argv.reserve(words.size() + 1);
    for (std::string& word : words) argv.push_back(word.data());
    argv.push_back(nullptr);

    Pipe info, gate, output;
    const UniqueFd file = fileOf(setup.arguments), filter = fileWith(*systemCalls);
    const UniqueFd null(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    const int afterLast = kFirstDirectoryDescriptor + static_cast<int>(setup.directories.size());
    ChildProcess child(afterLast - 1);
    bool ready = file && filter && null && info.open() && gate.open() && output.open() &&
                 child.give(null.get(), STDIN_FILENO) &&
                 child.give(output.writeEnd.get(), STDOUT_FILENO) &&
                 child.give(output.writeEnd.get(), STDERR_FILENO) &&
                 child.give(connection.get(), kConnectionDescriptor) &&
                 child.give(file.get(), kArgumentsFd) && child.give(info.writeEnd.get(), kInfoFd) &&
                 child.give(gate.readEnd.get(), kGateFd) && child.give(filter.get(), kFilterFd);
    for (std::size_t i = 0; i < setup.directories.size(); ++i)
        ready = ready && child.give(setup.directories[i].get(),
                                    kFirstDirectoryDescriptor + static_cast<int>(i));
    if (!ready) return Error::posix(errno, "cannot start " + program);

    SandboxedProcess process;
    static char path[] = "PATH=/usr/bin:/bin";
    static char* const environment[] = {path, nullptr};
    const Result<pid_t> pid = child.run(program.c_str(), argv.data(), environment);
    if (!pid) return Error::posix(pid.error().code, "cannot start " + program);
    process.pid = *pid;
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
