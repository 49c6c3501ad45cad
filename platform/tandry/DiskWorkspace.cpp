#include "platform/tandry/DiskWorkspace.h"

#include <fmt/format.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <future>
#include <mutex>

#include "platform/log/OpsLog.h"
#include "platform/services/SdkDictionaries.h"
#include "platform/system/Directories.h"
#include "platform/system/Files.h"
#include "platform/tandry/ApplicationScanner.h"
#include "platform/tandry/Catalogue.h"
#include "platform/tandry/CurrentSnapshot.h"
#include "platform/tandry/FolderEntries.h"
#include "platform/tandry/LocalizedNames.h"
#include "platform/threads/ProgrammingError.h"
#include "platform/threads/SerialQueue.h"

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

/// Tells of a change that is refused, and why.
Error refused(const char* change, const std::string& path, const std::string& reason) {
    EVLOG_ERROR(ops(), "refusing to {} {}: {}", change, path, pub(reason));
    return {"Registry", 0, fmt::format("{}: {}", path, reason)};
}

constexpr const char* kConfined = "a confined process asks";

/// The registry's thread owns the state, everything that reads and writes it, and the observers.
/// Lookups run on their callers' threads, on the current snapshot alone.
class DiskWorkspace final : public Workspace {
  public:
    DiskWorkspace(const Directories& directories, SdkDictionaries& sdks, SdkMerge merge,
                  std::unique_ptr<Catalogue> catalogue, const WatchSettings& settings);
    ~DiskWorkspace() override;

    std::unique_ptr<Observation> addObserver(WorkspaceObserver& observer) override;
    void activate() override;

    TDPlugInProxyRef plugInWithUuid(const Uuid& uuid) override;
    TDPlugInProxyRef plugInAtPath(const std::string& bundlePath) override;
    TDPlugInProxyList plugInsOfApplication(const std::string& bundlePath) override;
    TDPlugInProxyList installedPlugIns() override;
    UntouchedBundles untouchedBundles() override;
    std::optional<TDPlugInProxyList> plugInsMatching(const Dictionary& query,
                                                     const Filter& filter) override;

    std::optional<Error> registerPlugIn(const std::string& bundlePath,
                                        Requester requester) override;
    std::optional<Error> unregisterPlugIn(const std::string& bundlePath,
                                          Requester requester) override;
    std::optional<Error> restoreContainer(const TDPlugInProxy& plugIn) override {
        return plugIn.dataContainerPath ? makeContainer(*plugIn.dataContainerPath) : std::nullopt;
    }
    void clearSchemaCaches() override { sdks_.clear(); }

  private:
    class DiskObservation;

    template <class Work>
    auto onQueue(Work work) -> decltype(work());
    std::optional<Error> afterFirstScan(const std::function<std::optional<Error>()>& work);

    void firstScan();
    void rescan(const Scopes& touched);
    void publish(const RegistryChanges& changes);
    void published();
    void withdraw(const TDPlugInProxyList& plugIns);
    void announceGoing(const TDPlugInProxyList& plugIns);
    bool lacksRoom() const;
    void makeContainers();
    std::optional<Error> registerOnQueue(const std::string& bundlePath);
    std::optional<Error> unregisterOnQueue(const std::string& bundlePath);
    void dropApplications(const std::string& path, RegistryChanges& changes);
    bool dropRegistrations(const std::string& path, RegistryChanges& changes);
    bool forgetWithin(const std::string& path, RegistryChanges& changes);
    std::optional<Error> apply(const RegistryChanges& changes);

    SdkDictionaries& sdks_;
    CurrentSnapshot current_;
    std::mutex unwatchedMutex_;
    std::shared_ptr<const UntouchedBundles::Paths> unwatched_;  // guarded by it
    std::atomic<bool> closing_ = false;

    // Of the registry's thread:
    std::unique_ptr<Catalogue> catalogue_;
    BundleReader reader_;
    DataContainers containers_;
    bool isScanned_ = false;
    RegistryState state_;
    std::shared_ptr<const Snapshot> published_;
    FolderWatch watch_;
    UntrustedPlaces untrusted_;
    ApplicationScanner scanner_;
    const WatchSettings settings_;
    std::unique_ptr<ChangeGatherer> gatherer_;  // from the first scan until the end
    std::vector<WorkspaceObserver*> observers_;

    SerialQueue queue_;  // the last member: nothing runs on it once the others go
};

class DiskWorkspace::DiskObservation final : public Workspace::Observation {
  public:
    DiskObservation(DiskWorkspace& workspace, WorkspaceObserver& observer)
        : workspace_(workspace), observer_(&observer) {}
    /// Waits behind a callback that is running.
    ~DiskObservation() override {
        workspace_.onQueue([this] { return std::erase(workspace_.observers_, observer_); });
    }

  private:
    DiskWorkspace& workspace_;
    WorkspaceObserver* observer_;
};

DiskWorkspace::DiskWorkspace(const Directories& directories, SdkDictionaries& sdks, SdkMerge merge,
                             std::unique_ptr<Catalogue> catalogue, const WatchSettings& settings)
    : sdks_(sdks),
      catalogue_(std::move(catalogue)),
      reader_(sdks, std::move(merge), userLanguages()),
      containers_(directories.zorvanData()),
      watch_(settings.mostWatches),
      untrusted_(directories),
      scanner_(state_, reader_, containers_, watch_, untrusted_, scannedFolders(directories)),
      settings_(settings),
      queue_("tandry") {}

DiskWorkspace::~DiskWorkspace() {
    closing_ = true;
    current_.close();
    queue_.async([this] { gatherer_.reset(); });
}

/// Runs work on the registry's thread and waits for its answer.
template <class Work>
auto DiskWorkspace::onQueue(Work work) -> decltype(work()) {
    if (queue_.isCurrent()) programmingError("the registry was changed from its own callback");
    std::promise<decltype(work())> promise;
    auto answer = promise.get_future();
    queue_.async([&] { promise.set_value(work()); });
    return answer.get();
}

std::unique_ptr<Workspace::Observation> DiskWorkspace::addObserver(WorkspaceObserver& observer) {
    queue_.async([this, &observer] { observers_.push_back(&observer); });
    return std::make_unique<DiskObservation>(*this, observer);
}

void DiskWorkspace::activate() {
    queue_.async([this] { firstScan(); });
}

void DiskWorkspace::firstScan() {
    queue_.assertCurrent();
    if (closing_ || std::exchange(isScanned_, true)) return;
    containers_.beginWalk();
    // Filled in place: the scanner refers to the state.
    state_ = catalogue_->load();
    // Marking every directory takes time, and lookups wait: it is left to a second walk, which
    // finds what has changed since the first.
    watch_.setPostponed(true);
    RegistryChanges changes = scanner_.scanAll();
    watch_.setPostponed(false);
    EVLOG_INFO(ops(), "{} plug-ins in {} applications, {} new, {} gone", state_.plugIns.size(),
               state_.applications.size(), changes.installed.size(), changes.uninstalled.size());
    if (!changes.records()) publish(changes);
    gatherer_ = std::make_unique<ChangeGatherer>(
        queue_.runLoop(), watch_, settings_, [this](const Scopes& touched) { rescan(touched); });
    // The catalogue has told of a failure, and nobody waits for an answer.
    static_cast<void>(apply(changes));
    queue_.async([this] { rescan({std::string()}); });
}

void DiskWorkspace::rescan(const Scopes& touched) {
    queue_.assertCurrent();
    if (closing_) return;
    RegistryChanges changes = scanner_.scanTouched(touched);
    if (changes.records() || changes.lists()) return static_cast<void>(apply(changes));
    gatherer_->walkEnded(scanner_.isComplete());
    published();
    makeContainers();
}

/// Lookups see the state; nobody has seen anything before the first time.
void DiskWorkspace::publish(const RegistryChanges& changes) {
    published_ = published_ ? std::make_shared<const Snapshot>(*published_, state_, changes)
                            : std::make_shared<const Snapshot>(state_);
    current_.publish(published_);
}

/// What the last walk found is there for all to see.
void DiskWorkspace::published() {
    auto unwatched = std::make_shared<const UntouchedBundles::Paths>(scanner_.unwatched());
    {
        const std::lock_guard lock(unwatchedMutex_);
        unwatched_.swap(unwatched);
    }
    gatherer_->published();
}

/// Asked in this order, and records looked up afterwards: when the watch is quiet, both the
/// exceptions and the records are at least as new as what it has seen.
UntouchedBundles DiskWorkspace::untouchedBundles() {
    if (!watch_.isQuiet()) return {};
    const std::lock_guard lock(unwatchedMutex_);
    return UntouchedBundles(unwatched_);
}

/// Takes records out of what lookups see, and tells observers.
void DiskWorkspace::withdraw(const TDPlugInProxyList& plugIns) {
    if (plugIns.empty()) return;
    RegistryChanges changes;
    changes.uninstalled = plugIns;
    published_ = std::make_shared<const Snapshot>(*published_, RegistryState(), changes);
    current_.publish(published_);
    announceGoing(plugIns);
}

void DiskWorkspace::announceGoing(const TDPlugInProxyList& plugIns) {
    if (plugIns.empty()) return;
    for (WorkspaceObserver* observer : observers_) observer->pluginsWillUninstall(plugIns);
}

bool DiskWorkspace::lacksRoom() const {
    return std::ranges::any_of(state_.refusals,
                               [](const auto& entry) { return entry.second.size != 0; });
}

/// Makes the containers that the last walk found missing. Where that fails, records that say so
/// take the places of those that were published.
void DiskWorkspace::makeContainers() {
    const std::set<std::string> impossible = containers_.makeMissing();
    if (impossible.empty()) return;
    RegistryChanges changes;
    for (auto& [path, entry] : state_.plugIns) {
        const TDPlugInProxyRef before = entry.record;
        if (!before->dataContainerPath || !impossible.contains(*before->dataContainerPath))
            continue;
        entry.record = std::make_shared<TDPlugInProxy>(*before);
        entry.record->plugInUuid = Uuid::random();
        entry.record->dataContainerPath.reset();
        changes.uninstalled.push_back(before);
        changes.installed.push_back(entry.record);
    }
    static_cast<void>(apply(changes));
}

/// What goes is hidden before its observers hear of it, so that what they drop is not built again;
/// the catalogue changes after them. What comes is stored before anybody sees it, so that it is
/// there after a crash as well; a record that takes another's place takes it at once, so that
/// nobody finds neither. Before the first time nobody can have seen what goes, and observers, who
/// may look up, come last. The error says why nothing was stored.
std::optional<Error> DiskWorkspace::apply(const RegistryChanges& changes) {
    // What had no room may find it where something went.
    const bool mayFit = !changes.uninstalled.empty() && lacksRoom();
    gatherer_->walkEnded(scanner_.isComplete() && !mayFit);
    // Those that go, then those that others replace.
    TDPlugInProxyList going = changes.uninstalled;
    const auto replaced =
        std::stable_partition(going.begin(), going.end(), [this](const auto& record) {
            return published_ && !state_.plugIns.contains(record->bundlePath.value_or(""));
        });
    const TDPlugInProxyList later(replaced, going.end());
    going.erase(replaced, going.end());
    withdraw(going);
    std::optional<Error> error = catalogue_->save(state_, changes);
    if (changes.records()) publish(changes);
    published();
    announceGoing(later);
    if (!changes.installed.empty())
        for (WorkspaceObserver* observer : observers_)
            observer->pluginsDidInstall(changes.installed);
    makeContainers();
    return error;
}

TDPlugInProxyRef DiskWorkspace::plugInWithUuid(const Uuid& uuid) {
    auto snapshot = current_.get();
    return snapshot ? snapshot->plugInWithUuid(uuid) : nullptr;
}

TDPlugInProxyRef DiskWorkspace::plugInAtPath(const std::string& bundlePath) {
    auto snapshot = current_.get();
    return snapshot ? snapshot->plugInAtPath(bundlePath) : nullptr;
}

TDPlugInProxyList DiskWorkspace::plugInsOfApplication(const std::string& bundlePath) {
    auto snapshot = current_.get();
    return snapshot ? snapshot->plugInsOfApplication(bundlePath) : TDPlugInProxyList();
}

TDPlugInProxyList DiskWorkspace::installedPlugIns() {
    auto snapshot = current_.get();
    return snapshot ? snapshot->plugIns() : TDPlugInProxyList();
}

std::optional<TDPlugInProxyList> DiskWorkspace::plugInsMatching(const Dictionary& query,
                                                                const Filter& filter) {
    auto snapshot = current_.get();
    if (!snapshot) return std::nullopt;
    TDPlugInProxyList list = snapshot->candidates(query);
    if (filter)
        std::erase_if(list, [&filter](const TDPlugInProxyRef& plugIn) {
            return !filter(plugIn->plugInIdentifier, plugIn->entitlements.get());
        });
    return list;
}

std::optional<Error> DiskWorkspace::afterFirstScan(
    const std::function<std::optional<Error>()>& work) {
    if (!current_.get()) return Error{"POSIX", ECANCELED, "the registry is being closed"};
    return onQueue(work);
}

std::optional<Error> DiskWorkspace::registerPlugIn(const std::string& bundlePath,
                                                   Requester requester) {
    if (requester == Requester::Confined) return refused("register", bundlePath, kConfined);
    return afterFirstScan([&] { return registerOnQueue(bundlePath); });
}

std::optional<Error> DiskWorkspace::unregisterPlugIn(const std::string& bundlePath,
                                                     Requester requester) {
    if (requester == Requester::Confined) return refused("unregister", bundlePath, kConfined);
    return afterFirstScan([&] { return unregisterOnQueue(bundlePath); });
}

std::optional<Error> DiskWorkspace::registerOnQueue(const std::string& bundlePath) {
    scanner_.places().beginWalk();
    if (!scanner_.places().answers(bundlePath)) return Error::posix(ETIMEDOUT, bundlePath);
    std::optional<std::string> canonical = canonicalPath(bundlePath);
    struct stat status;
    if (!canonical || ::stat(canonical->c_str(), &status) != 0)
        return Error::posix(ENOENT, bundlePath);
    if (!S_ISDIR(status.st_mode)) return Error::posix(ENOTDIR, bundlePath);
    if (!isUsablePath(*canonical)) return Error::posix(EILSEQ, bundlePath);

    const std::string& path = *canonical;
    untrusted_.beginWalk();
    if (const char* place = untrusted_.around(path))
        return refused("register", path, fmt::format("it lies in {}", place));
    const bool isNew = !scanner_.isHeld(path) && state_.registrations.insert(path).second;
    std::map<std::string, Forgotten> forgotten;
    forEachWithin(state_.forgotten, path,
                  [&](auto entry) { forgotten.insert(state_.forgotten.extract(entry)); });
    bool hasPlugIns = false;
    RegistryChanges changes = scanner_.scanPath(path, hasPlugIns);
    if (hasPlugIns) {
        for (const auto& [inside, entry] : forgotten) changes.forgotten.insert(inside);
        if (isNew) changes.registrations.insert(path);
    } else {
        state_.forgotten.merge(forgotten);
        if (isNew) state_.registrations.erase(path);
        if (isNew) dropApplications(path, changes);
    }
    std::optional<Error> error = apply(changes);
    if (hasPlugIns) return error;
    if (!changes.refusal.empty()) return Error{"Registry", 0, changes.refusal};
    return Error{"Registry", 0, fmt::format("{}: no plug-ins in this application", path)};
}

/// Takes the plug-ins within a path out of the state; walks leave them out as they are now.
bool DiskWorkspace::forgetWithin(const std::string& path, RegistryChanges& changes) {
    reader_.beginPass();
    scanner_.places().beginWalk();
    forEachWithin(state_.plugIns, path, [&](auto entry) {
        changes.uninstalled.push_back(entry->second.record);
        const Fingerprint& known = entry->second.print;
        const bool isThere = scanner_.places().answers(entry->first);
        state_.forgotten[entry->first] = {
            isThere ? reader_.toRemember(BundleFolder(entry->first), known) : known};
        changes.forgotten.insert(entry->first);
        state_.plugIns.erase(entry);
    });
    return !changes.uninstalled.empty();
}

/// Drops the applications that no walk would find.
void DiskWorkspace::dropApplications(const std::string& path, RegistryChanges& changes) {
    if (scanner_.isHeld(path)) return;
    forEachWithin(state_.applications, path, [&](auto entry) {
        bool hasPlugIns = false;
        forEachWithin(state_.plugIns, entry->first, [&](auto) { hasPlugIns = true; });
        if (hasPlugIns) return;
        changes.applications.insert(entry->first);
        state_.applications.erase(entry);
    });
}

/// Drops the registrations of a path and of the plug-ins inside; answers whether there were any.
bool DiskWorkspace::dropRegistrations(const std::string& path, RegistryChanges& changes) {
    return std::erase_if(state_.registrations, [&](const std::string& registered) {
               if (!isWithin(registered, path)) return false;
               changes.registrations.insert(registered);
               return true;
           }) != 0;
}

std::optional<Error> DiskWorkspace::unregisterOnQueue(const std::string& bundlePath) {
    RegistryChanges changes;
    // Only what a path names goes, never what merely lies below some directory.
    const bool isKnown = state_.plugIns.contains(bundlePath) ||
                         state_.applications.contains(bundlePath) ||
                         state_.registrations.contains(bundlePath);
    const bool wasRegistered = isKnown && dropRegistrations(bundlePath, changes);
    const bool hadPlugIns = isKnown && forgetWithin(bundlePath, changes);
    if (!wasRegistered && !hadPlugIns)
        return Error{"Registry", 0, fmt::format("{}: nothing is registered there", bundlePath)};
    if (!hadPlugIns) {
        // Links may have led from there to plug-ins elsewhere.
        RegistryChanges walk = scanner_.scanAll();
        walk.registrations.merge(changes.registrations);
        changes = std::move(walk);
    }
    dropApplications(bundlePath, changes);
    return apply(changes);
}

}  // namespace

Result<std::unique_ptr<Workspace>> openDiskWorkspace(const Directories& directories,
                                                     SdkDictionaries& sdks, SdkMerge merge,
                                                     const WatchSettings& settings) {
    Result<std::unique_ptr<Catalogue>> catalogue = Catalogue::open(directories.zorvanData());
    if (!catalogue) return catalogue.error();
    return std::unique_ptr<Workspace>(std::make_unique<DiskWorkspace>(
        directories, sdks, std::move(merge), std::move(*catalogue), settings));
}

}  // namespace platform::tandry
