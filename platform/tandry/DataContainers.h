#pragma once

#include <optional>
#include <string>
#include <vector>

#include "platform/UniqueFd.h"

namespace platform::tandry {

/// The plug-ins' data containers: one directory a plug-in identifier, with a `tmp` inside, under
/// <data>/zorvan/Containers. Belongs to the registry's thread.
class DataContainers {
  public:
    /// `root` is made at the first need.
    explicit DataContainers(std::string root);

    /// The path of the container of an identifier (a safe file name). None, and an error line, when
    /// what is there is not a directory of this user's own, or containers cannot be made at all.
    std::optional<std::string> locate(const std::string& identifier);

    /// Makes the containers that `locate` has missed, which costs more than anything else in a
    /// first scan and so is left until lookups have their answers. Failures are logged.
    void makeMissing();

  private:
    bool openRoot();

    std::string root_;
    UniqueFd folder_;
    std::vector<std::string> missing_;
};

}  // namespace platform::tandry
