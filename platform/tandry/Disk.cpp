#include "platform/tandry/Disk.h"

#include <fmt/format.h>
#include <sys/stat.h>

#include <cerrno>
#include <utility>

#include "platform/system/Directories.h"
#include "platform/system/Files.h"
#include "platform/tandry/FolderEntries.h"
#include "platform/tandry/LocalizedNames.h"

namespace platform::tandry {

namespace {

ApplicationScanner::Folders scannedFolders(const Directories& directories) {
    ApplicationScanner::Folders folders;
    auto add = [&folders](const std::string& data) {
        folders.applications.push_back(data + "/Applications");
        folders.dictionaries.push_back(data + "/SDKs");
    };
    add(directories.zorvanData());
    for (const std::string& folder : directories.dataDirs) add(folder + "/zorvan");
    return folders;
}

}  // namespace

Disk::Disk(const Directories& directories, SdkDictionaries& sdks, SdkMerge merge,
           std::size_t mostWatches, RegistryState known)
    : state(std::move(known)),
      reader(sdks, std::move(merge), userLanguages(), places),
      containers(directories.zorvanData()),
      watch(mostWatches),
      untrusted(directories),
      scanner(state, reader, containers, watch, untrusted, places, scannedFolders(directories)) {}

Disk::Outcome Disk::registerBundle(const std::string& bundlePath) {
    const auto failed = [](Error error) { return Outcome{{}, std::move(error)}; };
    places.beginWalk();
    if (!places.answersWithin(bundlePath)) return failed(Error::posix(ETIMEDOUT, bundlePath));
    std::optional<std::string> canonical = canonicalPath(bundlePath);
    struct stat status;
    if (!canonical || ::stat(canonical->c_str(), &status) != 0)
        return failed(Error::posix(ENOENT, bundlePath));
    if (!S_ISDIR(status.st_mode)) return failed(Error::posix(ENOTDIR, bundlePath));
    if (!isUsablePath(*canonical)) return failed(Error::posix(EILSEQ, bundlePath));

    const std::string& path = *canonical;
    untrusted.beginWalk();
    if (const char* place = untrusted.around(path))
        return {{}, Error{path, 0, fmt::format("it lies in {}", place)}, true};
    bool hasPlugIns = false;
    Outcome outcome{scanRegistered(path, hasPlugIns), {}};
    if (hasPlugIns) return outcome;
    const std::string& refusal = outcome.changes->refusal;
    outcome.error = Error{
        "Registry", 0,
        !refusal.empty() ? refusal : fmt::format("{}: no plug-ins in this application", path)};
    return outcome;
}

/// Walks over a path that is registered from now on, unless there are no plug-ins.
RegistryChanges Disk::scanRegistered(const std::string& path, bool& hasPlugIns) {
    const bool isNew = !scanner.isHeld(path) && state.registrations.insert(path).second;
    std::map<std::string, Forgotten> forgotten;
    forEachWithin(state.forgotten, path,
                  [&](auto entry) { forgotten.insert(state.forgotten.extract(entry)); });
    RegistryChanges changes = scanner.scanPath(path, hasPlugIns);
    if (hasPlugIns) {
        for (const auto& [inside, entry] : forgotten) changes.forgotten.insert(inside);
        if (isNew) changes.registrations.insert(path);
    } else {
        state.forgotten.merge(forgotten);
        if (isNew) state.registrations.erase(path);
        if (isNew) dropApplications(path, changes);
    }
    return changes;
}

/// Takes the plug-ins within a path out of the state; walks leave them out as they are now.
bool Disk::forgetWithin(const std::string& path, RegistryChanges& changes) {
    reader.beginPass();
    places.beginWalk();
    forEachWithin(state.plugIns, path, [&](auto entry) {
        changes.uninstalled.push_back(entry->second.record);
        const Fingerprint& known = entry->second.print;
        const bool isThere = places.answersWithin(entry->first);
        state.forgotten[entry->first] = {
            isThere ? reader.toRemember(BundleFolder(entry->first), known) : known};
        changes.forgotten.insert(entry->first);
        state.plugIns.erase(entry);
    });
    return !changes.uninstalled.empty();
}

/// Drops the applications that no walk would find.
void Disk::dropApplications(const std::string& path, RegistryChanges& changes) {
    if (scanner.isHeld(path)) return;
    forEachWithin(state.applications, path, [&](auto entry) {
        bool hasPlugIns = false;
        forEachWithin(state.plugIns, entry->first, [&](auto) { hasPlugIns = true; });
        if (hasPlugIns) return;
        changes.applications.insert(entry->first);
        state.applications.erase(entry);
    });
}

/// Drops the registrations of a path and of the plug-ins inside; answers whether there were any.
bool Disk::dropRegistrations(const std::string& path, RegistryChanges& changes) {
    return std::erase_if(state.registrations, [&](const std::string& registered) {
               if (!isWithin(registered, path)) return false;
               changes.registrations.insert(registered);
               return true;
           }) != 0;
}

Disk::Outcome Disk::unregisterBundle(const std::string& bundlePath) {
    RegistryChanges changes;
    // Only what a path names goes, never what merely lies below some directory.
    const bool isKnown = state.plugIns.contains(bundlePath) ||
                         state.applications.contains(bundlePath) ||
                         state.registrations.contains(bundlePath);
    const bool wasRegistered = isKnown && dropRegistrations(bundlePath, changes);
    const bool hadPlugIns = isKnown && forgetWithin(bundlePath, changes);
    if (!wasRegistered && !hadPlugIns)
        return {{},
                Error{"Registry", 0, fmt::format("{}: nothing is registered there", bundlePath)}};
    if (!hadPlugIns) {
        // Links may have led from there to plug-ins elsewhere.
        RegistryChanges walk = scanner.scanAll();
        walk.registrations.merge(changes.registrations);
        changes = std::move(walk);
    }
    dropApplications(bundlePath, changes);
    return {std::move(changes), {}};
}

}  // namespace platform::tandry
