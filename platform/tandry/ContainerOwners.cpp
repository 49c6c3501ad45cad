#include "platform/tandry/ContainerOwners.h"

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <utility>

#include "platform/log/OpsLog.h"
#include "platform/plist/PropertyList.h"
#include "platform/system/Digest.h"
#include "platform/system/Files.h"

namespace platform::tandry {

namespace {

constexpr int kVersion = 1;
/// Every plug-in of the user may have an entry.
constexpr std::size_t kMaxFile = 128u << 20;
constexpr const char* kVersionKey = "version";
constexpr const char* kPlaces = "places";
constexpr const char* kDamaged = "damaged";
constexpr const char* kApplication = "application";
constexpr const char* kContainers = "containers";

/// The name of a container that does not bear the identifier's: the digest of whose it is. A
/// `number` tells it from one that a former owner of the place has taken along.
std::string ownName(const ContainerClaim& claim, int number) {
    const std::string text =
        claim.identifier + '\0' + claim.place + '\0' + (number ? std::to_string(number) : "");
    return std::string(1, '.').append(sha256Text(text));
}

/// Names from the file become parts of paths.
bool isContainerOf(const std::string& identifier, const std::string& name) {
    return isSafeName(identifier) &&
           (name == identifier || (name.starts_with('.') && isSafeName(name.substr(1))));
}

bool isGone(const std::string& place) {
    struct stat status;
    return ::stat(place.c_str(), &status) != 0 && (errno == ENOENT || errno == ENOTDIR);
}

template <class Owner>
const std::string& placeOf(const Owner& owner) {
    return *owner.place;
}

/// Whether an owner's application has that bundle identifier, or neither has any.
template <class Owner>
bool isOf(const Owner& owner, const std::optional<std::string>& application) {
    return owner.application ? application == *owner.application : !application;
}

const Dictionary* dictionaryAt(const Dictionary& dictionary, const char* key) {
    const Value* value = dictionary.find(key);
    return value ? value->dictionary() : nullptr;
}

}  // namespace

std::optional<Error> ContainerOwners::load() {
    if (isLoaded_) return std::nullopt;
    removeLeftovers(file_);
    if (std::optional<Error> error = read()) {
        if (error->domain == "POSIX") return error;
        owners_.clear();
        const std::optional<std::string> aside = unusedDamagedName(file_);
        if (!aside || std::rename(file_.c_str(), aside->c_str()) != 0) return error;
        EVLOG_ERROR(ops(), "the owners of data containers in {} cannot be used and are now {}: {}",
                    pub(file_), pub(*aside), pub(*error));
        wasDamaged_ = isChanged_ = true;
    }
    isLoaded_ = true;
    return std::nullopt;
}

std::optional<Error> ContainerOwners::read() {
    const Result<Value> value = readPropertyListFile(file_, kMaxFile);
    if (!value) return isMissingFile(value.error()) ? std::nullopt : std::optional(value.error());
    const Error malformed{"PropertyList", 0, file_ + ": not a list of owners"};
    const Dictionary* contents = value->dictionary();
    const Value* version = contents ? contents->find(kVersionKey) : nullptr;
    const Dictionary* places = contents ? dictionaryAt(*contents, kPlaces) : nullptr;
    // What the file could not be written with again would keep everything else from being stored.
    if (!version || *version != Value(kVersion) || !places || !isPropertyList(*value))
        return malformed;
    wasDamaged_ = contents->contains(kDamaged);
    for (const auto& [place, entry] : *places)
        if (!entry.dictionary() || !take(place.string(), *entry.dictionary())) return malformed;
    return std::nullopt;
}

/// Takes over what the file says of one place; false when it makes no sense.
bool ContainerOwners::take(const std::string& place, const Dictionary& entry) {
    const Value* application = entry.find(kApplication);
    const Dictionary* containers = dictionaryAt(entry, kContainers);
    if (!place.starts_with('/') || !containers || (application && !application->string()))
        return false;
    for (const auto& [key, container] : *containers) {
        const std::string identifier = key.string();
        const auto* name = container.string();
        if (!name || !isContainerOf(identifier, name->string())) return false;
        Owners& owners = owners_[identifier];
        for (const Owner& owner : owners)
            if (owner.container == *name) return false;
        put(owners, place, name->string(),
            application ? std::optional(application->string()->string()) : std::nullopt);
    }
    return true;
}

Dictionary ContainerOwners::contents() const {
    std::map<std::string, std::pair<std::optional<std::string>, std::vector<Dictionary::Entry>>>
        byPlace;
    for (const auto& [identifier, owners] : owners_)
        for (const Owner& owner : owners) {
            auto& [application, containers] = byPlace[*owner.place];
            // One that was uninstalled before the application's name was known must not hide it.
            if (owner.application && application.value_or("").empty())
                application = *owner.application;
            containers.emplace_back(identifier, owner.container);
        }
    std::vector<Dictionary::Entry> places;
    for (auto& [place, entry] : byPlace) {
        Dictionary described{{kContainers, *Dictionary::fromEntries(std::move(entry.second))}};
        if (entry.first) described.set(kApplication, *entry.first);
        places.emplace_back(place, std::move(described));
    }
    Dictionary contents{{kVersionKey, kVersion},
                        {kPlaces, *Dictionary::fromEntries(std::move(places))}};
    if (wasDamaged_) contents.set(kDamaged, true);
    return contents;
}

std::string ContainerOwners::nameFor(const ContainerClaim& claim, const Exists& exists) {
    Owners& owners = owners_[claim.identifier];
    const auto known = find(owners, claim.place);
    const bool isKnown = known != owners.end();
    const bool isNamed = !claim.application.value_or("").empty();
    if (isKnown && (!isNamed || isOf(*known, claim.application))) return known->container;
    isChanged_ = true;
    // An application may have been met before its Info.plist was there: then nobody could tell
    // whose follower it is.
    const bool mayFollow = !isKnown || (isOf(*known, "") && known->container != claim.identifier);
    const auto former = mayFollow ? findFormer(owners, claim) : owners.end();
    if (former != owners.end()) {
        std::string container = former->container;
        owners.erase(former);
        put(owners, claim.place, container, claim.application);
        return container;
    }
    if (isKnown) {
        std::string container = known->container;
        put(owners, claim.place, container, claim.application);
        return container;
    }
    std::string name = unownedName(claim, owners, exists);
    put(owners, claim.place, name, claim.application);
    return name;
}

ContainerOwners::Owners::iterator ContainerOwners::find(Owners& owners, const std::string& place) {
    const auto found = std::ranges::lower_bound(owners, place, {}, placeOf<Owner>);
    return found != owners.end() && *found->place == place ? found : owners.end();
}

void ContainerOwners::put(Owners& owners, const std::string& place, std::string container,
                          const std::optional<std::string>& application) {
    auto owner = std::ranges::lower_bound(owners, place, {}, placeOf<Owner>);
    if (owner == owners.end() || *owner->place != place) owner = owners.emplace(owner);
    *owner = {places_.of(place), application ? applications_.of(*application) : nullptr,
              std::move(container)};
}

/// The owner elsewhere that has become the claimant.
ContainerOwners::Owners::iterator ContainerOwners::findFormer(Owners& owners,
                                                              const ContainerClaim& claim) {
    return std::ranges::find_if(owners, [&claim](const Owner& owner) {
        const std::string& place = *owner.place;
        if (place == claim.place) return false;
        if (const auto leadsTo = canonicalPath(place)) return *leadsTo == claim.place;
        return isOf(owner, claim.application) && !isOf(owner, "") && isGone(place);
    });
}

std::string ContainerOwners::unownedName(const ContainerClaim& claim, Owners& owners,
                                         const Exists& exists) {
    const auto ownerOf = [&owners](const std::string& name) {
        return std::ranges::find_if(owners,
                                    [&](const Owner& owner) { return owner.container == name; });
    };
    const std::string& plain = claim.identifier;
    const bool isThere = exists(plain);
    auto owner = ownerOf(plain);
    // Of an owner that left nothing behind there is nothing to keep.
    if (owner != owners.end() && !isThere && isGone(*owner->place)) {
        owners.erase(owner);
        owner = owners.end();
    }
    // Who had one of its own was not the first.
    const bool hadOwn = wasDamaged_ && exists(ownName(claim, 0));
    if (owner == owners.end() && !hadOwn) {
        if (!isThere || !wasDamaged_ || claim.isRemembered) return plain;
        EVLOG_ERROR(ops(), "the data container {} stays as it is: it is not known to be that of {}",
                    pub(plain), pub(claim.place));
    }
    for (int number = 0;; ++number)
        if (std::string name = ownName(claim, number); ownerOf(name) == owners.end()) return name;
}

void ContainerOwners::save() {
    if (!isChanged_) return;
    const Result<std::string> text = writeXmlPropertyList(contents(), kMaxFile);
    const std::optional<Error> error =
        text ? writeFileAtomically(file_, *text) : std::optional(text.error());
    std::string problem = error ? describe(*error) : std::string();
    if (error && problem != problem_)
        EVLOG_ERROR(ops(), "cannot store the owners of data containers: {}", pub(problem));
    problem_ = std::move(problem);
    isChanged_ = error.has_value();
}

}  // namespace platform::tandry
