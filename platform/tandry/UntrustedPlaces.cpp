#include "platform/tandry/UntrustedPlaces.h"

#include <sys/stat.h>

#include "platform/system/Directories.h"
#include "platform/system/Files.h"

namespace platform::tandry {

namespace {

/// Zeros for what cannot be looked at: nothing can be read below it either.
FileIdentity identityOf(const std::string& path) {
    struct stat status;
    if (::stat(path.c_str(), &status) != 0) return {};
    return FileIdentity::of(status);
}

}  // namespace

UntrustedPlaces::UntrustedPlaces(const Directories& directories)
    : places_{
          {joinPath(directories.zorvanData(), "Containers"), "a data container", {}},
          {joinPath(directories.zorvanRuntime(), "tenurd"), "an assertion folder", {}},
          {directories.runtime, "the runtime directory", {}},
      } {}

void UntrustedPlaces::beginWalk() {
    folders_.clear();
    for (Place& place : places_) place.identity = identityOf(place.path);
}

const char* UntrustedPlaces::around(const std::string& path) {
    return around(path, identityOf(path));
}

const char* UntrustedPlaces::around(const std::string& path, const FileIdentity& directory) {
    for (const Place& place : places_)
        if (place.identity == directory && directory != FileIdentity()) return place.name;
    std::string folder(parentPath(path));
    if (folder == path) return nullptr;
    if (const auto known = folders_.find(folder); known != folders_.end()) return known->second;
    const char* place = around(folder);
    folders_.emplace(std::move(folder), place);
    return place;
}

}  // namespace platform::tandry
