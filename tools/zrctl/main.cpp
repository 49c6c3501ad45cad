#include <fmt/core.h>

#include <csignal>
#include <cstdio>
#include <cstdlib>

#include "platform/system/Process.h"
#include "tools/zrctl/AnnotationCommands.h"
#include "tools/zrctl/ExcludeCommand.h"
#include "tools/zrctl/HoldCommands.h"
#include "tools/zrctl/MatchCommand.h"
#include "tools/zrctl/Options.h"
#include "tools/zrctl/Outcome.h"
#include "tools/zrctl/ReadyCommands.h"
#include "tools/zrctl/RegistrationCommands.h"
#include "tools/zrctl/RunCommand.h"
#include "tools/zrctl/Terminal.h"
#include "tools/zrctl/WatchCommand.h"

namespace {

zrctl::Outcome run(const zrctl::Options& options) {
    using Command = zrctl::Options::Command;
    switch (options.command) {
        case Command::Match:
            return zrctl::runMatch(options);
        case Command::Add:
        case Command::Remove:
            return zrctl::runRegistration(options);
        case Command::Elect:
            return zrctl::runElect(options);
        case Command::Annotate:
            return zrctl::runAnnotate(options);
        case Command::Watch:
            return zrctl::runWatch();
        case Command::Ready:
            return zrctl::runReady(options);
        case Command::Access:
            return zrctl::runAccess(options);
        case Command::Run:
            return zrctl::runPlugIn(options);
        case Command::Hold:
            return zrctl::runHold(options);
        case Command::Release:
            return zrctl::runRelease(options);
        case Command::ExcludeList:
        case Command::ExcludeAdd:
        case Command::ExcludeRemove:
            return zrctl::runExclude(options);
    }
    return {};
}

/// Writes what a command has to say.
int finish(zrctl::Outcome outcome) {
    const zrctl::Outcome written = zrctl::writeOut(outcome.output);
    if (written.status != zrctl::kDone) outcome = written;
    if (outcome.complaint.empty()) return outcome.status;
    const std::string line = fmt::format("zrctl: {}\n", zrctl::terminal::safe(outcome.complaint));
    // Where nobody can be told the status says enough.
    std::fwrite(line.data(), 1, line.size(), stderr);
    return outcome.status;
}

}  // namespace

int main(int argc, char** argv) {
    platform::openStandardDescriptors();
    std::signal(SIGPIPE, SIG_IGN);
    zrctl::terminal::useUtf8();
    // The library's lines about connections would say again what the commands say themselves.
    setenv("ZR_LOG", "off", 0);
    const auto parsed = zrctl::Options::parse(argc, argv);
    if (const auto* outcome = std::get_if<zrctl::Outcome>(&parsed)) return finish(*outcome);
    return finish(run(std::get<zrctl::Options>(parsed)));
}
