// What lets a host start a plug-in, and read what it shares.

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string_view>
#include <unordered_set>

#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "Zorvan/ZRBundle.h"
#include "Zorvan/ZRError.h"
#include "platform/sandbox/Sandbox.h"
#include "platform/services/Consent.h"
#include "platform/spawnerd/Launcher.h"
#include "platform/system/Files.h"
#include "platform/tandry/Workspace.h"
#include "zrd/HostProcess.h"
#include "zrd/PlugInContext.h"
#include "zrd/ZRDPlugIn.h"

namespace zorvan {

using platform::Array;
using platform::Dictionary;
using platform::Value;

namespace {

constexpr std::string_view kKeyboardService = "com.orbel.keyboard-service";
constexpr std::string_view kFilterDataService = "com.orbel.netvane.filter-data";
constexpr std::string_view kPreviewService = "com.orbel.glimse.extension.preview";

/// The tokens for what a plug-in shares are issued anew for each answer that it is in.
constexpr std::size_t kMaxResources = 64;

bool isText(const Value* value, std::string_view text) {
    return value && value->string() && *value->string() == text;
}

}  // namespace

const char* ZRDPlugIn::sandboxProfile() const {
    const Value* point = pluginKey(key::kExtensionPoint);
    if (isText(point, kKeyboardService)) {
        const Value* openAccess = attribute(key::kRequestsOpenAccess);
        bool isOpen = openAccess && platform::equalsTrue(*openAccess) &&
                      allowedVSKServices().contains(platform::kKeyboardNetworkConsent);
        return isOpen ? "plugin" : "keyboard";
    }
    if (isText(point, kFilterDataService)) return "network-filter";
    const auto& stored = plugInDictionary();
    if (stored && isText(stored->find(key::kExtensionPoint), kPreviewService)) return "glimsed";
    return "plugin";
}

/// Where the plug-in may write, as variables of its environment.
Dictionary ZRDPlugIn::containerEnvironment() const {
    const auto& container = tdproxy_->dataContainerPath;
    if (!container) {
        EVLOG_DEBUG(ops(), "no data container for plug-in {}({}) {} at {}", identifier(), version(),
                    pub(uuid()), path());
        return {};
    }
    return {{"HOME", *container},
            {"QFFIXED_USER_HOME", *container},
            {"TMPDIR", platform::joinPath(*container, "tmp")}};
}

/// The service dictionary: the plug-in's own, under what is not the plug-in's to choose.
Dictionary ZRDPlugIn::launchService() const {
    Dictionary environment = containerEnvironment();
    const char* profile = sandboxProfile();
    if (const char* sdk = std::getenv("ZRTEST_SDK")) environment.set("ZRTEST_SDK", sdk);
    Dictionary service;
    const Value* raw = infoKey(overlay::kService);
    if (raw && raw->dictionary()) {
        EVLOG_DEBUG(td(), "raw LUMService={}", *raw);
        service = *raw->dictionary();
    } else {
        EVLOG_INFO(ops(), "no LUMService for plug-in; database returned {}", raw);
    }
    const Value* own = service.find(overlay::kEnvironment);
    if (own && own->dictionary()) {
        for (const auto& [name, value] : *own->dictionary()) environment.set(name, value);
    }
    service.set(overlay::kEnvironment, std::move(environment));
    service.set(overlay::kProfile, profile);
    service.set(overlay::kOmitParameters, true);
    EVLOG_INFO(ops(), "assigning plug-in {}({}) {} to {} sandbox", identifier(), version(),
               pub(uuid()), profile);
    return service;
}

Dictionary ZRDPlugIn::overlayForClient(const HostProcess& host) const {
    Dictionary overlay{{overlay::kService, launchService()},
                       {overlay::kPackageType, overlay::kLumPackage}};
    EVLOG_DEFAULT(ops(), "allowing host {} {} to use plug-in {}({}) uuid={} at {}", host.pid(),
                  host.path(), identifier(), version(), pub(uuid()), path());
    return overlay;
}

std::optional<ZRDPlugIn::Preparation> ZRDPlugIn::prepareAgain(const Dictionary& overlay) const {
    std::shared_ptr<const platform::CheckedService> checked;
    {
        const std::lock_guard lock(mutex_);
        checked = checked_;
    }
    if (checked) checked = context_->launcher->renewExternalService(*checked, overlay);
    if (!checked) return std::nullopt;
    EVLOG_DEBUG(ops(), "activation overlay={}", overlay);
    return Preparation{.service = std::move(checked)};
}

ZRDPlugIn::Preparation ZRDPlugIn::prepareForClient(const HostProcess& host,
                                                   const Dictionary& overlay) const {
    const auto bundle = ZRBundle::initWithPath(path());
    const auto executable = bundle ? bundle->executablePath() : std::nullopt;
    if (!executable) {
        EVLOG_ERROR(ops(), "failed to obtain execPath for plug-in {}({}) bundle={}", identifier(),
                    pub(uuid()), bundle.get());
        return {.service = nullptr,
                .error = ZRErrorWithFormat(kZRErrorInvalidRequest,
                                           "cannot obtain executable path for plug-in {}({})",
                                           identifier(), uuid().string())};
    }
    EVLOG_DEBUG(ops(), "activation overlay={}", overlay);
    const platform::ExternalService service{*executable, bundleDirectory(),
                                            tdproxy_->dataContainerPath.value_or("")};
    if (const auto error = context_->workspace->restoreContainer(*tdproxy_))
        return couldNotPrepareFor(host, error->code);
    auto checked = context_->launcher->checkExternalService(service, overlay);
    if (!checked) return couldNotPrepareFor(host, checked.error().code);
    const std::lock_guard lock(mutex_);
    checked_ = *checked;
    return {.service = *std::move(checked)};
}

ZRDPlugIn::Preparation ZRDPlugIn::couldNotPrepareFor(const HostProcess& host, int failure) const {
    EVLOG_ERROR(ops(),
                "spawnerd error {} trying to allow {} {} to use plug-in {}({}) uuid={} at {}",
                failure, host.pid(), host.path(), identifier(), version(), pub(uuid()), path());
    return {.service = nullptr,
            .error = ZRErrorWithFormat(kZRErrorInvalidRequest, "unable to enable plug-in {}({})",
                                       identifier(), uuid().string())};
}

std::optional<ZRError> ZRDPlugIn::enableForClient(const HostProcess& host,
                                                  const Preparation& preparation) const {
    if (preparation.error) return preparation.error;
    const auto token = host.auditToken();
    const int failure =
        token ? context_->launcher->grantExternalService(*token, preparation.service) : ESRCH;
    if (failure == 0) return std::nullopt;
    return couldNotPrepareFor(host, failure).error;
}

std::optional<Dictionary> ZRDPlugIn::issueResourceExtensions(const Value& resources,
                                                             platform::Wait wait) const {
    const Value* begin = resources.array() ? resources.array()->begin() : &resources;
    const Value* end = resources.array() ? resources.array()->end() : &resources + 1;
    const platform::KnownDirectory bundle = bundleDirectory();
    Dictionary extensions;
    // Logged once it is clear that the resources are not gone through again.
    std::vector<std::pair<std::string_view, int>> failures;
    bool sharesTooMany = false;
    std::unordered_set<std::string_view> known;
    for (const Value* element = begin; element != end; ++element) {
        const auto* name = element->string();
        if (!name || known.contains(*name)) continue;
        if (known.size() == kMaxResources) {
            sharesTooMany = true;
            break;
        }
        known.insert(*name);
        auto token = context_->sandbox->issueReadExtension(bundle, name->string(), wait);
        if (token) {
            extensions.set(*name, *std::move(token));
        } else if (wait == platform::Wait::Never && token.error().code == EAGAIN) {
            return std::nullopt;
        } else {
            failures.emplace_back(*name, token.error().code);
        }
    }
    for (const auto& [name, code] : failures) {
        const std::string location = name == "." ? path() : platform::joinPath(path(), name);
        EVLOG_INFO(ops(), "failed to make extension for {} in plug-in at {}: {}", location, path(),
                   pub(std::strerror(code)));
    }
    if (sharesTooMany)
        EVLOG_INFO(ops(), "plug-in at {} shares more than {} resources", path(), kMaxResources);
    return extensions;
}

bool ZRDPlugIn::sharesResources() const {
    return !isAppExtension() && pluginKey(key::kShared);
}

ZRDPlugIn::Augmented ZRDPlugIn::augmentForm(Dictionary& form, platform::Wait wait) const {
    static const Value bundleItself = Array{"."};
    const Value* resources = isAppExtension() ? &bundleItself : pluginKey(key::kShared);
    if (!resources) return Augmented::ForGood;
    const auto extensions = issueResourceExtensions(*resources, wait);
    if (!extensions) return Augmented::NotYet;
    form.set(form::kExtensions, *extensions);
    // Another bundle is another record, and whether it is in its place is asked before the form is
    // used again. What lies in it may be exchanged without that, and then a token for what was
    // there grants nothing any more.
    const bool isForGood = resources == &bundleItself && !extensions->empty();
    return isForGood ? Augmented::ForGood : Augmented::ForNow;
}

}  // namespace zorvan
