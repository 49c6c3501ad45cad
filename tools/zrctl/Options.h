#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "tools/zrctl/Outcome.h"

namespace zrctl {

/// How the plug-ins of a match are written.
enum class Format { Table, Long, Json, PropertyList };

/// The command line, taken apart. A plain value.
struct Options {
    enum class Command {
        Match,
        Add,
        Remove,
        Elect,
        Annotate,
        Watch,
        Ready,
        Access,
        Run,
        Hold,
        Release,
        ExcludeList,
        ExcludeAdd,
        ExcludeRemove
    };

    std::string service;
    Command command = Command::Match;

    // match, exclude
    std::vector<std::string> rules;  // KEY=PATTERN, as given

    // match, hold
    std::uint64_t flags = 0;

    // match
    std::optional<std::string> rulesFile;
    Format format = Format::Table;

    // add, remove, hold
    std::vector<std::string> paths;  // as given

    // elect, annotate, ready, access, run
    std::vector<std::string> plugIns;  // as given; for annotate, with its KEY=VALUE among them

    // elect, annotate
    int election = 0;
    bool replace = false;

    std::vector<std::string> arguments;  // run
    std::vector<std::string> tokens;     // release

    /// Reads the command line; or, when there is nothing (more) to do, what that comes to: the
    /// help, the version, or wrong usage, of which standard error has been told then.
    static std::variant<Options, Outcome> parse(int argc, const char* const* argv);
};

}  // namespace zrctl
