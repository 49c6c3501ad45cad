#include "platform/threads/TerminationWatch.h"

#include <sys/signalfd.h>
#include <unistd.h>

#include <csignal>
#include <utility>

namespace platform {

namespace {

UniqueFd openSignals() {
    sigset_t asking;
    ::sigemptyset(&asking);
    ::sigaddset(&asking, SIGTERM);
    ::sigaddset(&asking, SIGINT);
    UniqueFd signals(::signalfd(-1, &asking, SFD_CLOEXEC | SFD_NONBLOCK));
    // Without a descriptor to tell, they end the process as ever.
    if (signals) ::pthread_sigmask(SIG_BLOCK, &asking, nullptr);
    return signals;
}

}  // namespace

TerminationWatch::TerminationWatch(RunLoop& loop, std::function<void()> asked)
    : asked_(std::move(asked)), signals_(openSignals()), watch_(loop, signals_.get()) {
    await();
}

void TerminationWatch::await() {
    watch_.awaitReadable([this] {
        signalfd_siginfo signal;
        const bool isAsked = ::read(signals_.get(), &signal, sizeof signal) == sizeof signal;
        await();
        if (isAsked) asked_();
    });
}

}  // namespace platform
