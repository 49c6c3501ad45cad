#include "tools/zrctl/Relay.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <utility>

using platform::Error;
using platform::Result;

namespace zrctl {

namespace {

bool isToBeRepeated(int errnum) {
    return errnum == EINTR || errnum == EAGAIN;
}

}  // namespace

void Relay::Stream::read() {
    char buffer[PIPE_BUF];
    const ssize_t count = ::read(from, buffer, sizeof buffer);
    if (count > 0)
        pending.assign(buffer, static_cast<std::size_t>(count));
    else if (count == 0 || !isToBeRepeated(errno))
        atEnd = true;
}

int Relay::Stream::write() {
    const ssize_t count = ::write(to, pending.data(), pending.size());
    if (count < 0) return isToBeRepeated(errno) ? 0 : errno;
    pending.erase(0, static_cast<std::size_t>(count));
    return 0;
}

Relay::Relay(platform::UniqueFd connection)
    : connection_(std::move(connection)),
      input_{STDIN_FILENO, connection_.get()},
      output_{connection_.get(), STDOUT_FILENO} {
    // The socket is ours alone, unlike the other two: a full one must not keep its answers waiting.
    const int flags = ::fcntl(connection_.get(), F_GETFL);
    ::fcntl(connection_.get(), F_SETFL, flags | O_NONBLOCK);
}

void Relay::moveInput(bool readable, bool writable) {
    if (input_.isDone()) return;
    if (readable) input_.read();
    if (writable && input_.write() != 0) input_ = {input_.from, input_.to, {}, true};
    if (input_.isDone()) ::shutdown(connection_.get(), SHUT_WR);
}

std::optional<Error> Relay::moveOutput(bool readable, bool writable) {
    if (readable) output_.read();
    const int failure = writable ? output_.write() : 0;
    if (failure == 0) return std::nullopt;
    if (failure != EPIPE) return Error::posix(failure, "cannot write");
    // Nobody reads any more. The plug-in learns of it when it writes on.
    output_ = {output_.from, output_.to, {}, true};
    ::shutdown(connection_.get(), SHUT_RD);
    return std::nullopt;
}

Result<bool> Relay::run(int ended, int stop) {
    for (bool hasEnded = false; !hasEnded || !output_.isDone();) {
        // What is not waited for is left out: an end would be told again and again.
        const auto when = [](bool condition, int descriptor) {
            return condition ? descriptor : -1;
        };
        const bool sends = !input_.pending.empty(), receives = output_.reads();
        const short events = static_cast<short>((sends ? POLLOUT : 0) | (receives ? POLLIN : 0));
        pollfd waited[] = {{stop, POLLIN, 0},
                           {when(!hasEnded, ended), POLLIN, 0},
                           {when(!hasEnded && input_.reads(), input_.from), POLLIN, 0},
                           {when(sends || receives, connection_.get()), events, 0},
                           {when(!output_.pending.empty(), output_.to), POLLOUT, 0}};
        if (::poll(waited, std::size(waited), -1) < 0) {
            if (errno == EINTR) continue;
            return Error::posix(errno, "poll");
        }
        if (waited[0].revents) return false;
        hasEnded = hasEnded || waited[1].revents;
        constexpr short kBroken = POLLHUP | POLLERR | POLLNVAL;
        const short peer = waited[3].revents;
        moveInput(waited[2].revents, sends && (peer & (POLLOUT | kBroken)));
        auto failure = moveOutput(receives && (peer & (POLLIN | kBroken)), waited[4].revents);
        if (failure) return *std::move(failure);
    }
    return true;
}

}  // namespace zrctl
