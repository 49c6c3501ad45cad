#include "platform/tandry/ApplicationScanner.h"

#include <fcntl.h>
#include <fmt/format.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <filesystem>

#include "platform/log/OpsLog.h"
#include "platform/system/Files.h"
#include "platform/tandry/FolderEntries.h"

namespace platform::tandry {

namespace {

constexpr std::string_view kApplicationSuffix = ".app";
constexpr std::string_view kPlugIns = "PlugIns";
constexpr const char* kLeavingOut = "leaving out a plug-in:";

/// The domain of refusals for want of room.
constexpr const char* kRoom = "Room";

Date now() {
    using Seconds = std::chrono::duration<double>;
    return {Seconds(std::chrono::system_clock::now().time_since_epoch()).count()};
}

bool isMissing(const Error& error) {
    return error.code == ENOENT;
}

}  // namespace

ApplicationScanner::ApplicationScanner(RegistryState& state, BundleReader& reader,
                                       DataContainers& containers, FolderWatch& watch,
                                       UntrustedPlaces& untrusted, ForeignPlaces& places,
                                       Folders folders)
    : state_(state),
      reader_(reader),
      containers_(containers),
      watch_(watch),
      untrusted_(untrusted),
      places_(places),
      folders_(std::move(folders)) {}

bool ApplicationScanner::isApplication(std::string_view path) {
    std::string_view name = lastPathComponent(path);
    return name.size() > kApplicationSuffix.size() && name.ends_with(kApplicationSuffix);
}

std::string ApplicationScanner::applicationAbove(std::string_view path) {
    for (path = parentPath(path); path.size() > 1; path = parentPath(path))
        if (isApplication(path)) return std::string(path);
    return {};
}

bool ApplicationScanner::isHeld(const std::string& path) {
    std::string_view application = path;
    if (!isApplication(path)) {
        std::string_view folder = parentPath(path);
        if (lastPathComponent(folder) != kPlugIns) return false;
        application = parentPath(folder);
    }
    return isApplication(application) &&
           std::ranges::any_of(folders_.applications, [&](const auto& folder) {
               return places_.answers(folder) && canonicalPath(folder) == parentPath(application);
           });
}

void ApplicationScanner::begin(bool overEverything) {
    pass_ = ++state_.lastPass;
    metPlugIns_ = 0;
    isIncomplete_ = hasTransientFailure_ = false;
    unreachable_.clear();
    reader_.beginPass();
    watch_.beginWalk(overEverything);
    places_.beginWalk();
    untrusted_.beginWalk();
    containers_.beginWalk();
    complaints_.beginWalk();
    room_.count(state_);
    if (overEverything) links_.clear();
}

RegistryChanges ApplicationScanner::scanAll() {
    begin(true);
    visitAll();
    return finish({std::string()});
}

RegistryChanges ApplicationScanner::scanPath(const std::string& path, bool& hasPlugIns) {
    begin(false);
    if (state_.registrations.contains(path)) watch_.markWay(path);
    complaints_.setLevel(LogLevel::Info);
    visitPath(path);
    complaints_.setLevel(LogLevel::Error);
    hasPlugIns = metPlugIns_ != 0;
    std::string refusal = changes_.refusal;
    const bool isAlone = isSelfContained(path) && visitScope(path);
    if (!isAlone) visitAll();
    changes_.refusal = std::move(refusal);
    return finish({isAlone ? path : std::string()});
}

RegistryChanges ApplicationScanner::scanTouched(const Scopes& scopes) {
    places_.beginWalk();
    auto isNamed = [this](const std::string& path) {
        return places_.answers(path) && (state_.registrations.contains(path) || isHeld(path)) &&
               isSelfContained(path);
    };
    if (!std::ranges::all_of(scopes, isNamed)) return scanAll();
    begin(false);
    if (std::ranges::all_of(scopes, [this](const auto& path) { return visitScope(path); }))
        return finish(scopes);
    visitAll();
    return finish({std::string()});
}

/// Whether nothing but what lies within an application or plug-in decides what is installed there,
/// and nothing elsewhere depends on it: then a walk over it alone is enough.
bool ApplicationScanner::isSelfContained(const std::string& scope) const {
    std::error_code ignored;
    bool hasLinks = std::filesystem::is_symlink(scope, ignored);
    forEachWithin(links_, scope, [&](auto) { hasLinks = true; });
    return !hasLinks;
}

/// Whether plug-ins refer to an application as it was before this walk.
bool ApplicationScanner::isOutdated(const std::string& application) const {
    auto found = state_.applications.find(application);
    if (found == state_.applications.end()) return false;
    bool result = false;
    forEachWithin(state_.plugIns, application, [&](auto entry) {
        const TDApplicationProxyRef& known = entry->second.record->containingApplication;
        if (known && known->bundlePath == application && known != found->second.record)
            result = true;
    });
    return result;
}

/// Visits a self-contained path and what is registered inside. Answers whether that was enough: an
/// application that changed is part of its other plug-ins' records too, and a plug-in that is not
/// there may leave an application that nothing needs any more.
bool ApplicationScanner::visitScope(const std::string& path) {
    if (canonicalPath(path) == path) visitPath(path);
    forEachWithin(state_.registrations, path, [this](auto inside) { visitRegistration(*inside); });
    return isApplication(path) || (isAllMet(path) && !isOutdated(applicationAbove(path)));
}

void ApplicationScanner::visitAll() {
    for (const std::string& folder : folders_.dictionaries) {
        if (!places_.answers(folder)) {
            // Those who need it stay as they are.
            hasTransientFailure_ = true;
            continue;
        }
        watch_.markWay(folder);
        if (std::optional<std::string> canonical = canonicalPath(folder))
            watch_.markContents(*canonical, {});
    }
    for (const std::string& folder : folders_.applications) {
        if (!places_.answers(folder)) {
            // Links may lead there by another name.
            if (!folderPaths_.contains(folder)) isIncomplete_ = true;
            keepUnseen(folderPaths_.try_emplace(folder, folder).first->second);
            continue;
        }
        watch_.markWay(folder);
        if (std::optional<std::string> canonical = canonicalPath(folder))
            visitFolder(folderPaths_[folder] = *canonical);
        else
            unreachable_.push_back(folder);
    }
    for (const std::string& path : state_.registrations) visitRegistration(path);
}

void ApplicationScanner::visitRegistration(const std::string& path) {
    if (!canSee(path)) return;
    watch_.markWay(path);
    if (canonicalPath(path) == path) {
        visitPath(path);
    } else {
        EVLOG_INFO(ops(), "nothing at registered path {}", path);
        unreachable_.push_back(path);
    }
}

void ApplicationScanner::visitFolder(const std::string& folder) {
    if (isUntrusted(folder, "applications")) return;
    watch_.markEntries(folder, kApplicationSuffix);
    Result<FolderEntries> found = FolderEntries::read(folder, watch_, places_, complaints_);
    if (!found) {
        complaints_.add(folder, "cannot look for applications:", found.error().text);
        unreachable_.push_back(folder);
        // Its links may lead anywhere.
        if (noteTransient(found.error())) isIncomplete_ = true;
        return;
    }
    noteLost(*found);
    for (const auto& [name, target] : found->entries) {
        if (!isApplication(name)) continue;
        const std::string entry = joinPath(folder, name);
        if (!target.empty()) noteLink(entry, target);
        if (target.empty())
            visitApplication(BundleFolder(found->directory(), folder, name));
        else if (isApplication(target))
            visitApplication(BundleFolder(target));
        else
            complaints_.add(entry, "skipping",
                            fmt::format("{}: {} is not an application directory", entry, target));
    }
}

void ApplicationScanner::noteLink(const std::string& link, const std::string& target) {
    links_.insert(link);
    links_.insert(target);
}

void ApplicationScanner::visitPath(const std::string& path) {
    if (isApplication(path))
        visitApplication(BundleFolder(path));
    else
        visitPlugIn(BundleFolder(path), applicationOf(path), path);
}

void ApplicationScanner::visitApplication(const BundleFolder& place) {
    const std::string& path = place.path;
    // Two links may lead to one application.
    auto known = state_.applications.find(path);
    if (known != state_.applications.end() && known->second.plugInsPass == pass_) return;
    if (!canSee(place)) return;
    if (isUntrusted(path, place.identity(), "an application")) return;
    watch_.markContents(path, path);
    std::string folder = joinPath(path, kPlugIns);
    std::error_code ignored;
    if (places_.answers(folder) && std::filesystem::is_symlink(folder, ignored)) {
        watch_.markWay(folder);
        std::string target = canonicalPath(folder).value_or(folder);
        noteLink(folder, target);
        folder = std::move(target);
        if (isUntrusted(folder, "plug-ins")) return;
    }
    visitPlugIns(place, folder);
}

/// An application that cannot be looked into is not known.
void ApplicationScanner::visitPlugIns(const BundleFolder& place, const std::string& folder) {
    const std::string& application = place.path;
    if (!canSee(folder)) {
        unreachable_.push_back(application);
        if (!state_.applications.contains(application)) return;
        static_cast<void>(applicationAt(place));
        state_.applications[application].plugInsPass = pass_;
        return;
    }
    watch_.markContents(folder, application);
    Result<FolderEntries> found = FolderEntries::read(folder, watch_, places_, complaints_);
    if (!found && !isMissing(found.error())) {
        complaints_.add(folder, "cannot look for plug-ins:", found.error().text);
        if (changes_.refusal.empty()) changes_.refusal = found.error().text;
        unreachable_.push_back(application);
        if (noteTransient(found.error())) isIncomplete_ = true;
        return;
    }
    TDApplicationProxyRef record = applicationAt(place);
    state_.applications[application].plugInsPass = pass_;
    if (!found) return;
    noteLost(*found);
    const bool isInside = isWithin(folder, application);
    for (const auto& [name, target] : found->entries)
        if (!target.empty()) {
            noteLink(joinPath(folder, name), target);
            visitPlugIn(BundleFolder(target), applicationOf(target), application);
        } else {
            visitPlugIn(BundleFolder(found->directory(), folder, name),
                        isInside ? record : applicationOf(joinPath(folder, name)), application);
        }
}

TDApplicationProxyRef ApplicationScanner::applicationAt(const BundleFolder& folder) {
    const std::string& path = folder.path;
    ApplicationEntry& entry = state_.applications[path];
    if (std::exchange(entry.pass, pass_) == pass_) return entry.record;
    watch_.markContents(path, path);
    if (entry.record && reader_.applicationStamps(folder) == entry.stamps) return entry.record;
    BundleReader::ApplicationReading reading = reader_.readApplication(folder);
    // What cannot be read just now is not known to have changed.
    if (reading.failure && noteTransient(*reading.failure) && entry.record) return entry.record;
    if (entry.record && *entry.record == *reading.record &&
        reader_.areApplicationStampsLike(entry.stamps, reading.stamps)) {
        entry.stamps = std::move(reading.stamps);
        changes_.restamped.insert(path);
        return entry.record;
    }
    if (reading.failure && !reading.record->isPlaceholder)
        complaints_.add(path, "application without name and identifier:", reading.failure->text);
    entry.record = std::move(reading.record);
    entry.stamps = std::move(reading.stamps);
    changes_.applications.insert(path);
    return entry.record;
}

/// Whether an error says nothing about the disk: then another walk has to come.
bool ApplicationScanner::noteTransient(const Error& error) {
    const bool isSo = isTransient(error);
    hasTransientFailure_ = hasTransientFailure_ || isSo;
    return isSo;
}

TDApplicationProxyRef ApplicationScanner::applicationOf(const std::string& plugInPath) {
    std::string path = applicationAbove(plugInPath);
    return path.empty() ? nullptr : applicationAt(BundleFolder(std::move(path)));
}

/// Whether a bundle lies where none is taken from. What an earlier walk took from there goes at
/// once, also when this one turns out to be incomplete.
bool ApplicationScanner::isUntrusted(const std::string& path, const FileIdentity& directory,
                                     const char* kind) {
    const char* place = untrusted_.around(path, directory);
    if (!place) return false;
    const std::string reason = fmt::format("{}: it lies in {}", path, place);
    complaints_.add(path, "leaving out", fmt::format("{}: {}", kind, reason));
    if (changes_.refusal.empty()) changes_.refusal = reason;
    forEachWithin(state_.plugIns, path, [this](auto entry) {
        room_.remove(entry->second);
        changes_.uninstalled.push_back(entry->second.record);
        state_.plugIns.erase(entry);
    });
    return true;
}

bool ApplicationScanner::isUntrusted(const std::string& path, const char* kind) {
    return isUntrusted(path, FileIdentity::at(AT_FDCWD, path.c_str()), kind);
}

/// Nothing is left of a forgotten bundle that its content could be compared with.
bool ApplicationScanner::isForgotten(const BundleFolder& folder) {
    auto found = state_.forgotten.find(folder.path);
    if (found == state_.forgotten.end()) return false;
    const Fingerprint& print = found->second.print;
    if (!reader_.isLike(reader_.refreshed(folder, print), print)) return false;
    found->second.pass = pass_;
    return true;
}

bool ApplicationScanner::isRefused(const BundleFolder& folder, const FileIdentity& directory,
                                   const std::string& application) {
    auto found = state_.refusals.find(folder.path);
    if (found == state_.refusals.end()) return false;
    Refusal& refusal = found->second;
    if (refusal.pass == pass_) return true;
    if (!reader_.isUnchanged(folder, directory, refusal.print)) return false;
    if (refusal.size != 0 && !room_.excess(application, refusal.size)) return false;
    // Remembered from an earlier run: its author has to be told in this one as well.
    if (std::exchange(refusal.pass, pass_) == 0) complaints_.say(kLeavingOut, refusal.reason);
    if (changes_.refusal.empty()) changes_.refusal = refusal.reason;
    return true;
}

/// Meets a plug-in that did not change. Its container may have: when something came into its place
/// or went, and when its application was away and another one took it over. Then another record
/// says so; one that nobody has seen yet is completed.
void ApplicationScanner::keep(PlugInEntry& entry) {
    const bool isShared = std::exchange(entry.pass, pass_) != 0;
    if (!entry.needsContainer) return;
    const auto container = containers_.locate(*entry.record, true);
    if (!container) return static_cast<void>(noteTransient(container.error()));
    if (*container == entry.record->dataContainerPath) return;
    if (isShared) replace(entry);
    entry.record->dataContainerPath = *container;
}

/// Puts a copy, which nobody has seen, in the place of a record.
void ApplicationScanner::replace(PlugInEntry& entry) {
    changes_.uninstalled.push_back(entry.record);
    entry.record = std::make_shared<TDPlugInProxy>(*entry.record);
    entry.record->plugInUuid = Uuid::random();
    changes_.installed.push_back(entry.record);
}

/// Whether what was read anew is what is known, so that at most stamps have changed. A record that
/// nobody has seen yet takes over the number that its device has now.
bool ApplicationScanner::isSame(PlugInEntry& known, const PlugInEntry& read) {
    TDPlugInProxy& record = *known.record;
    const FileIdentity& identity = read.record->bundleIdentity;
    const bool isSame = *known.dictionaries == *read.dictionaries &&
                        known.infoPlistSize == read.infoPlistSize && known.points == read.points &&
                        record.localizedName == read.record->localizedName &&
                        record.localizedShortName == read.record->localizedShortName &&
                        (known.pass == 0 || record.bundleIdentity == identity) &&
                        (known.print.executableDigest.empty() ||
                         known.print.executableDigest == read.print.executableDigest) &&
                        reader_.isLike(known.print, read.print);
    if (isSame && known.pass == 0) record.bundleIdentity = identity;
    return isSame;
}

void ApplicationScanner::visitPlugIn(const BundleFolder& folder,
                                     const TDApplicationProxyRef& application,
                                     const std::string& scope) {
    if (!canSee(folder)) return;
    const FileIdentity directory = folder.identity();
    if (isUntrusted(folder.path, directory, "a plug-in")) return;
    watch_.markContents(folder.path, scope);
    auto found = state_.plugIns.find(folder.path);
    PlugInEntry* known = found == state_.plugIns.end() ? nullptr : &found->second;
    if (known && known->pass == pass_) return static_cast<void>(++metPlugIns_);
    const bool isInPlace =
        known && known->record->containingApplication == application && !isBeyondRoom(*known);
    if (isInPlace && reader_.isUnchanged(folder, directory, known->print)) {
        ++metPlugIns_;
        return keep(*known);
    }
    if (isForgotten(folder)) return;
    if (isRefused(folder, directory, application ? application->bundlePath : std::string())) return;
    const bool hasDigest = known && !known->print.executableDigest.empty();
    BundleReader::Reading reading = reader_.readPlugIn(folder, hasDigest);
    // One that cannot be read is not known to have changed.
    if (reading.refusal && reading.refusal->domain == "POSIX")
        unreachable_.push_back(folder.path);
    else if (state_.forgotten.erase(folder.path))
        changes_.forgotten.insert(folder.path);
    if (reading.refusal) return refuse(folder, std::move(reading));
    if (!isInPlace || !isSame(*known, reading.entry))
        return install(folder, std::move(reading), application);
    known->print = std::move(reading.entry.print);
    changes_.restamped.insert(folder.path);
    ++metPlugIns_;
    keep(*known);
}

/// Whether a record of the catalogue takes more room than there is.
bool ApplicationScanner::isBeyondRoom(const PlugInEntry& entry) const {
    return entry.pass == 0 && room_.excess(DictionaryRoom::applicationOf(*entry.record), 0);
}

void ApplicationScanner::refuse(const BundleFolder& folder, BundleReader::Reading reading) {
    const Error& error = *reading.refusal;
    if (changes_.refusal.empty()) changes_.refusal = error.text;
    if (error.domain == "POSIX") {
        complaints_.add(folder.path, kLeavingOut, error.text);
        auto known = state_.plugIns.find(folder.path);
        if (noteTransient(error) && known != state_.plugIns.end()) keep(known->second);
        return;
    }
    Refusal& refusal = state_.refusals[folder.path];
    // Read again, and the same: that has been told.
    if (refusal.pass == 0 || refusal.reason != error.text ||
        !reader_.isLike(refusal.print, reading.entry.print))
        complaints_.add(folder.path, kLeavingOut, error.text);
    const std::size_t size = reading.entry.dictionaries ? reading.entry.dictionaries->size() : 0;
    refusal = {std::move(reading.entry.print), error.text, error.domain == kRoom ? size : 0, pass_};
    changes_.refusals.insert(folder.path);
}

void ApplicationScanner::install(const BundleFolder& folder, BundleReader::Reading reading,
                                 const TDApplicationProxyRef& application) {
    PlugInEntry& entry = reading.entry;
    TDPlugInProxy& record = *entry.record;
    record.plugInUuid = Uuid::random();
    record.registrationDate = now();
    record.containingApplication = application;
    auto known = state_.plugIns.find(folder.path);
    const bool isNew = known == state_.plugIns.end();
    const bool isRemembered =
        !isNew && known->second.record->plugInIdentifier == record.plugInIdentifier;
    if (!isNew) {
        room_.remove(known->second);
        changes_.uninstalled.push_back(known->second.record);
        state_.plugIns.erase(known);
    }
    if (const char* excess =
            room_.excess(DictionaryRoom::applicationOf(record), entry.dictionaries->size())) {
        reading.refusal = Error{kRoom, 0, fmt::format("{}: {}", folder.path, excess)};
        return refuse(folder, std::move(reading));
    }
    if (state_.refusals.erase(folder.path)) changes_.refusals.insert(folder.path);
    room_.add(entry);
    if (entry.needsContainer) {
        const auto container = containers_.locate(record, isRemembered);
        if (container)
            record.dataContainerPath = *container;
        else
            noteTransient(container.error());
    }
    entry.pass = pass_;
    ++metPlugIns_;
    changes_.installed.push_back(entry.record);
    state_.plugIns.emplace(folder.path, std::move(entry));
}

}  // namespace platform::tandry
