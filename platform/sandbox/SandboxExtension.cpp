#include "platform/sandbox/SandboxExtension.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <string_view>
#include <system_error>

#include "platform/log/OpsLog.h"
#include "platform/lum/Listener.h"
#include "platform/sandbox/MountProcess.h"
#include "platform/sandbox/SandboxTokens.h"
#include "platform/system/Directories.h"
#include "platform/system/UniqueFd.h"

namespace platform {

namespace {

// Longer than a broker takes at its slowest.
constexpr timeval kPatience{20, 0};
// Below lie the standard streams, which a caller may have closed and want back, and 0, which is no
// handle.
constexpr int kLeastHandle = 3;

/// The outcome of a call with a limit of time, which a signal ends early, and even a stop of the
/// process that it knows nothing of.
template <class Call>
ssize_t uninterrupted(Call call) {
    ssize_t outcome = -1;
    do {
        outcome = call();
    } while (outcome < 0 && errno == EINTR);
    return outcome;
}

UniqueFd connectTo(const std::string& path) {
    UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, path.data(), path.size());
    if (!socket ||
        ::setsockopt(socket.get(), SOL_SOCKET, SO_SNDTIMEO, &kPatience, sizeof kPatience) != 0 ||
        ::setsockopt(socket.get(), SOL_SOCKET, SO_RCVTIMEO, &kPatience, sizeof kPatience) != 0 ||
        uninterrupted([&] {
            return ::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address),
                             sizeof address);
        }) != 0)
        return {};
    return socket;
}

/// The descriptor of the one answer; without one, errno says why.
UniqueFd receiveAnswer(int socket) {
    char line[16];
    int received = -1;
    iovec data{line, sizeof line};
    // Room for one descriptor: the kernel keeps what else a false broker sends.
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof received)] = {};
    msghdr message{};
    message.msg_iov = &data;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    const ssize_t count =
        uninterrupted([&] { return ::recvmsg(socket, &message, MSG_CMSG_CLOEXEC); });
    if (count < 0) return {};
    const cmsghdr* header = CMSG_FIRSTHDR(&message);
    if (header && header->cmsg_level == SOL_SOCKET && header->cmsg_type == SCM_RIGHTS &&
        header->cmsg_len == CMSG_LEN(sizeof received))
        std::memcpy(&received, CMSG_DATA(header), sizeof received);
    UniqueFd descriptor(received);
    const std::string_view answer(line, static_cast<std::size_t>(count));
    if (descriptor && answer == MountProcess::kGranted) return descriptor;
    errno = std::atoi(std::string(answer).c_str());
    if (errno == 0) errno = ECONNABORTED;
    return {};
}

UniqueFd consume(const std::string& token) {
    const auto service = SandboxTokens::serviceOf(token);
    const auto path =
        service ? lum::socketPath(Directories::fromEnvironment(), sandboxServiceName(*service))
                : Result<std::string>(Error::posix(EINVAL, "token"));
    if (!path) {
        errno = path.error().code;
        return {};
    }
    const UniqueFd socket = connectTo(*path);
    const std::string line = token + "\n";
    const auto send = [&] { return ::send(socket.get(), line.data(), line.size(), MSG_NOSIGNAL); };
    if (!socket || uninterrupted(send) != static_cast<ssize_t>(line.size())) return {};
    return receiveAnswer(socket.get());
}

}  // namespace

std::int64_t consumeExtension(const std::string& token) {
    UniqueFd descriptor = consume(token);
    if (descriptor && descriptor.get() < kLeastHandle)
        descriptor.reset(::fcntl(descriptor.get(), F_DUPFD_CLOEXEC, kLeastHandle));
    if (!descriptor) {
        EVLOG_INFO(ops(), "sandbox extension is not granted: {}",
                   pub(std::generic_category().message(errno)));
        return 0;
    }
    return descriptor.release();
}

void releaseExtension(std::int64_t handle) {
    if (handle != 0) UniqueFd(static_cast<int>(handle));
}

}  // namespace platform
