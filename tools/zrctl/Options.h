#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <variant>
#include <vector>

namespace zrctl {

/// How the plug-ins of a match are written.
enum class Format { Table, Long, Json, PropertyList };

/// The command line, taken apart. A plain value.
struct Options {
    enum class Command { Match, Add, Remove };

    std::string service;
    Command command = Command::Match;

    // match
    std::vector<std::string> rules;  // KEY=PATTERN, as given
    std::optional<std::string> rulesFile;
    std::uint64_t flags = 0;
    Format format = Format::Table;

    // add, remove
    std::vector<std::string> paths;  // as given

    /// Reads the command line; or, when there is nothing (more) to do, the exit status: the help,
    /// the version or the complaint has been written then.
    static std::variant<Options, int> parse(int argc, const char* const* argv);
};

}  // namespace zrctl
