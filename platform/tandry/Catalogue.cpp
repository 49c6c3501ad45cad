#include "platform/tandry/Catalogue.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sqlite3.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>

#include "platform/log/OpsLog.h"
#include "platform/system/Files.h"
#include "platform/tandry/CatalogueTables.h"

namespace platform::tandry {

namespace {

/// Whether what lies there could never be opened as a database, whoever tries.
bool isNoReadableFile(const std::string& path) {
    struct stat status;
    if (::stat(path.c_str(), &status) != 0) return errno == ELOOP;
    return !S_ISREG(status.st_mode) || (::access(path.c_str(), R_OK) != 0 && errno == EACCES);
}

RegistryChanges everythingOf(const RegistryState& state) {
    RegistryChanges changes;
    auto add = [](const auto& map, std::set<std::string>& paths) {
        for (const auto& [path, entry] : map) paths.insert(paths.end(), path);
    };
    add(state.applications, changes.applications);
    for (const auto& [path, entry] : state.plugIns) changes.installed.push_back(entry.record);
    changes.registrations = state.registrations;
    add(state.forgotten, changes.forgotten);
    add(state.refusals, changes.refusals);
    return changes;
}

/// Gives a state without identities of directories those that lie there now: the stamps of their
/// files say whether they still hold what they did.
void addDirectories(RegistryState& state) {
    const auto add = [](const std::string& path, Fingerprint& print) {
        std::string stamps;
        FileIdentity::at(AT_FDCWD, path.c_str()).appendTo(stamps);
        print.stamps = PackedBytes(stamps + print.stamps.unpacked());
    };
    for (auto& [path, entry] : state.plugIns) add(path, entry.print);
    for (auto& [path, forgotten] : state.forgotten) add(path, forgotten.print);
    for (auto& [path, refusal] : state.refusals) add(path, refusal.print);
}

}  // namespace

Result<std::unique_ptr<Catalogue>> Catalogue::open(std::string directory) {
    std::unique_ptr<Catalogue> catalogue(new Catalogue(std::move(directory)));
    std::optional<Error> error = catalogue->takeLock();
    // Any other error shows again, and is told, when the catalogue is loaded.
    if (error && error->code == EADDRINUSE) return *error;
    return catalogue;
}

Catalogue::Catalogue(std::string directory)
    : directory_(std::move(directory)), path_(joinPath(directory_, "Tandry.db")) {}

std::optional<Error> Catalogue::takeLock() {
    if (lock_) return std::nullopt;
    if (std::optional<Error> error = makeDirectories(directory_, S_IRWXU)) return error;
    const std::string path = path_ + ".lock";
    UniqueFd lock(::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK,
                         S_IRUSR | S_IWUSR));
    if (!lock) return Error::posix(errno, path);
    if (::flock(lock.get(), LOCK_EX | LOCK_NB) != 0) {
        if (errno != EWOULDBLOCK) return Error::posix(errno, path);
        return Error{"POSIX", EADDRINUSE,
                     fmt::format("{}: another daemon uses this data directory", path)};
    }
    lock_ = std::move(lock);
    return std::nullopt;
}

RegistryState Catalogue::load() {
    RegistryState state;
    std::optional<Error> error = openDatabase();
    if (!error) error = CatalogueTables(database_).read(state, isStale_);
    if (error && isDamage(*error) && setAside(*error)) {
        state = {};
        error = openDatabase();
    }
    database_.releaseMemory();
    if (!error) return state;
    EVLOG_ERROR(ops(), "working without the catalogue {}: {}", pub(path_), pub(*error));
    database_.close();
    isStale_ = hasUnreadLists_ = true;
    return {};
}

/// Nothing of the file is touched without the lock: it might be another daemon's.
std::optional<Error> Catalogue::openDatabase() {
    if (auto error = takeLock()) return error;
    Result<SqliteDatabase> opened = SqliteDatabase::open(path_);
    if (!opened) return opened.error();
    database_ = std::move(*opened);
    std::optional<Error> error = prepareDatabase();
    if (error) database_.close();
    return error;
}

std::optional<Error> Catalogue::prepareDatabase() {
    Result<std::int64_t> version = database_.integer("PRAGMA user_version");
    if (!version) return version.error();
    Result<std::int64_t> tables = database_.integer("SELECT count(*) FROM sqlite_master");
    if (!tables) return tables.error();
    const bool isNew = *version == 0 && *tables == 0;
    if (!isNew && (*version < CatalogueTables::kVersionWithoutDirectories ||
                   *version > CatalogueTables::kVersion))
        return Error{"SQLite", SQLITE_CORRUPT,
                     fmt::format("version {} instead of {}", *version, CatalogueTables::kVersion)};
    // Rows of a few KiB waste little of pages of this size. What was confirmed must be there after
    // a power failure, which takes the full kind of synchronising.
    if (auto error = database_.run("PRAGMA page_size = 16384; PRAGMA journal_mode = WAL;"
                                   "PRAGMA synchronous = FULL;"
                                   "PRAGMA journal_size_limit = 1048576;"))
        return error;
    if (!isNew) return upgrade(*version);
    return inTransaction([this] {
        const std::optional<Error> error = CatalogueTables(database_).create();
        return error ? error : writeVersion();
    });
}

/// Brings the file to this version, or leaves it as it is.
std::optional<Error> Catalogue::upgrade(std::int64_t version) {
    if (version == CatalogueTables::kVersion) return std::nullopt;
    return inTransaction([&]() -> std::optional<Error> {
        CatalogueTables tables(database_);
        if (auto error = tables.addColumns()) return error;
        if (version <= CatalogueTables::kVersionWithoutDirectories) {
            RegistryState state;
            if (auto error = tables.read(state, isStale_)) return error;
            addDirectories(state);
            if (auto error = tables.clear(true)) return error;
            if (auto error = tables.write(state, everythingOf(state))) return error;
        }
        return writeVersion();
    });
}

std::optional<Error> Catalogue::inTransaction(const std::function<std::optional<Error>()>& work) {
    if (auto error = database_.run("BEGIN IMMEDIATE")) return error;
    std::optional<Error> error = work();
    if (!error) error = database_.run("COMMIT");
    // The second failure would only repeat the first.
    if (error) static_cast<void>(database_.run("ROLLBACK"));
    return error;
}

std::optional<Error> Catalogue::writeVersion() {
    return database_.run(
        fmt::format("PRAGMA user_version = {}", CatalogueTables::kVersion).c_str());
}

/// Whether an error is the file's own, so that another file would do better. Anything else may
/// pass, and the file is the only copy of what was registered by path.
bool Catalogue::isDamage(const Error& error) const {
    if (error.domain != "SQLite") return false;
    switch (error.code) {
        case SQLITE_CORRUPT:
        case SQLITE_NOTADB:
        case SQLITE_FORMAT:
        case SQLITE_SCHEMA:
            return true;
        case SQLITE_CANTOPEN:
            return isNoReadableFile(path_);
        default:
            return false;
    }
}

/// Moves the database away. Its log goes first: beside a new database it would be taken for that
/// one's.
bool Catalogue::setAside(const Error& reason) {
    database_.close();
    const std::optional<std::string> aside = unusedDamagedName(path_);
    if (!aside) return false;
    for (const char* suffix : {"-wal", "-shm", ""})
        if (std::rename((path_ + suffix).c_str(), (*aside + suffix).c_str()) != 0 &&
            errno != ENOENT)
            return false;
    EVLOG_ERROR(ops(), "the catalogue {} cannot be used and is now {}: {}", pub(path_), pub(*aside),
                pub(reason));
    isStale_ = true;
    hasUnreadLists_ = false;
    return true;
}

std::optional<Error> Catalogue::save(const RegistryState& state, const RegistryChanges& changes) {
    leaveLostFile();
    if (!isStale_ && !changes.records() && !changes.lists()) return std::nullopt;
    std::optional<Error> error = store(state, changes);
    if (error && isDamage(*error) && setAside(*error)) error = store(state, changes);
    database_.releaseMemory();
    isStale_ = error.has_value();
    if (error) EVLOG_ERROR(ops(), "cannot write the catalogue {}: {}", pub(path_), pub(*error));
    return error;
}

std::optional<Error> Catalogue::store(const RegistryState& state, const RegistryChanges& changes) {
    if (!database_)
        if (auto error = openDatabase()) return error;
    return inTransaction([&] {
        return isStale_ ? writeAll(state) : CatalogueTables(database_).write(state, changes);
    });
}

/// What is written to a file without a name is gone with the daemon.
void Catalogue::leaveLostFile() {
    if (!database_ || !database_.hasMoved()) return;
    database_.close();
    isStale_ = true;
    hasUnreadLists_ = false;
    struct stat status;
    if (::lstat(path_.c_str(), &status) == 0)
        setAside({"SQLite", SQLITE_READONLY, "it was put in the place of the one in use"});
    else
        EVLOG_ERROR(ops(), "the catalogue {} is gone, and is written anew", pub(path_));
}

/// What could not be read of registrations and removals is not known to be gone: it stays, and
/// counts again at the next start.
std::optional<Error> Catalogue::writeAll(const RegistryState& state) {
    CatalogueTables tables(database_);
    if (auto error = tables.clear(!hasUnreadLists_)) return error;
    if (auto error = tables.write(state, everythingOf(state))) return error;
    return hasUnreadLists_ ? tables.clearForgotten() : std::nullopt;
}

}  // namespace platform::tandry
