#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace zorvan {

/// The daemon's options.
struct CommandLine {
    std::string serviceName;
    std::optional<std::string> databasePath;
    std::uint32_t cacheLimit = 1'000'000;
    std::uint32_t verbose = 0;

    /// Reads `-S service`, `-d path`, `-c number` and `-v`; a later occurrence overrides an earlier
    /// one. None, after the usage text on standard error, for anything else.
    static std::optional<CommandLine> parse(int argc, char* const argv[]);
};

}  // namespace zorvan
