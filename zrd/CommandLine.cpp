#include "zrd/CommandLine.h"

#include <getopt.h>

#include <cstdio>
#include <cstdlib>

#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"

namespace zorvan {

namespace {

std::nullopt_t usage() {
    std::fputs("Usage: zrd [-S servicename] [-v]\n", stderr);
    return std::nullopt;
}

}  // namespace

std::optional<CommandLine> CommandLine::parse(int argc, char* const argv[]) {
    CommandLine line;
    line.serviceName = kDefaultServiceName;
    optind = 0;  // starts the scanner afresh
    opterr = 0;  // the usage text says it all
    for (int option; (option = getopt(argc, argv, "c:d:S:v")) != -1;) {
        switch (option) {
            case 'c':
                // No range check: whatever the text holds, a number comes of it.
                line.cacheLimit = static_cast<std::uint32_t>(std::strtol(optarg, nullptr, 10));
                break;
            case 'd':
                line.databasePath = optarg;
                break;
            case 'S':
                line.serviceName = optarg;
                break;
            case 'v':
                ++line.verbose;
                EVLOG_ERROR(platform::Log::defaultHandle(),
                            "verbose option -v is ineffective; use log config --subsystem "
                            "com.orbel.zorvan");
                break;
            default:
                return usage();
        }
    }
    if (optind < argc) return usage();
    return line;
}

}  // namespace zorvan
