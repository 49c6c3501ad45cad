#pragma once

#include <string>
#include <utility>

namespace zrctl {

/// Exit statuses.
inline constexpr int kDone = 0;
inline constexpr int kNothingFound = 1;
inline constexpr int kUsageError = 2;
inline constexpr int kFailure = 3;

/// What a command came to: its exit status, the text for standard output and, unless empty, one
/// line for standard error.
struct Outcome {
    int status = kDone;
    std::string output;
    std::string complaint;

    static Outcome failure(std::string complaint) { return {kFailure, {}, std::move(complaint)}; }
    static Outcome usage(std::string complaint) { return {kUsageError, {}, std::move(complaint)}; }
};

/// Writes a text to standard output, at once. Done, or why not; a reader that has gone away
/// (`| head`) is no failure.
Outcome writeOut(const std::string& text);

}  // namespace zrctl
