#pragma once

#include <dirent.h>

#include <memory>
#include <string>
#include <vector>

#include "platform/system/Error.h"
#include "platform/tandry/Complaints.h"
#include "platform/tandry/FolderWatch.h"
#include "platform/tandry/ForeignPlaces.h"

namespace platform::tandry {

/// The subdirectories of a directory, in the order of their names. Hidden ones, and those whose
/// path is no text that a message could carry (logged), are left out.
struct FolderEntries {
    struct Entry {
        std::string name;
        std::string target;  // where a symbolic link leads, canonical; empty for a real directory
    };
    struct Closer {
        void operator()(DIR* stream) const { ::closedir(stream); }
    };
    std::unique_ptr<DIR, Closer> stream;
    std::vector<Entry> entries;
    std::vector<std::string> nowhere;  // where links that cannot be resolved would lead
    std::vector<std::string> unseen;   // where links lead to what does not answer

    /// The open directory, owned here.
    int directory() const { return ::dirfd(stream.get()); }

    /// Reads the directory at a canonical path. Links that lead nowhere, or to no directory, are
    /// left out; the first kind is logged. Where links lead is marked in `watch`. Error: the
    /// system's.
    static Result<FolderEntries> read(const std::string& path, FolderWatch& watch,
                                      ForeignPlaces& places, Complaints& complaints);
};

/// Whether a path can stand in messages: valid UTF-8 without ASCII control characters.
bool isUsablePath(const std::string& path);

}  // namespace platform::tandry
