#include "tools/zrctl/Interruption.h"

#include <sys/eventfd.h>
#include <sys/signalfd.h>

#include <cerrno>
#include <csignal>

using platform::Error;
using platform::Result;
using platform::UniqueFd;

namespace zrctl {

Result<UniqueFd> interruption() {
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGINT);
    sigaddset(&signals, SIGTERM);
    sigprocmask(SIG_BLOCK, &signals, nullptr);
    UniqueFd descriptor(::signalfd(-1, &signals, SFD_CLOEXEC));
    if (!descriptor) return Error::posix(errno, "signalfd");
    return descriptor;
}

Result<std::shared_ptr<const Event>> Event::make() {
    UniqueFd descriptor(::eventfd(0, EFD_CLOEXEC));
    if (!descriptor) return Error::posix(errno, "eventfd");
    return std::shared_ptr<const Event>(new Event(std::move(descriptor)));
}

void Event::happen() const {
    ::eventfd_write(descriptor_.get(), 1);
}

}  // namespace zrctl
