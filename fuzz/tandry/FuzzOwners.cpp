// The file that says whose each data container is, then claims: arrays of an identifier, a place,
// an application's identifier and whether the catalogue knows the plug-in; "." claims that
// containers are there. What is stored says who has what, and no container is given to two.
// Covers: platform/tandry/ContainerOwners.cpp

#include "fuzz/Support.h"
#include "platform/system/Files.h"
#include "platform/tandry/ContainerOwners.h"
#include "platform/values/Cbor.h"

using namespace platform;
using namespace platform::tandry;

namespace {

/// "@" stands for where applications are: there are "A.app", and "B.app", which leads to it. The
/// registry has no bundles, nor paths, whose texts no property list can hold.
std::optional<ContainerClaim> claimIn(const Value& value) {
    const Array* fields = isPropertyList(value) ? value.array() : nullptr;
    if (!fields || fields->size() < 2) return std::nullopt;
    const Text* identifier = (*fields)[0].string();
    const Text* place = (*fields)[1].string();
    if (!identifier || !isSafeName(*identifier) || !place) return std::nullopt;
    ContainerClaim claim{identifier->string(), place->string(), std::nullopt};
    if (claim.place.starts_with('@')) claim.place.replace(0, 1, fuzz::home().path());
    if (!claim.place.starts_with('/')) return std::nullopt;
    if (fields->size() > 2 && (*fields)[2].string())
        claim.application = (*fields)[2].string()->string();
    claim.isRemembered = fields->size() > 3;
    return claim;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const std::string applications = fuzz::home().makeDirectory("A.app");
    static const bool isLinked = [] {
        std::filesystem::create_symlink("A.app", fuzz::home().path("B.app"));
        return true;
    }();
    fuzz::require(isLinked);
    const auto parts = fuzz::parts(fuzz::text(data, size), 2);
    std::filesystem::remove_all(fuzz::home().path("owners"));
    std::string bytes(parts[0]);
    for (std::size_t at = 0; (at = bytes.find('@', at)) != bytes.npos;)
        bytes.replace(at, 1, fuzz::home().path());
    const std::string file = fuzz::home().write("owners/file", bytes);
    ContainerOwners owners(file);
    fuzz::require(!owners.load() && !owners.load());
    const auto claims = decodeCbor(std::make_shared<const std::string>(parts[1]));
    if (!claims || !claims->array()) return 0;

    bool isThere = false;
    std::optional<ContainerClaim> last;
    std::string name;
    for (const Value& value : *claims->array()) {
        if (value.string()) isThere = *value.string() == ".";
        auto claim = claimIn(value);
        if (!claim) continue;
        name = owners.nameFor(*claim, [&](const std::string&) { return isThere; });
        fuzz::require(name == claim->identifier || name.starts_with('.'));
        last = std::move(claim);
    }
    owners.save();
    ContainerOwners again(file);
    fuzz::require(!again.load());
    // It was not set aside.
    fuzz::require(!last || std::filesystem::exists(file));
    if (last)
        fuzz::require(again.nameFor(*last, [&](const std::string&) { return isThere; }) == name);
    return 0;
}
