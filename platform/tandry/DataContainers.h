#pragma once

#include <optional>
#include <set>
#include <string>

#include "platform/system/UniqueFd.h"
#include "platform/tandry/ContainerOwners.h"
#include "platform/tandry/TDPlugInProxy.h"

namespace platform::tandry {

/// The plug-ins' data containers: one directory, with a `tmp` inside, for a plug-in identifier and
/// the application that it lies in (see ContainerOwners.h), under <data>/zorvan/Containers. Belongs
/// to the registry's thread.
class DataContainers {
  public:
    /// The folder of the containers is made at the first need; their owners are stored beside it.
    explicit DataContainers(const std::string& dataFolder);

    /// The path of the container of a plug-in, whose record is complete but for that. None, and an
    /// error line, when what is there is not a directory of this user's own, when containers cannot
    /// be made, or when their owners cannot be read. `isRemembered` is the claim's.
    ///
    /// The first container that is missing is made at once, so that what keeps containers from
    /// being made shows before anybody is told of one. The others are left to `makeMissing`: making
    /// them costs more than anything else in a first scan.
    std::optional<std::string> locate(const TDPlugInProxy& plugIn, bool isRemembered);
    /// Whether the container of a record is still the plug-in's own.
    bool isOwn(const TDPlugInProxy& plugIn) const;

    /// To be called at the end of each walk, before anybody is told of a container: stores to whom
    /// `locate` has given which.
    void saveOwners() { owners_.save(); }

    /// Makes what `locate` has left to be made. Answers the paths of those that could not be made
    /// after all, each with an error line.
    std::set<std::string> makeMissing();

  private:
    enum class State { Whole, Missing, Impossible };

    bool open();
    bool make(const std::string& name);
    State stateOf(const std::string& name);
    void refuse(const std::string& name, int errnum);

    std::string root_;
    ContainerOwners owners_;
    UniqueFd folder_;
    std::set<std::string> missing_;  // names
    bool canMake_ = false;           // since the last `makeMissing`
    std::string problem_;            // what the log was told last
};

}  // namespace platform::tandry
