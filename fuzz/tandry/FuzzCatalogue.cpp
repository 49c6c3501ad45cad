// Rows of a catalogue: an array of [table, value, ...]. What is read of them is stored, and is then
// read as it was. Rows of numbers behind those of the tables say what changes then, and what is
// looked for.
// Covers: platform/tandry/CatalogueTables.cpp platform/tandry/Sqlite.cpp
// Covers: platform/tandry/Snapshot.cpp platform/tandry/TextIndex.cpp
// platform/values/LazyDictionary.cpp

#include <fmt/format.h>

#include <algorithm>
#include <set>

#include "fuzz/Support.h"
#include "platform/tandry/CatalogueTables.h"
#include "platform/tandry/Snapshot.h"
#include "platform/values/Cbor.h"

using namespace platform;
using namespace platform::tandry;

namespace {

struct Table {
    const char* name;
    std::size_t columns;
};
constexpr Table kTables[] = {
    {"applications", 5}, {"plugins", 17}, {"registrations", 1}, {"forgotten", 4}, {"refusals", 6}};

/// Rows have the sums of what they hold by then.
constexpr const char* kSumUp =
    "UPDATE applications SET sum = checksum(path, identifier, name, placeholder, stamps);"
    "UPDATE plugins SET sum = checksum(path, uuid, application, bundle_identifier, identifier,"
    " original_identifier, version, registered, name, short_name, executable, sdk, points,"
    " container, stamps, info_plist_size, dictionaries)";

/// A value as SQL has it; whatever it does not have is null.
std::string literal(const Value& value) {
    if (const auto number = value.signedInteger()) return std::to_string(*number);
    if (const auto real = value.real()) return fmt::format("{:.17g}", *real);
    const bool isText = value.string() != nullptr;
    if (!isText && !value.data()) return "NULL";
    std::string hex;
    for (const unsigned char byte :
         isText ? std::string_view(*value.string()) : value.data()->bytes())
        hex += fmt::format("{:02x}", byte);
    return isText ? fmt::format("CAST(x'{}' AS TEXT)", hex) : fmt::format("x'{}'", hex);
}

void insert(SqliteDatabase& database, const Array& row) {
    const auto number = row.empty() ? std::nullopt : row[0].unsignedInteger();
    if (!number || *number >= std::size(kTables)) return;
    const Table& table = kTables[*number];
    std::string values;
    for (std::size_t i = 1; i <= table.columns; ++i)
        values += (i > 1 ? "," : "") + (i < row.size() ? literal(row[i]) : "NULL");
    // Some tables have a sum, behind all else. A row that SQL does not take is not there.
    const char* sum = *number < 2 ? ", NULL" : "";
    (void)database.run(
        fmt::format("INSERT OR REPLACE INTO {} VALUES({}{})", table.name, values, sum).c_str());
}

RegistryChanges everythingOf(const RegistryState& state) {
    RegistryChanges changes;
    for (const auto& [path, entry] : state.applications) changes.applications.insert(path);
    for (const auto& [path, entry] : state.plugIns) changes.installed.push_back(entry.record);
    changes.registrations = state.registrations;
    for (const auto& [path, entry] : state.forgotten) changes.forgotten.insert(path);
    for (const auto& [path, entry] : state.refusals) changes.refusals.insert(path);
    return changes;
}

/// The state without what lies at some paths, and with other stamps of what lies at others.
RegistryChanges change(RegistryState& state, const std::set<std::string>& gone,
                       const std::set<std::string>& restamped) {
    RegistryChanges changes;
    changes.applications = changes.registrations = changes.forgotten = changes.refusals = gone;
    for (const std::string& path : gone) {
        const auto plugIn = state.plugIns.find(path);
        if (plugIn != state.plugIns.end()) changes.uninstalled.push_back(plugIn->second.record);
        // A plug-in that comes anew is another one.
        if (plugIn != state.plugIns.end() && restamped.contains(path)) {
            auto record = std::make_shared<TDPlugInProxy>(*plugIn->second.record);
            record->plugInUuid = Uuid::random();
            plugIn->second.record = record;
            plugIn->second.attachDictionaries();
            changes.installed.push_back(record);
            continue;
        }
        state.plugIns.erase(path);
        state.registrations.erase(path);
        state.forgotten.erase(path);
        state.refusals.erase(path);
        std::erase_if(state.plugIns, [&](const auto& entry) {
            const auto& application = entry.second.record->containingApplication;
            const bool goes = application && application->bundlePath == path;
            if (goes) changes.uninstalled.push_back(entry.second.record);
            return goes;
        });
        state.applications.erase(path);
    }
    for (auto& [path, entry] : state.plugIns)
        if (restamped.contains(path))
            entry.print.stamps = PackedBytes(entry.print.stamps.unpacked() + "later");
    changes.restamped = restamped;
    return changes;
}

bool contains(const TDPlugInProxyList& list, const TDPlugInProxyRef& plugIn) {
    return std::ranges::find(list, plugIn) != list.end();
}

void lookAt(const Snapshot& snapshot) {
    for (const auto& plugIn : snapshot.plugIns()) {
        (void)plugIn->infoPlist.get();
        (void)plugIn->entitlements.get();
        fuzz::require(snapshot.plugInAtPath(*plugIn->bundlePath) == plugIn);
        fuzz::require(bool(snapshot.plugInWithUuid(plugIn->plugInUuid)));
        const Dictionary query{{"VXExtensionIdentifier", "=" + *plugIn->plugInIdentifier}};
        fuzz::require(contains(snapshot.candidates(query), plugIn));
        const auto& application = plugIn->containingApplication;
        if (application && plugIn->bundlePath->starts_with(application->bundlePath + "/"))
            fuzz::require(contains(snapshot.plugInsOfApplication(application->bundlePath), plugIn));
    }
}

std::set<std::string> texts(const Array& row) {
    std::set<std::string> texts;
    for (const Value& element : row)
        if (element.string()) texts.insert(element.string()->string());
    return texts;
}

/// What the rows behind those of the tables say.
struct Later {
    static constexpr std::uint64_t kFirst = std::size(kTables);

    explicit Later(const Array& rows) {
        for (const Value& row : rows) {
            const Array* fields = row.array();
            const auto number =
                fields && !fields->empty() ? (*fields)[0].unsignedInteger() : std::nullopt;
            if (number == kFirst) gone = texts(*fields);
            if (number == kFirst + 1) restamped = texts(*fields);
            if (number == kFirst + 2 && fields->size() > 1 && (*fields)[1].dictionary())
                query = *(*fields)[1].dictionary();
            if (number == kFirst + 3) damage = texts(*fields);
        }
    }
    std::set<std::string> gone, restamped;
    Dictionary query;
    std::set<std::string> damage;  // tables whose sums are wrong
};

/// Without a name it leaves no file behind.
SqliteDatabase openScratch() {
    return std::move(*SqliteDatabase::open(""));
}

/// A catalogue that is written anew, then changed, holds what the state does.
void write(RegistryState& state, const Later& later) {
    SqliteDatabase database = openScratch();
    CatalogueTables tables(database);
    fuzz::require(!tables.create() && !tables.clear(true));
    fuzz::require(!tables.write(state, everythingOf(state)));
    const Snapshot before(state);
    const RegistryChanges changes = change(state, later.gone, later.restamped);
    fuzz::require(!tables.write(state, changes));
    const Snapshot after(before, state, changes), fresh(state);
    lookAt(after);
    fuzz::require(after.plugIns() == fresh.plugIns());
    fuzz::require(after.candidates(later.query) == fresh.candidates(later.query));
    RegistryState again;
    bool leftOut = false;
    fuzz::require(!tables.read(again, leftOut) && !leftOut);
    fuzz::require(again.plugIns.size() == state.plugIns.size());
    fuzz::require(again.applications.size() == state.applications.size());
    fuzz::require(again.registrations == state.registrations);
    fuzz::require(again.forgotten.size() == state.forgotten.size());
    fuzz::require(again.refusals.size() == state.refusals.size());
    fuzz::require(!tables.clearForgotten());
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const auto rows = decodeCbor(std::make_shared<const std::string>(fuzz::text(data, size)));
    if (!rows || !rows->array()) return 0;
    SqliteDatabase database = openScratch();
    fuzz::require(!CatalogueTables(database).create());
    for (const Value& row : *rows->array())
        if (row.array()) insert(database, *row.array());
    fuzz::require(!database.run(kSumUp));
    const Later later(*rows->array());
    for (const std::string& table : later.damage)
        (void)database.run(fmt::format("UPDATE \"{}\" SET sum = x'00'", table).c_str());

    RegistryState state;
    bool leftOut = false;
    const auto error = CatalogueTables(database).read(state, leftOut);
    fuzz::require(!error || !later.damage.empty());
    if (error) return 0;
    lookAt(Snapshot(state));
    write(state, later);
    return 0;
}
