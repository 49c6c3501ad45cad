#include "tools/zrctl/WatchCommand.h"

#include <fmt/core.h>
#include <poll.h>
#include <time.h>

#include <cerrno>
#include <cstdint>

#include "Zorvan/Keys.h"
#include "platform/services/NotificationListener.h"
#include "platform/system/Directories.h"
#include "tools/zrctl/Interruption.h"
#include "tools/zrctl/Json.h"

using platform::Error;
using platform::NotificationListener;
using platform::Result;
using platform::UniqueFd;

namespace zrctl {

namespace {

std::string lines(std::uint64_t count) {
    const std::string line =
        fmt::format("{} {}\n", dateText({static_cast<double>(::time(nullptr))}),
                    zorvan::kAnnotationChangeNotification);
    std::string text;
    for (; count > 0; --count) text += line;
    return text;
}

}  // namespace

Outcome runWatch() {
    const Result<UniqueFd> end = interruption();
    Result<NotificationListener> listener = NotificationListener::make(
        platform::Directories::fromEnvironment(), zorvan::kAnnotationChangeNotification);
    if (!listener) return Outcome::failure(listener.error().text);
    if (!end) return Outcome::failure(end.error().text);

    // Of the output only its end is waited for: a pipe that nobody reads any more.
    pollfd waited[] = {{listener->descriptor(), POLLIN, 0}, {end->get(), POLLIN, 0}, {1, 0, 0}};
    for (;;) {
        if (::poll(waited, 3, -1) < 0 && errno != EINTR)
            return Outcome::failure(Error::posix(errno, "poll").text);
        const Result<std::uint64_t> posts = listener->take();
        if (!posts) return Outcome::failure(posts.error().text);
        if (Outcome written = writeOut(lines(*posts)); written.status != kDone) return written;
        if (waited[1].revents || waited[2].revents) return {};
    }
}

}  // namespace zrctl
