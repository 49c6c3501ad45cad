#include "platform/tandry/DiskWorkspace.h"

#include <fmt/format.h>
#include <malloc.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <future>
#include <mutex>

#include "platform/log/OpsLog.h"
#include "platform/services/SdkDictionaries.h"
#include "platform/system/Directories.h"
#include "platform/tandry/Catalogue.h"
#include "platform/tandry/CurrentSnapshot.h"
#include "platform/tandry/DiskWalks.h"
#include "platform/threads/ProgrammingError.h"
#include "platform/threads/SerialQueue.h"

namespace platform::tandry {

namespace {

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
    bool lacksRoom();
    void makeContainers();
    template <class Result>
    std::optional<Result> walk(std::function<Result(Disk&)> work);
    void follow();
    std::optional<Error> change(const std::string& bundlePath, const char* what,
                                Disk::Outcome (Disk::*make)(const std::string&));
    std::optional<Error> apply(const RegistryChanges& changes);
    Disk& disk() { return *walks_.disk(); }

    SdkDictionaries& sdks_;
    CurrentSnapshot current_;
    std::mutex watchMutex_;  // guards what lookups are told of the watch
    std::shared_ptr<Disk> watched_;
    std::shared_ptr<const UntouchedBundles::Paths> unwatched_;
    std::atomic<bool> closing_ = false;

    // Of the registry's thread:
    std::unique_ptr<Catalogue> catalogue_;
    const WatchSettings settings_;
    DiskWalks walks_;
    bool isScanned_ = false;
    std::shared_ptr<const Snapshot> published_;
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
      settings_(settings),
      walks_(
          [=, &sdks, merge = std::move(merge)](RegistryState known) {
              return std::make_shared<Disk>(directories, sdks, merge, settings.mostWatches,
                                            std::move(known));
          },
          settings.patience),
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

/// Has a walk made. None when it had to be given up: then nothing is known of a change that it has
/// met, and everything has to be walked over.
template <class Result>
std::optional<Result> DiskWorkspace::walk(std::function<Result(Disk&)> work) {
    const std::shared_ptr<Disk> before = walks_.disk();
    std::optional<Result> result = walks_.walk(std::move(work));
    if (result) {
        disk().containers.saveOwners();
        return result;
    }
    {
        const std::lock_guard lock(watchMutex_);
        watched_.reset();
    }
    if (!gatherer_) return result;
    // It may be the one that has called.
    queue_.async(
        [before, gatherer = std::shared_ptr(std::move(gatherer_))]() mutable { gatherer.reset(); });
    follow();
    return result;
}

void DiskWorkspace::follow() {
    gatherer_ =
        std::make_unique<ChangeGatherer>(queue_.runLoop(), disk().watch, settings_,
                                         [this](const Scopes& touched) { rescan(touched); });
}

void DiskWorkspace::firstScan() {
    queue_.assertCurrent();
    if (closing_ || std::exchange(isScanned_, true)) return;
    std::optional<RegistryChanges> changes;
    while (!changes) {
        if (closing_) return;
        disk().containers.beginWalk();
        // Read anew for each try: what nobody has seen, a walk may complete in place.
        disk().state = catalogue_->load();
        // Marking every directory takes time, and lookups wait: it is left to a second walk, which
        // finds what has changed since the first.
        changes = walk<RegistryChanges>([](Disk& disk) {
            disk.watch.setPostponed(true);
            RegistryChanges found = disk.scanner.scanAll();
            disk.watch.setPostponed(false);
            return found;
        });
    }
    EVLOG_INFO(ops(), "{} plug-ins in {} applications, {} new, {} gone",
               disk().state.plugIns.size(), disk().state.applications.size(),
               changes->installed.size(), changes->uninstalled.size());
    if (!changes->records()) publish(*changes);
    follow();
    // The catalogue has told of a failure, and nobody waits for an answer.
    static_cast<void>(apply(*changes));
    queue_.async([this] { rescan({std::string()}); });
}

/// A walk that is given up is followed by one that leaves alone what it has waited for.
void DiskWorkspace::rescan(const Scopes& touched) {
    queue_.assertCurrent();
    std::optional<RegistryChanges> changes;
    for (Scopes scopes = touched; !changes; scopes = {std::string()}) {
        if (closing_) return;
        changes = walk<RegistryChanges>(
            [scopes](Disk& disk) { return disk.scanner.scanTouched(scopes); });
    }
    if (changes->records() || changes->lists()) {
        static_cast<void>(apply(*changes));
    } else {
        gatherer_->walkEnded(disk().scanner.isComplete());
        published();
        makeContainers();
    }
    // A walk uses much for a while, of which the C library would keep most.
    ::malloc_trim(0);
}

/// Lookups see the state; nobody has seen anything before the first time.
void DiskWorkspace::publish(const RegistryChanges& changes) {
    published_ = published_ ? std::make_shared<const Snapshot>(*published_, disk().state, changes)
                            : std::make_shared<const Snapshot>(disk().state);
    current_.publish(published_);
}

/// What the last walk found is there for all to see.
void DiskWorkspace::published() {
    auto unwatched = std::make_shared<const UntouchedBundles::Paths>(disk().scanner.unwatched());
    auto watched = walks_.disk();
    {
        const std::lock_guard lock(watchMutex_);
        unwatched_.swap(unwatched);
        watched_.swap(watched);
    }
    gatherer_->published();
}

/// Asked in this order, and records looked up afterwards: when the watch is quiet, both the
/// exceptions and the records are at least as new as what it has seen.
UntouchedBundles DiskWorkspace::untouchedBundles() {
    const std::lock_guard lock(watchMutex_);
    if (!watched_ || !watched_->watch.isQuiet()) return {};
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

bool DiskWorkspace::lacksRoom() {
    return std::ranges::any_of(disk().state.refusals,
                               [](const auto& entry) { return entry.second.size != 0; });
}

/// Makes the containers that the last walk found missing. Where that fails, records that say so
/// take the places of those that were published.
void DiskWorkspace::makeContainers() {
    const std::set<std::string> impossible = disk().containers.makeMissing();
    if (impossible.empty()) return;
    RegistryChanges changes;
    for (auto& [path, entry] : disk().state.plugIns) {
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
    gatherer_->walkEnded(disk().scanner.isComplete() && !mayFit);
    // Those that go, then those that others replace.
    TDPlugInProxyList going = changes.uninstalled;
    const auto replaced =
        std::stable_partition(going.begin(), going.end(), [this](const auto& record) {
            return published_ && !disk().state.plugIns.contains(record->bundlePath.value_or(""));
        });
    const TDPlugInProxyList later(replaced, going.end());
    going.erase(replaced, going.end());
    withdraw(going);
    std::optional<Error> error = catalogue_->save(disk().state, changes);
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
    return afterFirstScan([&] { return change(bundlePath, "register", &Disk::registerBundle); });
}

std::optional<Error> DiskWorkspace::unregisterPlugIn(const std::string& bundlePath,
                                                     Requester requester) {
    if (requester == Requester::Confined) return refused("unregister", bundlePath, kConfined);
    return afterFirstScan(
        [&] { return change(bundlePath, "unregister", &Disk::unregisterBundle); });
}

/// Has a path registered or unregistered, and waits for the walk that this takes.
std::optional<Error> DiskWorkspace::change(const std::string& bundlePath, const char* what,
                                           Disk::Outcome (Disk::*make)(const std::string&)) {
    const auto outcome = walk<Disk::Outcome>([=](Disk& disk) { return (disk.*make)(bundlePath); });
    if (!outcome) {
        rescan({std::string()});
        return Error::posix(ETIMEDOUT, bundlePath);
    }
    if (outcome->isRefused) return refused(what, outcome->error->domain, outcome->error->text);
    if (!outcome->changes) return outcome->error;
    std::optional<Error> error = apply(*outcome->changes);
    return outcome->error ? outcome->error : error;
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
