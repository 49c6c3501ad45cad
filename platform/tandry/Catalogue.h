#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"
#include "platform/tandry/RegistryState.h"
#include "platform/tandry/Sqlite.h"

namespace platform::tandry {

/// The registry's state on disk: a cache of what the bundles say, and the home of the UUIDs and of
/// what was registered or forgotten by path. Belongs to the registry's thread once made.
///
/// A file that is deleted or exchanged while it is open is noticed by the next save, which goes to
/// a new one with all that the state holds; what was put in its place is set aside.
///
/// Without a usable file the registry goes on in memory, and each save tries again. Every failure
/// is logged here.
class Catalogue {
  public:
    /// The catalogue `Tandry.db` in a directory. Takes a lock beside it that is held for life;
    /// nothing is read yet. Error: another process holds the lock (EADDRINUSE).
    static Result<std::unique_ptr<Catalogue>> open(std::string directory);

    /// What is stored. A catalogue that is damaged or has a version that is not known is set aside
    /// under another name, with an error line, and an empty one takes its place. One that cannot be
    /// read for any other reason stays as it is, and nothing counts as stored.
    RegistryState load();

    /// Stores, in one transaction that outlives a power failure, what `changes` says has changed of
    /// `state`, and whatever an earlier save failed to store. The error says why nothing was.
    std::optional<Error> save(const RegistryState& state, const RegistryChanges& changes);

  private:
    explicit Catalogue(std::string directory);

    std::optional<Error> takeLock();
    std::optional<Error> openDatabase();
    std::optional<Error> prepareDatabase();
    std::optional<Error> upgrade(std::int64_t version);
    std::optional<Error> inTransaction(const std::function<std::optional<Error>()>& work);
    std::optional<Error> writeVersion();
    void leaveLostFile();
    std::optional<Error> store(const RegistryState& state, const RegistryChanges& changes);
    std::optional<Error> writeAll(const RegistryState& state);
    bool isDamage(const Error& error) const;
    bool setAside(const Error& reason);

    std::string directory_;
    std::string path_;
    UniqueFd lock_;                // none when it could not be made
    SqliteDatabase database_;      // none while the registry works in memory alone
    bool isStale_ = false;         // the file differs from the state by more than the next changes
    bool hasUnreadLists_ = false;  // the file may hold registrations that the state lacks
};

}  // namespace platform::tandry
