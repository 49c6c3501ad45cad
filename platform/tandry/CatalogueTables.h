#pragma once

#include <optional>

#include "platform/system/Error.h"
#include "platform/tandry/RegistryState.h"
#include "platform/tandry/Sqlite.h"

namespace platform::tandry {

/// How the registry's state is laid out in the tables of an open database, which it borrows.
/// Errors are the database's; SQLITE_CORRUPT also for a row whose digest does not fit.
class CatalogueTables {
  public:
    static constexpr int kVersion = 3;
    /// The same tables, but for the sizes of refused plug-ins.
    static constexpr int kVersionWithoutSizes = 2;
    /// Fingerprints lack the identities of directories as well.
    static constexpr int kVersionWithoutDirectories = 1;

    explicit CatalogueTables(SqliteDatabase& database) : database_(database) {}

    /// Makes the tables in an empty database.
    std::optional<Error> create();
    /// Gives the tables of an earlier version all columns.
    std::optional<Error> addColumns();

    /// Adds what is stored to an empty state. Rows that do not fit the others are left out, and
    /// `leftOut` becomes true: their bundles want reading again.
    std::optional<Error> read(RegistryState& state, bool& leftOut);

    /// Stores what `changes` says has changed of `state`; inside a transaction of the caller's.
    std::optional<Error> write(const RegistryState& state, const RegistryChanges& changes);

    /// Empties the tables of the cache, or all.
    std::optional<Error> clear(bool withLists);
    /// Removes the plug-ins that are forgotten as well.
    std::optional<Error> clearForgotten();

  private:
    std::optional<Error> execute(const char* sql);
    std::optional<Error> readApplications(RegistryState& state);
    std::optional<Error> readPlugIns(RegistryState& state, bool& leftOut);
    std::optional<Error> readLists(RegistryState& state);
    std::optional<Error> writeApplications(const RegistryState& state,
                                           const RegistryChanges& changes);
    std::optional<Error> writePlugIns(const RegistryState& state, const RegistryChanges& changes);
    std::optional<Error> writeRegistrations(const RegistryState& state,
                                            const RegistryChanges& changes);
    std::optional<Error> writeForgotten(const RegistryState& state, const RegistryChanges& changes);
    std::optional<Error> writeRefusals(const RegistryState& state, const RegistryChanges& changes);

    SqliteDatabase& database_;
};

}  // namespace platform::tandry
