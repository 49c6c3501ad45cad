// Which hosts may use a plug-in, and what the user has allowed to the application around it.

#include <fmt/format.h>

#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "platform/services/Consent.h"
#include "zrd/HostProcess.h"
#include "zrd/HostRestriction.h"
#include "zrd/PlugInContext.h"
#include "zrd/ZRDPlugIn.h"

namespace zorvan {

using platform::Value;

std::optional<std::string> ZRDPlugIn::allowForClient(const HostProcess& host) const {
    return allowForClient(host, HostRestriction(host, context_->types));
}

std::optional<std::string> ZRDPlugIn::allowForClient(const HostProcess& host,
                                                     const HostRestriction& restriction) const {
    // The host's own restriction is judged before what the plug-in demands of it.
    if (auto refusal = restriction.refusal(*this)) return refusal;
    if (!hostEntitlement_) return std::nullopt;
    // A demand that names no entitlement cannot be met by anybody.
    if (!hostEntitlement_->string() || !host.hasEntitlement(hostEntitlement_->string()->string())) {
        return fmt::format("the host does not have the \"{}\" entitlement",
                           describe(*hostEntitlement_));
    }
    return std::nullopt;
}

std::set<std::string> ZRDPlugIn::allowedVSKServices() const {
    if (!containingPath()) return {};
    auto application =
        platform::LumBundle::make(*containingPath(), platform::LumBundle::BundleDirectory);
    if (!application) {
        EVLOG_INFO(ops(), "failed to create bundle for {}", path());
        return {};
    }
    // The answer is to reflect the bundle as it is on disk now.
    application->discardCache();
    auto records = context_->consent->copyConsentInformation(*application);
    if (!records) {
        EVLOG_INFO(ops(), "VSKAccessCopyInformationForBundle failed for {}", *application);
        return {};
    }
    std::set<std::string> services;
    for (const auto& record : *records) {
        const Value* granted = record.find(platform::kConsentGranted);
        const Value* service = record.find(platform::kConsentService);
        if (granted && granted->boolean().value_or(false) && service && service->string()) {
            services.insert(service->string()->string());
        }
    }
    return services;
}

}  // namespace zorvan
