#include "platform/tandry/Catalogue.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sqlite3.h>
#include <sys/file.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>

#include "platform/Files.h"
#include "platform/Log.h"

namespace platform::tandry {

namespace {

constexpr int kSchemaVersion = 1;
constexpr int kMostSetAside = 100;

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
CREATE TABLE refusals(path TEXT PRIMARY KEY, executable TEXT, sdk TEXT, stamps BLOB, reason TEXT);
)";

const Log& ops() {
    static const Log& handle = Log::make("com.orbel.Zorvan", "ops");
    return handle;
}

Error damage(std::string text) {
    return {"SQLite", SQLITE_CORRUPT, std::move(text)};
}

/// Whether an error is the file's own, so that another file would do better.
bool isDamage(const Error& error) {
    switch (error.code) {
        case SQLITE_BUSY:
        case SQLITE_LOCKED:
        case SQLITE_NOMEM:
        case SQLITE_IOERR:
        case SQLITE_FULL:
            return false;
        default:
            return true;
    }
}

SqliteStatement::Blob blob(std::string_view bytes) {
    return {bytes};
}

std::string_view bytesOf(const Uuid& uuid) {
    return {reinterpret_cast<const char*>(uuid.bytes.data()), uuid.bytes.size()};
}

/// Parses the columns of `readPlugIns`. None when a row is not one that this class wrote.
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
    entry.print = {row.text(10), row.text(11), row.text(14)};
    entry.points = row.text(12);
    entry.needsContainer = row.integer(13) != 0;
    entry.infoPlistSize = static_cast<std::size_t>(row.integer(15));
    entry.dictionaries = std::make_shared<const std::string>(row.bytes(16));
    if (entry.infoPlistSize > entry.dictionaries->size()) return std::nullopt;
    if (entry.needsContainer && !record->plugInIdentifier) return std::nullopt;
    entry.record = std::move(record);
    entry.attachDictionaries();
    return entry;
}

RegistryChanges everythingOf(const RegistryState& state) {
    RegistryChanges changes;
    for (const auto& [path, entry] : state.applications) changes.applications.insert(path);
    for (const auto& [path, entry] : state.plugIns) changes.installed.push_back(entry.record);
    changes.lists = true;
    return changes;
}

}  // namespace

Result<std::unique_ptr<Catalogue>> Catalogue::open(const std::string& directory) {
    if (std::optional<Error> error = makeDirectories(directory, S_IRWXU)) return *error;
    std::string path = joinPath(directory, "Tandry.db");
    const std::string lockPath = path + ".lock";
    UniqueFd lock(::open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK,
                         S_IRUSR | S_IWUSR));
    if (!lock) return Error::posix(errno, lockPath);
    if (::flock(lock.get(), LOCK_EX | LOCK_NB) != 0) {
        if (errno != EWOULDBLOCK) return Error::posix(errno, lockPath);
        return Error{"POSIX", EADDRINUSE,
                     fmt::format("{}: another daemon uses this data directory", lockPath)};
    }
    return std::unique_ptr<Catalogue>(new Catalogue(std::move(path), std::move(lock)));
}

Catalogue::Catalogue(std::string path, UniqueFd lock)
    : path_(std::move(path)), lock_(std::move(lock)) {}

RegistryState Catalogue::load() {
    for (bool isFresh : {false, true}) {
        RegistryState state;
        std::optional<Error> error = openDatabase();
        if (!error) error = read(state);
        if (!error) return state;
        database_.close();
        if (isFresh || !isDamage(*error) || !setAside(*error)) {
            EVLOG_ERROR(ops(), "working without the catalogue {}: {}", pub(path_), pub(*error));
            break;
        }
    }
    return {};
}

std::optional<Error> Catalogue::openDatabase() {
    Result<SqliteDatabase> opened = SqliteDatabase::open(path_);
    if (!opened) return opened.error();
    database_ = std::move(*opened);
    Result<std::int64_t> version = database_.integer("PRAGMA user_version");
    if (!version) return version.error();
    Result<std::int64_t> tables = database_.integer("SELECT count(*) FROM sqlite_master");
    if (!tables) return tables.error();
    const bool isNew = *version == 0 && *tables == 0;
    if (!isNew && *version != kSchemaVersion)
        return damage(fmt::format("version {} instead of {}", *version, kSchemaVersion));
    // Rows of a few KiB waste little of pages of this size.
    if (auto error = database_.run("PRAGMA page_size = 16384; PRAGMA journal_mode = WAL;"
                                   "PRAGMA synchronous = NORMAL;"
                                   "PRAGMA journal_size_limit = 1048576;"))
        return error;
    if (!isNew) return std::nullopt;
    return database_.run(
        fmt::format("BEGIN; {} PRAGMA user_version = {}; COMMIT;", kSchema, kSchemaVersion)
            .c_str());
}

/// Moves the database away. Its log goes first: beside a new database it would be taken for that
/// one's.
bool Catalogue::setAside(const Error& reason) {
    database_.close();
    for (int number = 1; number <= kMostSetAside; ++number) {
        const std::string aside = fmt::format("{}.damaged-{}", path_, number);
        struct stat status;
        if (::lstat(aside.c_str(), &status) == 0) continue;
        for (const char* suffix : {"-wal", "-shm", ""})
            if (std::rename((path_ + suffix).c_str(), (aside + suffix).c_str()) != 0 &&
                errno != ENOENT)
                return false;
        EVLOG_ERROR(ops(), "the catalogue {} cannot be used and is now {}: {}", pub(path_),
                    pub(aside), pub(reason));
        return true;
    }
    return false;
}

std::optional<Error> Catalogue::read(RegistryState& state) {
    if (auto error = readApplications(state)) return error;
    if (auto error = readPlugIns(state)) return error;
    return readLists(state);
}

std::optional<Error> Catalogue::readApplications(RegistryState& state) {
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

std::optional<Error> Catalogue::readPlugIns(RegistryState& state) {
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
        std::optional<PlugInEntry> entry;
        if (row.integer(17) == 1) entry = plugInOf(row, state);
        if (!entry) return damage("the row of a plug-in is damaged");
        std::string path = *entry->record->bundlePath;
        // Rows were mostly written in the order of their paths.
        state.plugIns.insert_or_assign(state.plugIns.end(), std::move(path), *std::move(entry));
    }
    return row.error();
}

std::optional<Error> Catalogue::readLists(RegistryState& state) {
    SqliteStatement registration(database_, "SELECT path FROM registrations");
    while (registration.next()) state.registrations.insert(registration.text(0));
    SqliteStatement forgotten(database_, "SELECT path, executable, sdk, stamps FROM forgotten");
    while (forgotten.next())
        state.forgotten[forgotten.text(0)] = {
            {forgotten.text(1), forgotten.text(2), forgotten.text(3)}};
    SqliteStatement refusal(database_,
                            "SELECT path, executable, sdk, stamps, reason FROM refusals");
    while (refusal.next())
        state.refusals[refusal.text(0)] = {{refusal.text(1), refusal.text(2), refusal.text(3)},
                                           refusal.text(4)};
    for (const SqliteStatement* statement : {&registration, &forgotten, &refusal})
        if (statement->error()) return statement->error();
    return std::nullopt;
}

void Catalogue::save(const RegistryState& state, const RegistryChanges& changes) {
    if (!database_) return;
    std::optional<Error> error = write(state, changes);
    if (error && isDamage(*error) && setAside(*error)) {
        error = openDatabase();
        if (!error) error = write(state, everythingOf(state));
    }
    if (error) EVLOG_ERROR(ops(), "cannot write the catalogue {}: {}", pub(path_), pub(*error));
}

std::optional<Error> Catalogue::write(const RegistryState& state, const RegistryChanges& changes) {
    std::optional<Error> error = database_.run("BEGIN IMMEDIATE");
    if (error) return error;
    error = writeApplications(state, changes);
    if (!error) error = writePlugIns(state, changes);
    if (!error && changes.lists) error = writeLists(state);
    if (!error) error = database_.run("COMMIT");
    // The second failure would only repeat the first.
    if (error) static_cast<void>(database_.run("ROLLBACK"));
    return error;
}

std::optional<Error> Catalogue::writeApplications(const RegistryState& state,
                                                  const RegistryChanges& changes) {
    SqliteStatement remove(database_, "DELETE FROM applications WHERE path = ?");
    SqliteStatement put(database_,
                        "INSERT OR REPLACE INTO applications VALUES(?1, ?2, ?3, ?4, ?5,"
                        " checksum(?1, ?2, ?3, ?4, ?5))");
    for (const std::string& path : changes.applications) {
        auto found = state.applications.find(path);
        if (found == state.applications.end()) {
            remove.execute({path});
            continue;
        }
        const TDApplicationProxy& record = *found->second.record;
        put.execute({path, record.bundleIdentifier, record.localizedName,
                     std::int64_t{record.isPlaceholder}, blob(found->second.stamps)});
    }
    return remove.error() ? remove.error() : put.error();
}

std::optional<Error> Catalogue::writePlugIns(const RegistryState& state,
                                             const RegistryChanges& changes) {
    SqliteStatement remove(database_, "DELETE FROM plugins WHERE path = ?");
    for (const TDPlugInProxyRef& plugIn : changes.uninstalled)
        if (!state.plugIns.contains(*plugIn->bundlePath)) remove.execute({*plugIn->bundlePath});

    SqliteStatement put(database_,
                        "INSERT OR REPLACE INTO plugins VALUES(?1, ?2, ?3, ?4, ?5, ?6, ?7, ?8, ?9,"
                        " ?10, ?11, ?12, ?13, ?14, ?15, ?16, ?17, checksum(?1, ?2, ?3, ?4, ?5, ?6,"
                        " ?7, ?8, ?9, ?10, ?11, ?12, ?13, ?14, ?15, ?16, ?17))");
    for (const TDPlugInProxyRef& plugIn : changes.installed) {
        auto found = state.plugIns.find(*plugIn->bundlePath);
        if (found == state.plugIns.end()) continue;
        const PlugInEntry& entry = found->second;
        const TDPlugInProxy& record = *entry.record;
        std::optional<std::string> application;
        if (record.containingApplication) application = record.containingApplication->bundlePath;
        put.execute({found->first, blob(bytesOf(record.plugInUuid)), application,
                     record.bundleIdentifier, record.plugInIdentifier, record.originalIdentifier,
                     record.bundleVersion, record.registrationDate.secondsSince1970,
                     record.localizedName, record.localizedShortName, entry.print.executable,
                     entry.print.sdk, blob(entry.points), std::int64_t{entry.needsContainer},
                     blob(entry.print.stamps), static_cast<std::int64_t>(entry.infoPlistSize),
                     blob(*entry.dictionaries)});
    }
    return remove.error() ? remove.error() : put.error();
}

std::optional<Error> Catalogue::writeLists(const RegistryState& state) {
    if (auto error = database_.run(
            "DELETE FROM registrations; DELETE FROM forgotten; DELETE FROM refusals;"))
        return error;
    SqliteStatement registration(database_, "INSERT INTO registrations VALUES(?)");
    for (const std::string& path : state.registrations) registration.execute({path});
    SqliteStatement forgotten(database_, "INSERT INTO forgotten VALUES(?, ?, ?, ?)");
    for (const auto& [path, entry] : state.forgotten)
        forgotten.execute(
            {path, entry.print.executable, entry.print.sdk, blob(entry.print.stamps)});
    SqliteStatement refusal(database_, "INSERT INTO refusals VALUES(?, ?, ?, ?, ?)");
    for (const auto& [path, entry] : state.refusals)
        refusal.execute({path, entry.print.executable, entry.print.sdk, blob(entry.print.stamps),
                         entry.reason});
    for (const SqliteStatement* statement : {&registration, &forgotten, &refusal})
        if (statement->error()) return statement->error();
    return std::nullopt;
}

}  // namespace platform::tandry
