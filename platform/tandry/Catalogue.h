#pragma once

#include <memory>
#include <optional>
#include <string>

#include "platform/Error.h"
#include "platform/UniqueFd.h"
#include "platform/tandry/RegistryState.h"
#include "platform/tandry/Sqlite.h"

namespace platform::tandry {

/// The registry's state on disk: a cache of what the bundles say, and the home of the UUIDs and of
/// what was registered or forgotten by path. Belongs to the registry's thread once made.
///
/// Failures never reach the caller: they are logged, and the registry goes on in memory.
class Catalogue {
  public:
    /// The catalogue `Tandry.db` in a directory, which is made when missing. Takes a lock beside it
    /// that is held for life; nothing is read yet. Error: the directory cannot be used, or another
    /// process holds the lock (EADDRINUSE).
    static Result<std::unique_ptr<Catalogue>> open(const std::string& directory);

    /// What is stored. A catalogue that is damaged, cannot be read or has another version is set
    /// aside under another name, with an error line, and an empty one takes its place.
    RegistryState load();

    /// Stores, in one transaction, what `changes` says has changed of `state`.
    void save(const RegistryState& state, const RegistryChanges& changes);

  private:
    Catalogue(std::string path, UniqueFd lock);

    std::optional<Error> openDatabase();
    std::optional<Error> read(RegistryState& state);
    std::optional<Error> readApplications(RegistryState& state);
    std::optional<Error> readPlugIns(RegistryState& state);
    std::optional<Error> readLists(RegistryState& state);
    std::optional<Error> write(const RegistryState& state, const RegistryChanges& changes);
    std::optional<Error> writeApplications(const RegistryState& state,
                                           const RegistryChanges& changes);
    std::optional<Error> writePlugIns(const RegistryState& state, const RegistryChanges& changes);
    std::optional<Error> writeLists(const RegistryState& state);
    bool setAside(const Error& reason);

    std::string path_;
    UniqueFd lock_;
    SqliteDatabase database_;  // none while the registry works in memory alone
};

}  // namespace platform::tandry
