#pragma once

#include <optional>
#include <set>
#include <string>

#include "platform/UniqueFd.h"

namespace platform::tandry {

/// The plug-ins' data containers: one directory a plug-in identifier, with a `tmp` inside, under
/// <data>/zorvan/Containers. Belongs to the registry's thread.
class DataContainers {
  public:
    /// `root` is made at the first need.
    explicit DataContainers(std::string root);

    /// The path of the container of an identifier (a safe file name). None, and an error line, when
    /// what is there is not a directory of this user's own, or containers cannot be made.
    ///
    /// The first container that is missing is made at once, so that what keeps containers from
    /// being made shows before anybody is told of one. The others are left to `makeMissing`: making
    /// them costs more than anything else in a first scan.
    std::optional<std::string> locate(const std::string& identifier);

    /// Makes what `locate` has left to be made. Answers the identifiers of those that could not be
    /// made after all, each with an error line.
    std::set<std::string> makeMissing();

  private:
    enum class State { Whole, Missing, Impossible };

    bool openRoot();
    bool make(const std::string& identifier);
    State stateOf(const std::string& identifier);
    void refuse(const std::string& identifier, int errnum);

    std::string root_;
    UniqueFd folder_;
    std::set<std::string> missing_;
    bool canMake_ = false;     // since the last `makeMissing`
    std::string rootProblem_;  // what the log was told last
};

}  // namespace platform::tandry
