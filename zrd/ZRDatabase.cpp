#include "zrd/ZRDatabase.h"

#include "Zorvan/Helpers.h"
#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "zrd/ZRDAnnotationStore.h"
#include "zrd/ZRDPlugIn.h"

namespace zorvan {

using platform::Dictionary;

ZRDatabase::ZRDatabase(platform::Services services) : services_(std::move(services)) {}

ZRDatabase::~ZRDatabase() = default;

bool ZRDatabase::initWithDatabase(const std::optional<std::string>& path,
                                  const std::shared_ptr<ZRDatabase>& self) {
    if (!services_.workspace) return false;
    annotations_ = ZRDAnnotationStore::initWithDatabase(path, services_.directories);
    context_ = std::make_shared<PlugInContext>(PlugInContext{.annotations = self,
                                                             .launcher = services_.launcher,
                                                             .assertions = services_.assertions,
                                                             .sandbox = services_.sandbox,
                                                             .consent = services_.consent,
                                                             .types = services_.types,
                                                             .workspace = services_.workspace});
    observation_ = services_.workspace->addObserver(*this);
    return true;
}

ZRDPlugInRef ZRDatabase::plugInForProxy(const platform::TDPlugInProxyRef& proxy) {
    return sync_.sync([&] { return recordForProxy(proxy); });
}

ZRDPlugInRef ZRDatabase::recordForProxy(const platform::TDPlugInProxyRef& proxy) {
    sync_.assertCurrent();
    auto cached = cache_.find(proxy->plugInUuid);
    return cached != cache_.end() ? cached->second : createPlugInForProxy(proxy);
}

ZRDPlugInRef ZRDatabase::createPlugInForProxy(const platform::TDPlugInProxyRef& proxy) {
    sync_.assertCurrent();
    auto plugIn = ZRDPlugIn::initWithTDData(proxy, context_);
    if (!plugIn) return nullptr;
    if (plugIn->hasEntitlement(entitlement::kAutoElectPlugIn)) autoElect(*plugIn);
    // A record of a plug-in that has gone meanwhile is not kept: its uninstall notice may have
    // passed already, and nothing would ever take it out of the cache again.
    if (!workspace().plugInWithUuid(plugIn->uuid())) return plugIn;
    purgeCachesToLimit(cacheLimit_);
    cache_[plugIn->uuid()] = plugIn;
    cacheCount_ = cache_.size();
    return plugIn;
}

void ZRDatabase::purgeCachesToLimit(std::uint32_t limit) {
    sync_.assertCurrent();
    if (cache_.size() <= limit) return;
    EVLOG_INFO(ops(), "purging cache for {} > {}", cache_.size(), limit);
    cache_.clear();
    cacheCount_ = 0;
    workspace().clearSchemaCaches();
}

ZRDPlugInRef ZRDatabase::findPlugIn(const platform::Uuid& uuid) {
    return sync_.sync([&]() -> ZRDPlugInRef {
        auto cached = cache_.find(uuid);
        if (cached != cache_.end()) return cached->second;
        if (auto proxy = workspace().plugInWithUuid(uuid)) return createPlugInForProxy(proxy);
        EVLOG_INFO(ops(), "Tandry cannot find plug-in with UUID:{}", pub(uuid));
        return nullptr;
    });
}

ZRDPlugInRef ZRDatabase::findPlugInAtPath(const std::string& bundlePath) {
    if (auto proxy = workspace().plugInAtPath(bundlePath)) return findPlugIn(proxy->plugInUuid);
    EVLOG_INFO(ops(), "Tandry cannot find plug-in at path:{}", bundlePath);
    return nullptr;
}

std::optional<ZRDPlugInList> ZRDatabase::plugInsWithinApplication(const std::string& bundlePath) {
    auto proxies = workspace().plugInsOfApplication(bundlePath);
    if (proxies.empty()) return std::nullopt;
    ZRDPlugInList plugIns;
    for (const auto& proxy : proxies) {
        if (auto plugIn = plugInForProxy(proxy)) plugIns.push_back(std::move(plugIn));
    }
    return plugIns;
}

std::optional<ZRError> ZRDatabase::addPlugIn(const std::string& bundlePath,
                                             platform::Requester requester) {
    if (auto error = workspace().registerPlugIn(bundlePath, requester)) {
        EVLOG_INFO(ops(), "Tandry refused to register {}: {}", bundlePath, *error);
        return ZRErrorWithCode(kZRErrorRegistration, "Tandry failed to register the plug-in");
    }
    return std::nullopt;
}

std::optional<ZRError> ZRDatabase::removePlugIn(const std::string& bundlePath,
                                                platform::Requester requester) {
    if (auto error = workspace().unregisterPlugIn(bundlePath, requester)) {
        EVLOG_INFO(ops(), "Tandry refused to unregister {}: {}", bundlePath, *error);
        return ZRErrorWithCode(kZRErrorRegistration, "Tandry failed to deregister the plug-in");
    }
    return std::nullopt;
}

std::optional<Dictionary> ZRDatabase::annotationForPlugIn(const ZRDPlugIn& plugIn) {
    return sync_.sync([&]() -> std::optional<Dictionary> {
        const Dictionary* annotation = annotations_->annotationForPlugIn(plugIn);
        return annotation ? std::optional(*annotation) : std::nullopt;
    });
}

bool ZRDatabase::hasRoomForAnnotation(const Dictionary& annotation, const ZRDPlugIn& plugIn) {
    return sync_.sync([&] { return annotations_->hasRoomFor(annotation, plugIn); });
}

bool ZRDatabase::hasShareForAnnotation(const Dictionary& annotation, const ZRDPlugIn& plugIn,
                                       const platform::Origin& origin) {
    return sync_.sync([&] { return annotations_->hasShareFor(annotation, plugIn, origin); });
}

std::optional<ZRError> ZRDatabase::setAnnotation(const std::optional<Dictionary>& annotation,
                                                 const ZRDPlugIn& plugIn,
                                                 const std::optional<platform::Origin>& origin,
                                                 platform::Sync sync) {
    sync_.sync([&] { annotations_->setAnnotation(annotation, plugIn, origin, sync); });
    return std::nullopt;
}

void ZRDatabase::syncAnnotations() {
    sync_.sync([&] { annotations_->sync(); });
}

void ZRDatabase::notifyAnnotationChange() {
    services_.notifications->post(kAnnotationChangeNotification);
}

}  // namespace zorvan
