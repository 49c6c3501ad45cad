#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>

#include "Zorvan/ZRPlugInCore.h"
#include "platform/spawnerd/Launcher.h"
#include "platform/system/KnownDirectory.h"
#include "platform/tandry/TDPlugInProxy.h"
#include "platform/tandry/UntouchedBundles.h"

namespace zorvan {

class HostProcess;
class HostRestriction;
struct PlugInContext;
class RulePattern;
class RuleSet;

/// A form on its way into an answer: as `exportForm` makes it, or complete already.
struct ZRDPlugInDraft {
    platform::Dictionary form;
    bool isComplete = false;
    std::uint64_t nameChanges = 0;  // that the form takes in
};

/// The daemon's record of one installed plug-in, tied to the registry's record of it, which answers
/// the dictionary lookups and the names. Made by the database on its queue, then shared: everything
/// but the cached names is immutable, so every operation may be called from any thread, except
/// those that reach the annotations or the host (see each).
class ZRDPlugIn final : public ZRPlugInCore {
  public:
    /// Null when the registry's record has no bundle path, the core refuses it, or it fails its
    /// self-check, which is logged.
    static std::shared_ptr<ZRDPlugIn> initWithTDData(platform::TDPlugInProxyRef proxy,
                                                     std::shared_ptr<const PlugInContext> context);

    const platform::TDPlugInProxyRef& tdproxy() const { return tdproxy_; }
    /// The bundle's directory as the registry read it.
    platform::KnownDirectory bundleDirectory() const { return {path(), tdproxy_->bundleIdentity}; }

    // The registry's view of the bundle.
    const platform::Dictionary* bundleInfoDictionary() const override;
    const platform::Value* infoKey(std::string_view key) const override;
    const platform::Value* pluginKey(std::string_view key) const override;
    const platform::Value* attribute(std::string_view key) const override;
    bool isDedicated() const override { return isDedicated_; }
    bool isAppExtension() const override { return isAppExtension_; }
    std::optional<std::string> localizedName() const override;
    void setLocalizedName(std::optional<std::string> value) override;
    std::optional<std::string> localizedShortName() const override;
    void setLocalizedShortName(std::optional<std::string> value) override;
    std::optional<std::string> localizedContainingName() const override;
    void setLocalizedContainingName(std::optional<std::string> value) override;

    /// The core's self-check, then the daemon's: a data container for what runs, and an application
    /// around what is not part of the system.
    std::optional<ZRError> diagnose() const override;

    using Draft = ZRDPlugInDraft;
    /// The record's form, without tokens unless it was completed before. An error: there is none,
    /// as with `exportForm`.
    std::optional<Draft> draftForm(const platform::UntouchedBundles& untouched,
                                   std::optional<ZRError>& error) const;
    /// The form with what `augmentForm` adds. Unless its tokens may go stale, it is encoded at the
    /// first call and shared from then on, as long as the bundle that it has a token for is in its
    /// place, which `draftForm` looks at unless it is one of `untouched`; setting a name makes it
    /// afresh. None, and the draft as it was, when that would have to wait for the bundle's file
    /// system, and may not.
    std::optional<platform::Dictionary> completedForm(Draft& draft, platform::Wait wait) const;
    /// Whether tokens are issued for each of its forms anew.
    bool sharesResources() const;

    /// The plug-in's value for an entitlement, or null.
    const platform::Value* valueForEntitlement(std::string_view name) const;
    /// Whether that value is there and does not equal boolean false.
    bool hasEntitlement(std::string_view name) const;
    /// What its entitlement to replace other plug-ins names: a text, a list of texts, something
    /// else, or null.
    const platform::Value* replaced() const { return replaced_; }
    /// The key of the user's choices about this plug-in: the identifier that it replaces, else its
    /// own.
    std::string_view annotationKey() const;

    /// `dictionary` without the entries whose keys begin with "DT".
    static platform::Dictionary prunedInfoDictionaryFor(const platform::Dictionary& dictionary);

    // Matching. Reads annotations: not from inside the database's queue.
    /// Whether every rule holds.
    bool match(const RuleSet& rules) const;
    /// The same for rules that are asked once; no rules hold always.
    bool match(const platform::Dictionary* rules) const;
    /// Whether one rule holds.
    bool matchKey(const std::string& key, const RulePattern& pattern) const;
    bool matchKey(const std::string& key, const platform::Value& pattern) const;

    // Admission.
    /// Why the host may not use this plug-in; none: it may.
    std::optional<std::string> allowForClient(const HostProcess& host) const;
    /// The same with the host's restriction, for who asks about many plug-ins.
    std::optional<std::string> allowForClient(const HostProcess& host,
                                              const HostRestriction& restriction) const;
    // Enabling.
    /// What a host needs to start this plug-in, as the bundle is now, or why it cannot.
    struct Preparation {
        std::shared_ptr<const platform::CheckedService> service;  // null when there is an error
        std::optional<ZRError> error{};
    };
    /// The activation overlay for a start by a host, which the log is told of: to be prepared next.
    platform::Dictionary overlayForClient(const HostProcess& host) const;
    /// Prepares the start as it was prepared before, while that holds: without waiting for anybody.
    /// None when only `prepareForClient` tells.
    std::optional<Preparation> prepareAgain(const platform::Dictionary& overlay) const;
    /// Prepares the start by a host. Waits for the bundle's file system, so not on the service
    /// queue.
    Preparation prepareForClient(const HostProcess& host,
                                 const platform::Dictionary& overlay) const;
    /// What comes of it when it met an errno, which it logs.
    Preparation couldNotPrepareFor(const HostProcess& host, int failure) const;
    /// Tells the launcher that the host may start this plug-in, as it was prepared. The error says
    /// why not.
    std::optional<ZRError> enableForClient(const HostProcess& host,
                                           const Preparation& preparation) const;
    /// A token for each named resource of the bundle ("." is the bundle), under its name, up to 64
    /// of them; those for which there is none are left out, with a log line. `resources` is a text
    /// or a list. None when one would have to wait for the bundle's file system, and may not.
    std::optional<platform::Dictionary> issueResourceExtensions(const platform::Value& resources,
                                                                platform::Wait wait) const;
    /// What comes of `augmentForm`.
    enum class Augmented { ForGood, ForNow, NotYet };
    /// Adds the tokens for what the plug-in shares with hosts: for as long as this record, and its
    /// bundle in its place; for this answer alone; or not, as it would have to wait.
    Augmented augmentForm(platform::Dictionary& form, platform::Wait wait) const;
    /// What a busy running instance says of itself, or none.
    std::optional<platform::Dictionary> checkBusy() const;

    /// The consent services that the user has granted to the containing application.
    std::set<std::string> allowedVSKServices() const;

  private:
    ZRDPlugIn(platform::TDPlugInProxyRef proxy, std::shared_ptr<const PlugInContext> context);
    bool fillFromProxy();
    std::uint32_t declaredHubProtocolVersion() const;

    /// The value that a rule's key stands for: borrowed from the registry's record, or made for the
    /// rule.
    struct RuleValue;
    RuleValue valueForRule(const std::string& key) const;
    const platform::Value* attributeOrInfoKey(std::string_view key) const;
    std::string userElection() const;
    const char* sandboxProfile() const;
    platform::Dictionary containerEnvironment() const;
    platform::Dictionary launchService() const;

    std::optional<std::string> cachedName(std::optional<std::string>& cache,
                                          const std::optional<std::string>& registered) const;
    void setName(std::optional<std::string>& cache, std::optional<std::string> value);

    const platform::TDPlugInProxyRef tdproxy_;
    // The registry record's dictionaries, so that a lookup searches one of them and not three.
    const platform::Dictionary& registeredInfo_;
    const platform::Dictionary* const registeredPlugIn_;
    const platform::Dictionary* const registeredAttributes_;
    // What every discovery asks of every candidate.
    const bool isDedicated_;
    const bool isAppExtension_;
    const platform::Value* const hostEntitlement_;
    const platform::Value* const replaced_;
    const platform::Value* const extensionPoint_;
    const std::shared_ptr<const PlugInContext> context_;
    mutable std::mutex mutex_;  // guards what follows
    mutable std::optional<std::string> localizedName_;
    mutable std::optional<std::string> localizedShortName_;
    mutable std::optional<std::string> localizedContainingName_;
    std::uint64_t nameChanges_ = 0;
    mutable std::optional<platform::Dictionary> form_;
    mutable std::shared_ptr<const platform::CheckedService> checked_;  // by the last preparation
};

}  // namespace zorvan
