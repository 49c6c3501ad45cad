// Rows of a catalogue: an array of [table, value, ...]. What is read of them is stored, and is then
// read as it was.
// Covers: platform/tandry/CatalogueTables.cpp platform/tandry/Sqlite.cpp
// Covers: platform/tandry/Snapshot.cpp

#include <fmt/format.h>

#include <algorithm>

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

void lookAt(const RegistryState& state) {
    const Snapshot snapshot(state);
    for (const auto& plugIn : snapshot.plugIns()) {
        (void)plugIn->infoPlist.get();
        (void)plugIn->entitlements.get();
        fuzz::require(snapshot.plugInAtPath(*plugIn->bundlePath) == plugIn);
        const Dictionary query{{"VXExtensionIdentifier", "=" + *plugIn->plugInIdentifier}};
        const auto found = snapshot.candidates(query);
        fuzz::require(std::ranges::find(found, plugIn) != found.end());
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const auto rows = decodeCbor(std::make_shared<const std::string>(fuzz::text(data, size)));
    if (!rows || !rows->array()) return 0;
    SqliteDatabase database = std::move(*SqliteDatabase::open(":memory:"));
    fuzz::require(!CatalogueTables(database).create());
    for (const Value& row : *rows->array())
        if (row.array()) insert(database, *row.array());
    fuzz::require(!database.run(kSumUp));

    RegistryState state;
    bool leftOut = false;
    fuzz::require(!CatalogueTables(database).read(state, leftOut));
    lookAt(state);
    SqliteDatabase second = std::move(*SqliteDatabase::open(":memory:"));
    fuzz::require(!CatalogueTables(second).create());
    fuzz::require(!CatalogueTables(second).write(state, everythingOf(state)));
    RegistryState again;
    fuzz::require(!CatalogueTables(second).read(again, leftOut = false) && !leftOut);
    fuzz::require(again.plugIns.size() == state.plugIns.size());
    fuzz::require(again.registrations == state.registrations);
    return 0;
}
