#include "platform/spawnerd/SandboxedProcess.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

#include "platform/spawnerd/Protocol.h"
#include "platform/spawnerd/SandboxProfile.h"
#include "platform/spawnerd/SystemCallFilter.h"
#include "platform/system/Files.h"

namespace platform::spawnerd {

namespace {

/// Descriptors of the child, behind the plug-in's connection. bubblewrap closes them, and those
/// of the setup, before it runs the plug-in.
constexpr int kArgumentsFd = kConnectionDescriptor + 1;
constexpr int kInfoFd = kArgumentsFd + 1;
constexpr int kGateFd = kInfoFd + 1;
constexpr int kFilterFd = kGateFd + 1;
static_assert(kFilterFd < kFirstSetupDescriptor);

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
    return memoryFile(bytes);
}

}  // namespace

Result<SandboxedProcess> SandboxedProcess::spawn(const Keeper& keeper, const std::string& program,
                                                 const SandboxSetup& setup,
                                                 const std::vector<std::string>& command,
                                                 const UniqueFd& connection) {
    if (::access(program.c_str(), X_OK) != 0)
        return Error::posix(errno, "cannot confine plug-ins without " + program);
    const Result<std::string> systemCalls = systemCallFilter();
    if (!systemCalls) return systemCalls.error();
    Pipe info, gate, output;
    const UniqueFd file = fileOf(setup.arguments), filter = memoryFile(*systemCalls);
    const UniqueFd null(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    if (!file || !filter || !null || !info.open() || !gate.open() || !output.open())
        return Error::posix(errno, "cannot start " + program);
    // bubblewrap takes the end of the gate's pipe for a word to go on: so it holds the pipe open
    // itself, and what nobody lets through stays before it.
    const UniqueFd gateEnd(::open(("/proc/self/fd/" + std::to_string(gate.readEnd.get())).c_str(),
                                  O_RDWR | O_CLOEXEC));
    if (!gateEnd) return Error::posix(errno, "cannot start " + program);
    Keeper::Order order{.words = {program, "--args", std::to_string(kArgumentsFd), "--info-fd",
                                  std::to_string(kInfoFd), "--block-fd", std::to_string(kGateFd),
                                  "--seccomp", std::to_string(kFilterFd), "--"},
                        .descriptors = {{null.get(), STDIN_FILENO},
                                        {output.writeEnd.get(), STDOUT_FILENO},
                                        {output.writeEnd.get(), STDERR_FILENO},
                                        {connection.get(), kConnectionDescriptor},
                                        {file.get(), kArgumentsFd},
                                        {info.writeEnd.get(), kInfoFd},
                                        {gateEnd.get(), kGateFd},
                                        {filter.get(), kFilterFd}}};
    order.words.insert(order.words.end(), command.begin(), command.end());
    for (int number = kFirstSetupDescriptor; const UniqueFd& descriptor : setup.descriptors)
        order.descriptors.emplace_back(descriptor.get(), number++);
    Result<Keeper::Child> child = keeper.run(order);
    if (!child) return Error::posix(child.error().code, "cannot start " + program);
    SandboxedProcess process;
    process.child = std::move(*child);
    process.info = std::move(info.readEnd);
    process.gate = std::move(gate.writeEnd);
    process.output = std::move(output.readEnd);
    makeNonBlocking(process.info);
    makeNonBlocking(process.output);
    return process;
}

}  // namespace platform::spawnerd
