#include "platform/tandry/CatalogueTables.h"

#include <sqlite3.h>

#include <cstring>

namespace platform::tandry {

namespace {

constexpr const char* kSchema = R"(
CREATE TABLE applications(
    path TEXT PRIMARY KEY, identifier TEXT, name TEXT, placeholder INTEGER, stamps BLOB, sum BLOB);
CREATE TABLE plugins(
    path TEXT PRIMARY KEY, uuid BLOB, application TEXT, bundle_identifier TEXT, identifier TEXT,
    original_identifier TEXT, version TEXT, registered REAL, name TEXT, short_name TEXT,
    executable TEXT, sdk TEXT, points BLOB, container INTEGER, stamps BLOB,
    info_plist_size INTEGER, dictionaries BLOB, sum BLOB);
CREATE TABLE registrations(path TEXT PRIMARY KEY);
CREATE TABLE forgotten(path TEXT PRIMARY KEY, executable TEXT, sdk TEXT, stamps BLOB);
CREATE TABLE refusals(
    path TEXT PRIMARY KEY, executable TEXT, sdk TEXT, stamps BLOB, reason TEXT, size INTEGER);
)";

Error damage(std::string text) {
    return {"SQLite", SQLITE_CORRUPT, std::move(text)};
}

SqliteStatement::Blob blob(std::string_view bytes) {
    return {bytes};
}

std::string_view bytesOf(const Uuid& uuid) {
    return {reinterpret_cast<const char*>(uuid.bytes.data()), uuid.bytes.size()};
}

/// Parses the columns of `readPlugIns`. None when the row does not fit the others.
std::optional<PlugInEntry> plugInOf(const SqliteStatement& row, const RegistryState& state) {
    PlugInEntry entry;
    auto record = std::make_shared<TDPlugInProxy>();
    record->bundlePath = row.text(0);
    std::string_view uuid = row.bytes(1);
    if (uuid.size() != record->plugInUuid.bytes.size()) return std::nullopt;
    std::memcpy(record->plugInUuid.bytes.data(), uuid.data(), uuid.size());
    if (std::optional<std::string> application = row.optionalText(2)) {
        auto found = state.applications.find(*application);
        if (found == state.applications.end()) return std::nullopt;
        record->containingApplication = found->second.record;
    }
    record->bundleIdentifier = row.text(3);
    record->plugInIdentifier = row.optionalText(4);
    record->originalIdentifier = row.optionalText(5);
    record->bundleVersion = row.text(6);
    record->registrationDate = {row.real(7)};
    record->localizedName = row.optionalText(8);
    record->localizedShortName = row.optionalText(9);
    record->onSystemPartition = isOnSystemPartition(*record->bundlePath);
    entry.print = {row.text(10), row.text(11), PackedBytes(row.bytes(14))};
    record->bundleIdentity = FileIdentity::from(row.bytes(14));
    entry.points = row.text(12);
    entry.needsContainer = row.integer(13) != 0;
    entry.infoPlistSize = static_cast<std::size_t>(row.integer(15));
    entry.dictionaries = std::make_shared<const std::string>(row.bytes(16));
    if (entry.infoPlistSize > entry.dictionaries->size()) return std::nullopt;
    if (!record->plugInIdentifier) return std::nullopt;
    if (!entry.points.empty() && entry.points.back() != '\0') return std::nullopt;
    entry.record = std::move(record);
    entry.attachDictionaries();
    return entry;
}

}  // namespace

std::optional<Error> CatalogueTables::create() {
    return database_.run(kSchema);
}

std::optional<Error> CatalogueTables::addColumns() {
    return execute("ALTER TABLE refusals ADD COLUMN size INTEGER");
}

std::optional<Error> CatalogueTables::read(RegistryState& state, bool& leftOut) {
    if (auto error = readApplications(state)) return error;
    if (auto error = readPlugIns(state, leftOut)) return error;
    return readLists(state);
}

std::optional<Error> CatalogueTables::readApplications(RegistryState& state) {
    SqliteStatement row(database_,
                        "SELECT path, identifier, name, placeholder, stamps,"
                        " sum = checksum(path, identifier, name, placeholder, stamps)"
                        " FROM applications");
    while (row.next()) {
        if (row.integer(5) != 1) return damage("the row of an application is damaged");
        auto record = std::make_shared<TDApplicationProxy>();
        *record = {row.text(0), row.text(1), row.text(2), row.integer(3) != 0};
        std::string path = record->bundlePath;
        state.applications[std::move(path)] = {std::move(record), row.text(4)};
    }
    return row.error();
}

std::optional<Error> CatalogueTables::readPlugIns(RegistryState& state, bool& leftOut) {
    // A sum over all that a row holds lets a start trust the dictionaries without decoding them.
    SqliteStatement row(
        database_,
        "SELECT path, uuid, application, bundle_identifier, identifier, original_identifier,"
        " version, registered, name, short_name, executable, sdk, points, container, stamps,"
        " info_plist_size, dictionaries,"
        " sum = checksum(path, uuid, application, bundle_identifier, identifier,"
        " original_identifier, version, registered, name, short_name, executable, sdk, points,"
        " container, stamps, info_plist_size, dictionaries) FROM plugins");
    while (row.next()) {
        if (row.integer(17) != 1) return damage("the row of a plug-in is damaged");
        std::optional<PlugInEntry> entry = plugInOf(row, state);
        if (!entry) {
            leftOut = true;
            continue;
        }
        std::string path = *entry->record->bundlePath;
        // Rows were mostly written in the order of their paths.
        state.plugIns.insert_or_assign(state.plugIns.end(), std::move(path), *std::move(entry));
    }
    return row.error();
}

std::optional<Error> CatalogueTables::readLists(RegistryState& state) {
    SqliteStatement registration(database_, "SELECT path FROM registrations");
    while (registration.next()) state.registrations.insert(registration.text(0));
    SqliteStatement forgotten(database_, "SELECT path, executable, sdk, stamps FROM forgotten");
    while (forgotten.next())
        state.forgotten[forgotten.text(0)] = {
            {forgotten.text(1), forgotten.text(2), PackedBytes(forgotten.bytes(3))}};
    SqliteStatement refusal(database_,
                            "SELECT path, executable, sdk, stamps, reason, size FROM refusals");
    while (refusal.next())
        state.refusals[refusal.text(0)] = {
            {refusal.text(1), refusal.text(2), PackedBytes(refusal.bytes(3))},
            refusal.text(4),
            static_cast<std::size_t>(refusal.integer(5))};
    for (const SqliteStatement* statement : {&registration, &forgotten, &refusal})
        if (statement->error()) return statement->error();
    return std::nullopt;
}

std::optional<Error> CatalogueTables::write(const RegistryState& state,
                                            const RegistryChanges& changes) {
    if (auto error = writeApplications(state, changes)) return error;
    if (auto error = writePlugIns(state, changes)) return error;
    if (auto error = writeRegistrations(state, changes)) return error;
    if (auto error = writeForgotten(state, changes)) return error;
    return writeRefusals(state, changes);
}

std::optional<Error> CatalogueTables::execute(const char* sql) {
    SqliteStatement statement(database_, sql);
    statement.execute({});
    return statement.error();
}

std::optional<Error> CatalogueTables::clear(bool withLists) {
    for (const char* sql : {"DELETE FROM applications", "DELETE FROM plugins"})
        if (auto error = execute(sql)) return error;
    if (!withLists) return std::nullopt;
    for (const char* sql :
         {"DELETE FROM registrations", "DELETE FROM forgotten", "DELETE FROM refusals"})
        if (auto error = execute(sql)) return error;
    return std::nullopt;
}

std::optional<Error> CatalogueTables::clearForgotten() {
    return execute("DELETE FROM plugins WHERE path IN (SELECT path FROM forgotten)");
}

std::optional<Error> CatalogueTables::writeApplications(const RegistryState& state,
                                                        const RegistryChanges& changes) {
    SqliteStatement remove(database_, "DELETE FROM applications WHERE path = ?");
    SqliteStatement put(database_,
                        "INSERT OR REPLACE INTO applications VALUES(?1, ?2, ?3, ?4, ?5,"
                        " checksum(?1, ?2, ?3, ?4, ?5))");
    const auto write = [&](const std::string& path, const ApplicationEntry& entry) {
        const TDApplicationProxy& record = *entry.record;
        put.execute({path, record.bundleIdentifier, record.localizedName,
                     std::int64_t{record.isPlaceholder}, blob(entry.stamps)});
    };
    for (const std::string& path : changes.applications) {
        auto found = state.applications.find(path);
        if (found == state.applications.end())
            remove.execute({path});
        else
            write(path, found->second);
    }
    for (const std::string& path : changes.restamped)
        if (auto found = state.applications.find(path); found != state.applications.end())
            write(path, found->second);
    return remove.error() ? remove.error() : put.error();
}

std::optional<Error> CatalogueTables::writePlugIns(const RegistryState& state,
                                                   const RegistryChanges& changes) {
    SqliteStatement remove(database_, "DELETE FROM plugins WHERE path = ?");
    for (const TDPlugInProxyRef& plugIn : changes.uninstalled)
        if (!state.plugIns.contains(*plugIn->bundlePath)) remove.execute({*plugIn->bundlePath});

    SqliteStatement put(database_,
                        "INSERT OR REPLACE INTO plugins VALUES(?1, ?2, ?3, ?4, ?5, ?6, ?7, ?8, ?9,"
                        " ?10, ?11, ?12, ?13, ?14, ?15, ?16, ?17, checksum(?1, ?2, ?3, ?4, ?5, ?6,"
                        " ?7, ?8, ?9, ?10, ?11, ?12, ?13, ?14, ?15, ?16, ?17))");
    std::set<std::string> paths = changes.restamped;
    for (const TDPlugInProxyRef& plugIn : changes.installed) paths.insert(*plugIn->bundlePath);
    for (const std::string& path : paths) {
        auto found = state.plugIns.find(path);
        if (found == state.plugIns.end()) continue;
        const PlugInEntry& entry = found->second;
        const std::string stamps = entry.print.stamps.unpacked();
        const TDPlugInProxy& record = *entry.record;
        std::optional<std::string> application;
        if (record.containingApplication) application = record.containingApplication->bundlePath;
        put.execute({found->first, blob(bytesOf(record.plugInUuid)), application,
                     record.bundleIdentifier, record.plugInIdentifier, record.originalIdentifier,
                     record.bundleVersion, record.registrationDate.secondsSince1970,
                     record.localizedName, record.localizedShortName, entry.print.executable,
                     entry.print.sdk, blob(entry.points), std::int64_t{entry.needsContainer},
                     blob(stamps), static_cast<std::int64_t>(entry.infoPlistSize),
                     blob(*entry.dictionaries)});
    }
    return remove.error() ? remove.error() : put.error();
}

std::optional<Error> CatalogueTables::writeRegistrations(const RegistryState& state,
                                                         const RegistryChanges& changes) {
    SqliteStatement remove(database_, "DELETE FROM registrations WHERE path = ?");
    SqliteStatement put(database_, "INSERT OR REPLACE INTO registrations VALUES(?)");
    for (const std::string& path : changes.registrations)
        (state.registrations.contains(path) ? put : remove).execute({path});
    return remove.error() ? remove.error() : put.error();
}

std::optional<Error> CatalogueTables::writeForgotten(const RegistryState& state,
                                                     const RegistryChanges& changes) {
    SqliteStatement remove(database_, "DELETE FROM forgotten WHERE path = ?");
    SqliteStatement put(database_, "INSERT OR REPLACE INTO forgotten VALUES(?, ?, ?, ?)");
    for (const std::string& path : changes.forgotten) {
        auto found = state.forgotten.find(path);
        if (found == state.forgotten.end()) {
            remove.execute({path});
            continue;
        }
        const Fingerprint& print = found->second.print;
        const std::string stamps = print.stamps.unpacked();
        put.execute({path, print.executable, print.sdk, blob(stamps)});
    }
    return remove.error() ? remove.error() : put.error();
}

std::optional<Error> CatalogueTables::writeRefusals(const RegistryState& state,
                                                    const RegistryChanges& changes) {
    SqliteStatement remove(database_, "DELETE FROM refusals WHERE path = ?");
    SqliteStatement put(database_, "INSERT OR REPLACE INTO refusals VALUES(?, ?, ?, ?, ?, ?)");
    for (const std::string& path : changes.refusals) {
        auto found = state.refusals.find(path);
        if (found == state.refusals.end()) {
            remove.execute({path});
            continue;
        }
        const Refusal& refusal = found->second;
        const std::string stamps = refusal.print.stamps.unpacked();
        put.execute({path, refusal.print.executable, refusal.print.sdk, blob(stamps),
                     refusal.reason, static_cast<std::int64_t>(refusal.size)});
    }
    return remove.error() ? remove.error() : put.error();
}

}  // namespace platform::tandry
