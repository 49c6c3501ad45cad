#pragma once

#include <optional>
#include <string>

#include "platform/UniqueFd.h"

namespace platform::tandry {

/// The plug-ins' data containers: one directory a plug-in identifier, with a `tmp` inside, under
/// <data>/zorvan/Containers. Belongs to the registry's thread.
class DataContainers {
  public:
    /// `root` is made at the first need.
    explicit DataContainers(std::string root);

    /// The path of the container of an identifier (a safe file name), made if it is missing. None,
    /// and an error line, when it cannot be made or is not a directory of this user's own.
    std::optional<std::string> prepare(const std::string& identifier);

  private:
    bool openRoot();

    std::string root_;
    UniqueFd folder_;
};

}  // namespace platform::tandry
