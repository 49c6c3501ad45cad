#include "platform/tandry/ApplicationScanner.h"

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <filesystem>

#include "platform/Files.h"
#include "platform/Log.h"
#include "platform/tandry/FolderEntries.h"

namespace platform::tandry {

namespace {

constexpr std::string_view kApplicationSuffix = ".app";
constexpr std::string_view kPlugIns = "PlugIns";

const Log& ops() {
    static const Log& handle = Log::make("com.orbel.Zorvan", "ops");
    return handle;
}

Date now() {
    using Seconds = std::chrono::duration<double>;
    return {Seconds(std::chrono::system_clock::now().time_since_epoch()).count()};
}

bool isMissing(const Error& error) {
    return error.code == ENOENT;
}

/// Whether a failure says nothing about the disk's content: nothing may be dropped for it.
bool isPassing(const Error& error) {
    return error.domain == "POSIX" && (error.code == EMFILE || error.code == ENFILE ||
                                       error.code == ENOMEM || error.code == EIO);
}

}  // namespace

ApplicationScanner::ApplicationScanner(RegistryState& state, BundleReader& reader,
                                       DataContainers& containers,
                                       std::vector<std::string> applicationFolders)
    : state_(state),
      reader_(reader),
      containers_(containers),
      folders_(std::move(applicationFolders)) {}

bool ApplicationScanner::isApplication(std::string_view path) {
    std::string_view name = lastPathComponent(path);
    return name.size() > kApplicationSuffix.size() && name.ends_with(kApplicationSuffix);
}

std::string ApplicationScanner::applicationAbove(std::string_view path) {
    for (path = parentPath(path); path.size() > 1; path = parentPath(path))
        if (isApplication(path)) return std::string(path);
    return {};
}

bool ApplicationScanner::isHeld(const std::string& path) const {
    std::string_view application = path;
    if (!isApplication(path)) {
        std::string_view folder = parentPath(path);
        if (lastPathComponent(folder) != kPlugIns) return false;
        application = parentPath(folder);
    }
    return isApplication(application) && std::ranges::any_of(folders_, [&](const auto& folder) {
               return canonicalPath(folder) == parentPath(application);
           });
}

void ApplicationScanner::begin() {
    ++pass_;
    metPlugIns_ = 0;
    isIncomplete_ = false;
    unreachable_.clear();
    reader_.beginPass();
}

RegistryChanges ApplicationScanner::scanAll() {
    begin();
    visitAll();
    return finish({});
}

RegistryChanges ApplicationScanner::scanPath(const std::string& path, bool& hasPlugIns) {
    begin();
    bool isKnown = state_.applications.contains(applicationAbove(path));
    visitPath(path);
    hasPlugIns = metPlugIns_ != 0;
    // An application that changed is part of its other plug-ins' records too. What was not met may
    // be there by another road: a registration of its own, or a link.
    const bool hasChanged = isKnown && !isApplication(path) && !changes_.applications.empty();
    if (!hasChanged && isAllMet(path)) return finish(path);
    std::string refusal = changes_.refusal;
    visitAll();
    changes_.refusal = std::move(refusal);
    return finish({});
}

void ApplicationScanner::visitAll() {
    for (const std::string& folder : folders_)
        if (std::optional<std::string> canonical = canonicalPath(folder))
            visitFolder(*canonical);
        else
            unreachable_.push_back(folder);
    for (const std::string& path : state_.registrations)
        if (canonicalPath(path) == path) {
            visitPath(path);
        } else {
            EVLOG_INFO(ops(), "nothing at registered path {}", path);
            unreachable_.push_back(path);
        }
}

void ApplicationScanner::visitFolder(const std::string& folder) {
    Result<FolderEntries> found = FolderEntries::read(folder);
    if (!found) {
        EVLOG_ERROR(ops(), "cannot look for applications: {}", pub(found.error().text));
        unreachable_.push_back(folder);
        // Its links may lead anywhere.
        if (isPassing(found.error())) isIncomplete_ = true;
        return;
    }
    for (const auto& [name, target] : found->entries) {
        if (!isApplication(name)) continue;
        std::string path = target.empty() ? joinPath(folder, name) : target;
        if (isApplication(path))
            visitApplication(path);
        else
            EVLOG_ERROR(ops(), "skipping {}: {} is not an application directory",
                        pub(joinPath(folder, name)), pub(path));
    }
}

void ApplicationScanner::visitPath(const std::string& path) {
    if (isApplication(path))
        visitApplication(path);
    else
        visitPlugIn(BundleFolder(path), applicationOf(path));
}

void ApplicationScanner::visitApplication(const std::string& path) {
    // Two links may lead to one application.
    auto known = state_.applications.find(path);
    if (known != state_.applications.end() && known->second.plugInsPass == pass_) return;
    std::string folder = joinPath(path, kPlugIns);
    std::error_code ignored;
    if (std::filesystem::is_symlink(folder, ignored))
        folder = canonicalPath(folder).value_or(folder);
    visitPlugIns(path, folder);
}

/// An application that cannot be looked into is not known.
void ApplicationScanner::visitPlugIns(const std::string& application, const std::string& folder) {
    Result<FolderEntries> found = FolderEntries::read(folder);
    if (!found && !isMissing(found.error())) {
        EVLOG_ERROR(ops(), "cannot look for plug-ins: {}", pub(found.error().text));
        if (changes_.refusal.empty()) changes_.refusal = found.error().text;
        unreachable_.push_back(application);
        if (isPassing(found.error())) isIncomplete_ = true;
        return;
    }
    TDApplicationProxyRef record = applicationAt(application);
    state_.applications[application].plugInsPass = pass_;
    if (!found) return;
    const bool isInside = isWithin(folder, application);
    for (const auto& [name, target] : found->entries)
        if (!target.empty())
            visitPlugIn(BundleFolder(target), applicationOf(target));
        else
            visitPlugIn(BundleFolder(found->directory(), folder, name),
                        isInside ? record : applicationOf(joinPath(folder, name)));
}

TDApplicationProxyRef ApplicationScanner::applicationAt(const std::string& path) {
    ApplicationEntry& entry = state_.applications[path];
    if (std::exchange(entry.pass, pass_) == pass_) return entry.record;
    BundleFolder folder(path);
    if (!entry.record || reader_.applicationStamps(folder) != entry.stamps) {
        entry = reader_.readApplication(folder);
        entry.pass = pass_;
        changes_.applications.insert(path);
    }
    return entry.record;
}

TDApplicationProxyRef ApplicationScanner::applicationOf(const std::string& plugInPath) {
    std::string path = applicationAbove(plugInPath);
    return path.empty() ? nullptr : applicationAt(path);
}

bool ApplicationScanner::isForgotten(const BundleFolder& folder) {
    auto found = state_.forgotten.find(folder.path);
    if (found == state_.forgotten.end() || !reader_.isUnchanged(folder, found->second.print))
        return false;
    found->second.pass = pass_;
    return true;
}

bool ApplicationScanner::isRefused(const BundleFolder& folder) {
    auto found = state_.refusals.find(folder.path);
    if (found == state_.refusals.end()) return false;
    Refusal& refusal = found->second;
    if (refusal.pass == pass_) return true;
    if (!reader_.isUnchanged(folder, refusal.print)) {
        state_.refusals.erase(found);
        changes_.refusals.insert(folder.path);
        return false;
    }
    // Remembered from an earlier run: its author has to be told in this one as well.
    if (std::exchange(refusal.pass, pass_) == 0)
        EVLOG_ERROR(ops(), "leaving out a plug-in: {}", pub(refusal.reason));
    if (changes_.refusal.empty()) changes_.refusal = refusal.reason;
    return true;
}

void ApplicationScanner::visitPlugIn(const BundleFolder& folder,
                                     const TDApplicationProxyRef& application) {
    auto found = state_.plugIns.find(folder.path);
    if (found != state_.plugIns.end()) {
        PlugInEntry& entry = found->second;
        if (entry.pass == pass_) {
            ++metPlugIns_;
            return;
        }
        if (entry.record->containingApplication == application &&
            reader_.isUnchanged(folder, entry.print)) {
            if (entry.pass == 0 && entry.needsContainer)
                entry.record->dataContainerPath =
                    containers_.locate(*entry.record->plugInIdentifier);
            entry.pass = pass_;
            ++metPlugIns_;
            return;
        }
    }
    if (isForgotten(folder) || isRefused(folder)) return;
    BundleReader::Reading reading = reader_.readPlugIn(folder);
    // One that cannot be read is not known to have changed.
    if (reading.refusal && reading.refusal->domain == "POSIX")
        unreachable_.push_back(folder.path);
    else if (state_.forgotten.erase(folder.path))
        changes_.forgotten.insert(folder.path);
    if (reading.refusal)
        refuse(folder, std::move(reading));
    else
        install(folder, std::move(reading.entry), application);
}

void ApplicationScanner::refuse(const BundleFolder& folder, BundleReader::Reading reading) {
    const Error& error = *reading.refusal;
    EVLOG_ERROR(ops(), "leaving out a plug-in: {}", pub(error.text));
    if (changes_.refusal.empty()) changes_.refusal = error.text;
    if (error.domain == "POSIX") {
        auto known = state_.plugIns.find(folder.path);
        if (isPassing(error) && known != state_.plugIns.end()) known->second.pass = pass_;
        return;
    }
    state_.refusals[folder.path] = {std::move(reading.entry.print), error.text, pass_};
    changes_.refusals.insert(folder.path);
}

void ApplicationScanner::install(const BundleFolder& folder, PlugInEntry entry,
                                 const TDApplicationProxyRef& application) {
    TDPlugInProxy& record = *entry.record;
    record.plugInUuid = Uuid::random();
    record.registrationDate = now();
    record.containingApplication = application;
    if (entry.needsContainer)
        record.dataContainerPath = containers_.locate(*record.plugInIdentifier);
    entry.pass = pass_;
    ++metPlugIns_;
    changes_.installed.push_back(entry.record);
    auto [place, isNew] = state_.plugIns.try_emplace(folder.path);
    if (!isNew) changes_.uninstalled.push_back(place->second.record);
    place->second = std::move(entry);
}

bool ApplicationScanner::isAllMet(const std::string& scope) {
    bool result = true;
    auto look = [&](auto entry) { result = result && entry->second.pass == pass_; };
    forEachWithin(state_.applications, scope, look);
    forEachWithin(state_.plugIns, scope, look);
    return result;
}

/// What was forgotten stays so while it cannot be looked at, be it unreadable or on a volume that
/// is not mounted.
bool ApplicationScanner::isUnreachable(const std::string& path) const {
    return std::ranges::any_of(unreachable_,
                               [&path](const auto& scope) { return isWithin(path, scope); });
}

/// Drops what lies within `scope` and was not met by this walk.
RegistryChanges ApplicationScanner::finish(const std::string& scope) {
    if (isIncomplete_) return std::exchange(changes_, {});
    auto dropUnmet = [&](auto& map, auto note) {
        forEachWithin(map, scope, [&](auto entry) {
            if (entry->second.pass == pass_) return;
            note(*entry);
            map.erase(entry);
        });
    };
    dropUnmet(state_.plugIns,
              [&](auto& entry) { changes_.uninstalled.push_back(entry.second.record); });
    dropUnmet(state_.applications, [&](auto& entry) { changes_.applications.insert(entry.first); });
    dropUnmet(state_.refusals, [&](auto& entry) { changes_.refusals.insert(entry.first); });
    forEachWithin(state_.forgotten, scope, [&](auto entry) {
        if (entry->second.pass == pass_ || isUnreachable(entry->first)) return;
        changes_.forgotten.insert(entry->first);
        state_.forgotten.erase(entry);
    });
    return std::exchange(changes_, {});
}

}  // namespace platform::tandry
