#pragma once

#include <map>
#include <optional>
#include <set>
#include <string>

#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"
#include "platform/tandry/ContainerOwners.h"
#include "platform/tandry/TDPlugInProxy.h"

namespace platform::tandry {

/// Makes what is missing of the data container at a path: itself, its `tmp`, and the folder of all
/// containers. From any thread. Errors: the system's; ENOTDIR or EPERM when what is there is not a
/// directory of this user's own.
std::optional<Error> makeContainer(const std::string& path);

/// The plug-ins' data containers: one directory, with a `tmp` inside, for a plug-in identifier and
/// the application that it lies in (see ContainerOwners.h), under <data>/zorvan/Containers. Belongs
/// to the registry's thread.
///
/// The folder of all is opened for each walk, so that what was moved away is not used any more.
class DataContainers {
  public:
    /// The folder of the containers is made at the first need; their owners are stored beside it.
    explicit DataContainers(const std::string& dataFolder);

    /// To be called before each walk, and before anything else at a start, as long as there are
    /// descriptors: learns whose containers are.
    void beginWalk();
    /// To be called when the walk has met everything.
    void endWalk() { folder_.reset(); }

    /// The path of the container of a plug-in, whose record is complete but for that. None, and an
    /// error line for each new reason, when what is there is not a directory of this user's own,
    /// when containers cannot be made, or when their owners cannot be read. `isRemembered` is the
    /// claim's. Error: nobody can tell just now.
    ///
    /// The first container that is missing is made at once, so that what keeps containers from
    /// being made shows before anybody is told of one. The others are left to `makeMissing`: making
    /// them costs more than anything else in a first scan.
    Result<std::optional<std::string>> locate(const TDPlugInProxy& plugIn, bool isRemembered);

    /// To be called at the end of each walk, before anybody is told of a container: stores to whom
    /// `locate` has given which.
    void saveOwners() { owners_.save(); }

    /// Makes what `locate` has left to be made. Answers the paths of those that could not be made
    /// after all, each with an error line.
    std::set<std::string> makeMissing();

  private:
    enum class State { Whole, Missing, Impossible };

    int faultOf(const std::string& name) const;
    bool hasTemporary(const std::string& name) const;
    Result<State> stateOf(const std::string& name);
    bool make(const std::string& path);
    void fail(std::optional<Error> failure);
    void complain(const std::string& path, const std::string& problem);

    std::string root_;
    UniqueFd folder_;  // none when there is none yet, or no descriptor
    ContainerOwners owners_;
    std::optional<Error> failure_;             // why this walk has no containers
    std::set<std::string> missing_;            // paths
    bool canMake_ = false;                     // since the last `makeMissing`
    std::map<std::string, std::string> told_;  // what the log was told last, by path
};

}  // namespace platform::tandry
