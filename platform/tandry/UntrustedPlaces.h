#pragma once

#include <string>
#include <unordered_map>
#include <vector>

#include "platform/system/FileIdentity.h"

namespace platform {

struct Directories;

namespace tandry {

/// The places from which no bundle is ever taken, whoever asks for it: the data containers, the
/// assertion folders and the runtime directory. Confined processes write there, and what they wrote
/// must never run with other rights than theirs. Belongs to the registry's thread.
///
/// A directory is told by its device and inode, whatever names and links lead to it.
class UntrustedPlaces {
  public:
    explicit UntrustedPlaces(const Directories& directories);

    /// To be called before each walk, and before the first question: a directory is looked at once
    /// a walk.
    void beginWalk();

    /// The place that a canonical path is or lies in, named for people ("a data container"); null
    /// when it lies in none.
    const char* around(const std::string& path);
    /// The same for a path where somebody has found that very directory.
    const char* around(const std::string& path, const FileIdentity& directory);

  private:
    struct Place {
        std::string path;
        const char* name;
        FileIdentity identity;  // zeros while it does not exist
    };

    std::vector<Place> places_;
    std::unordered_map<std::string, const char*> folders_;  // answers of this walk
};

}  // namespace tandry

}  // namespace platform
