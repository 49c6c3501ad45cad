#include "zrd/ZRDPlugIn.h"

#include <algorithm>
#include <cmath>

#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "platform/values/Cbor.h"
#include "zrd/PlugInContext.h"

namespace zorvan {

using platform::Dictionary;
using platform::Value;

namespace {

/// Seconds since 1970 without their fraction, or the nearest end of what 32 bits hold.
std::int32_t wholeSeconds(platform::Date date) {
    double seconds = std::trunc(date.secondsSince1970);
    if (!(seconds > INT32_MIN)) return std::isnan(seconds) ? 0 : INT32_MIN;
    if (seconds >= INT32_MAX) return INT32_MAX;
    return static_cast<std::int32_t>(seconds);
}

}  // namespace

ZRDPlugIn::ZRDPlugIn(platform::TDPlugInProxyRef proxy, std::shared_ptr<const PlugInContext> context)
    : tdproxy_(std::move(proxy)),
      registeredInfo_(tdproxy_->infoPlist.get()),
      registeredPlugIn_(tdproxy_->plugInDictionary()),
      registeredAttributes_(tdproxy_->attributes()),
      isDedicated_(ZRPlugInCore::isDedicated()),
      isAppExtension_(isAppExtensionPath(*tdproxy_->bundlePath)),
      hostEntitlement_(pluginKey(key::kHostEntitlement)),
      replaced_(tdproxy_->entitlements.get().find(entitlement::kReplacePlugIn)),
      extensionPoint_(attributeOrInfoKey(key::kExtensionPoint)),
      context_(std::move(context)) {}

std::shared_ptr<ZRDPlugIn> ZRDPlugIn::initWithTDData(platform::TDPlugInProxyRef proxy,
                                                     std::shared_ptr<const PlugInContext> context) {
    if (!proxy->bundlePath) return nullptr;
    std::shared_ptr<ZRDPlugIn> plugIn(new ZRDPlugIn(std::move(proxy), std::move(context)));
    if (!plugIn->fillFromProxy()) return nullptr;
    if (auto fault = plugIn->diagnose()) {
        EVLOG_INFO(ops(), "ignoring mis-configured plug-in at {}: {}", plugIn->path(),
                   pub(fault->description.value_or("")));
        return nullptr;
    }
    return plugIn;
}

bool ZRDPlugIn::fillFromProxy() {
    std::optional<Dictionary> plugInDictionary;
    if (registeredPlugIn_) plugInDictionary = *registeredPlugIn_;
    if (!initialize(tdproxy_->plugInIdentifier, tdproxy_->bundlePath, std::nullopt,
                    plugInDictionary, tdproxy_->plugInUuid)) {
        return false;
    }
    setEntitlements(tdproxy_->entitlements.get());
    setOriginalIdentifier(tdproxy_->originalIdentifier);
    setLastModified(wholeSeconds(tdproxy_->registrationDate));
    setOnSystemVolume(tdproxy_->onSystemPartition);
    setHubProtocolVersion(declaredHubProtocolVersion());
    if (tdproxy_->containingApplication) {
        setContainingPath(tdproxy_->containingApplication->bundlePath);
    }
    // These three go into the form, also where the form itself has to be encoded anew: encoded
    // once, they are copied from then on.
    platform::keepCborEncoded(registeredInfo_);
    platform::keepCborEncoded(tdproxy_->entitlements.get());
    if (registeredPlugIn_) platform::keepCborEncoded(*registeredPlugIn_);
    return true;
}

std::uint32_t ZRDPlugIn::declaredHubProtocolVersion() const {
    if (const Value* declared = pluginKey(key::kHubProtocolVersion)) {
        if (auto number = declared->numberAsInteger()) {
            return static_cast<std::uint32_t>(std::clamp<std::int64_t>(*number, 0, UINT32_MAX));
        }
    }
    return infoKey(key::kOldStylePlugIn) ? 1 : 2;
}

const Dictionary* ZRDPlugIn::bundleInfoDictionary() const {
    return &registeredInfo_;
}

const Value* ZRDPlugIn::infoKey(std::string_view key) const {
    return registeredInfo_.find(key);
}

const Value* ZRDPlugIn::pluginKey(std::string_view key) const {
    return registeredPlugIn_ ? registeredPlugIn_->find(key) : nullptr;
}

const Value* ZRDPlugIn::attribute(std::string_view key) const {
    return registeredAttributes_ ? registeredAttributes_->find(key) : nullptr;
}

std::optional<std::string> ZRDPlugIn::cachedName(
    std::optional<std::string>& cache, const std::optional<std::string>& registered) const {
    std::lock_guard lock(mutex_);
    if (!cache) cache = registered;
    return cache;
}

std::optional<std::string> ZRDPlugIn::localizedName() const {
    return cachedName(localizedName_, tdproxy_->localizedName);
}

std::optional<std::string> ZRDPlugIn::localizedShortName() const {
    return cachedName(localizedShortName_, tdproxy_->localizedShortName);
}

std::optional<std::string> ZRDPlugIn::localizedContainingName() const {
    const auto& application = tdproxy_->containingApplication;
    std::optional<std::string> registered;
    if (application && !application->localizedName.empty()) registered = application->localizedName;
    return cachedName(localizedContainingName_, registered);
}

void ZRDPlugIn::setName(std::optional<std::string>& cache, std::optional<std::string> value) {
    std::lock_guard lock(mutex_);
    cache = std::move(value);
    ++nameChanges_;
    form_.reset();
}

void ZRDPlugIn::setLocalizedName(std::optional<std::string> value) {
    setName(localizedName_, std::move(value));
}

void ZRDPlugIn::setLocalizedShortName(std::optional<std::string> value) {
    setName(localizedShortName_, std::move(value));
}

void ZRDPlugIn::setLocalizedContainingName(std::optional<std::string> value) {
    setName(localizedContainingName_, std::move(value));
}

std::optional<ZRDPlugIn::Draft> ZRDPlugIn::draftForm(const platform::UntouchedBundles& untouched,
                                                     std::optional<ZRError>& error) const {
    std::optional<Dictionary> form;
    std::uint64_t nameChanges = 0;
    {
        std::lock_guard lock(mutex_);
        form = form_;
        nameChanges = nameChanges_;
    }
    // The only token of a form that is kept is that for the bundle itself.
    if (form && (!isAppExtension() || untouched.contains(path()) ||
                 bundleDirectory().open(platform::Wait::Never)))
        return Draft{*std::move(form), true, nameChanges};
    form = exportForm(error);
    if (!form) return std::nullopt;
    return Draft{*std::move(form), false, nameChanges};
}

std::optional<Dictionary> ZRDPlugIn::completedForm(Draft& draft, platform::Wait wait) const {
    if (draft.isComplete) return std::move(draft.form);
    const Augmented augmented = augmentForm(draft.form, wait);
    if (augmented == Augmented::NotYet) return std::nullopt;
    // Tokens that could not be issued now may be another time, and others may go stale.
    if (augmented == Augmented::ForNow) return std::move(draft.form);
    platform::keepCborEncoded(draft.form);
    std::lock_guard lock(mutex_);
    if (draft.nameChanges == nameChanges_) form_ = draft.form;
    return std::move(draft.form);
}

std::optional<ZRError> ZRDPlugIn::diagnose() const {
    if (auto fault = ZRPlugInCore::diagnose()) return fault;
    if (!isData() && !tdproxy_->dataContainerPath) {
        return ZRErrorWithCode(kZRErrorPlugIn, "this plug-in has no sandbox data container");
    }
    if (!containingPath() && !path().starts_with("/System/")) {
        return ZRErrorWithCode(kZRErrorPlugIn,
                               "plug-ins outside containing apps must be in /System");
    }
    return std::nullopt;
}

const Value* ZRDPlugIn::valueForEntitlement(std::string_view name) const {
    return entitlements() ? entitlements()->find(name) : nullptr;
}

bool ZRDPlugIn::hasEntitlement(std::string_view name) const {
    const Value* value = valueForEntitlement(name);
    return value && !platform::equalsFalse(*value);
}

std::string_view ZRDPlugIn::annotationKey() const {
    return replaced_ && replaced_->string() ? replaced_->string()->view() : identifier();
}

Dictionary ZRDPlugIn::prunedInfoDictionaryFor(const Dictionary& dictionary) {
    Dictionary pruned;
    for (const auto& [key, value] : dictionary) {
        if (!key.view().starts_with("DT")) pruned.set(key, value);
    }
    return pruned;
}

}  // namespace zorvan
