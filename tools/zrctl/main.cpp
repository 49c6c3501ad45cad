#include <fmt/core.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "tools/zrctl/MatchCommand.h"
#include "tools/zrctl/Options.h"
#include "tools/zrctl/Outcome.h"
#include "tools/zrctl/RegistrationCommands.h"
#include "tools/zrctl/Terminal.h"

namespace {

zrctl::Outcome run(const zrctl::Options& options) {
    if (options.command == zrctl::Options::Command::Match) return zrctl::runMatch(options);
    return zrctl::runRegistration(options);
}

/// Writes what a command has to say. A reader that has gone away (`| head`) is no failure.
int finish(zrctl::Outcome outcome) {
    const bool written = std::fwrite(outcome.output.data(), 1, outcome.output.size(), stdout) ==
                             outcome.output.size() &&
                         std::fflush(stdout) == 0;
    if (!written && errno != EPIPE)
        outcome = zrctl::Outcome::failure(std::string("cannot write: ") + std::strerror(errno));
    if (!outcome.complaint.empty())
        fmt::print(stderr, "zrctl: {}\n", zrctl::terminal::safe(outcome.complaint));
    return outcome.status;
}

}  // namespace

int main(int argc, char** argv) {
    std::signal(SIGPIPE, SIG_IGN);
    zrctl::terminal::useUtf8();
    // The library's lines about connections would say again what the commands say themselves.
    setenv("ZR_LOG", "off", 0);
    const auto parsed = zrctl::Options::parse(argc, argv);
    if (const int* status = std::get_if<int>(&parsed)) return *status;
    return finish(run(std::get<zrctl::Options>(parsed)));
}
