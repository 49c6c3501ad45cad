#pragma once

#include <algorithm>
#include <atomic>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/Services.h"
#include "platform/log/Log.h"
#include "platform/lum/Connection.h"
#include "platform/threads/SerialQueue.h"
#include "tests/zrd/ProbeTrace.h"
#include "zrd/HostProcess.h"
#include "zrd/PlugInContext.h"
#include "zrd/ZRDPlugIn.h"

namespace zorvan {

using platform::Array;
using platform::Dictionary;
using platform::Value;

struct FakeAnnotations final : AnnotationReader {
    std::optional<Dictionary> annotationForPlugIn(const ZRDPlugIn& plugIn) override {
        auto found = stored.find(std::string(plugIn.annotationKey()));
        return found == stored.end() ? std::nullopt : std::optional(found->second);
    }
    std::map<std::string, Dictionary> stored;
};

struct FakeTypes final : platform::Types {
    std::string name(const std::string& type) override { return type; }
    std::vector<std::string> lineage(const std::string& type) override {
        if (type == "png") return {"png", "image"};
        return {type};
    }
};

struct FakeConsent final : platform::Consent {
    std::optional<std::vector<Dictionary>> copyConsentInformation(
        const platform::LumBundle&) override {
        return records;
    }
    std::optional<std::vector<Dictionary>> records;
};

struct FakeHost final : HostProcess {
    pid_t pid() const override { return 7; }
    std::optional<platform::AuditToken> auditToken() const override { return token; }
    const std::string& path() const override { return path_; }
    const std::shared_ptr<ZRBundle>& bundle() const override { return bundle_; }
    std::optional<Value> entitlementValueForKey(const std::string& name) const override {
        const Value* value = entitlements.find(name);
        return value ? std::optional(*value) : std::nullopt;
    }
    bool hasEntitlement(const std::string& name) const override {
        auto value = entitlementValueForKey(name);
        return value && !platform::equalsFalse(*value);
    }
    std::shared_ptr<ZRBundle> bundle_;
    Dictionary entitlements;
    std::optional<platform::AuditToken> token = platform::AuditToken::ofSelf();
    std::string path_ = "/Apps/Host.app/Host";
};

inline platform::TDApplicationProxyRef makeApplication(const std::string& path,
                                                       bool isPlaceholder = false) {
    return std::make_shared<platform::TDApplicationProxy>(
        platform::TDApplicationProxy{path, "com.host", "Host", isPlaceholder});
}

/// A good plug-in inside /Apps/Host.app, version 1 unless its attributes say otherwise.
inline std::shared_ptr<platform::TDPlugInProxy> makeProxy(const std::string& identifier,
                                                          Dictionary attributes = {},
                                                          Dictionary plugIn = {}) {
    if (!attributes.contains("VXExtensionVersion")) attributes.set("VXExtensionVersion", "1");
    plugIn.set("VXExtensionAttributes", std::move(attributes));
    auto proxy = std::make_shared<platform::TDPlugInProxy>();
    proxy->plugInUuid = platform::Uuid::random();
    proxy->bundlePath = "/Apps/Host.app/PlugIns/" + identifier + ".appex";
    proxy->plugInIdentifier = proxy->originalIdentifier = identifier;
    proxy->containingApplication = makeApplication("/Apps/Host.app");
    proxy->dataContainerPath = "/Containers/" + identifier;
    proxy->infoPlist = Dictionary{{"VXExtension", std::move(plugIn)}, {"Top", "top"}};
    return proxy;
}

struct FakeSandbox final : platform::Sandbox {
    bool isSandboxed(const platform::AuditToken&) override { return sandboxed; }
    bool isConfined(const platform::AuditToken&) override { return sandboxed; }
    platform::Result<std::string> issueReadExtension(const platform::KnownDirectory& bundle,
                                                     const std::string& resource,
                                                     platform::Wait wait) override {
        const std::string path = resource == "." ? bundle.path : bundle.path + "/" + resource;
        if (onIssue) onIssue();
        if (wait == platform::Wait::Never && distant.contains(bundle.path))
            return platform::Error::posix(EAGAIN, path);
        if (unreadable.contains(path)) return platform::Error::posix(EACCES, path);
        latest = path;
        return "token " + std::to_string(++issued) + " " + path;
    }
    std::set<std::string> unreadable;
    std::set<std::string> distant;  // bundles that are not looked at without waiting
    std::function<void()> onIssue;
    std::string latest;  // that a token was issued for
    int issued = 0;
    bool sandboxed = false;
};

/// Knows no instances, until told what to answer; keeps what it was asked for.
struct FakeLauncher final : platform::Launcher {
    struct Checked final : platform::CheckedService {
        Checked(const platform::ExternalService& service, const Dictionary& overlay)
            : contents(service, overlay) {}
        const std::pair<platform::ExternalService, Dictionary> contents;
    };
    platform::Result<std::shared_ptr<const platform::CheckedService>> checkExternalService(
        const platform::ExternalService& service, const Dictionary& overlay) override {
        if (onCheck) onCheck();
        if (refused.contains(service.executable)) return platform::Error::posix(EACCES, "refused");
        return std::shared_ptr<const platform::CheckedService>(new Checked(service, overlay));
    }
    std::shared_ptr<const platform::CheckedService> renewExternalService(
        const platform::CheckedService& checked, const Dictionary& overlay) override {
        const auto& service = static_cast<const Checked&>(checked).contents.first;
        return renews ? std::make_shared<const Checked>(service, overlay) : nullptr;
    }
    bool renews = false;
    int grantExternalService(
        const platform::AuditToken&,
        const std::shared_ptr<const platform::CheckedService>& checked) override {
        const auto& [service, overlay] = static_cast<const Checked&>(*checked).contents;
        granted.emplace_back(service.executable, overlay);
        services.push_back(service);
        return 0;
    }
    std::function<void()> onCheck;
    void removeExternalServices(const std::string& bundlePath) override {
        takenBack.insert(bundlePath);
    }
    std::set<std::string> takenBack;
    std::unique_ptr<WorkMarker> beginOutstandingWork() override {
        if (atNewWork) std::exchange(atNewWork, nullptr)();
        struct Marker final : WorkMarker {
            explicit Marker(int& value) : count(value) { ++count; }
            ~Marker() override { --count; }
            int& count;
        };
        return std::make_unique<Marker>(markers);
    }
    std::vector<std::pair<std::string, Dictionary>> granted;
    std::vector<platform::ExternalService> services;
    std::set<std::string> refused;
    std::function<void()> atNewWork;  // once
    int markers = 0;
    void terminatePlugInInstances(const std::string& identifier, const std::string& version,
                                  const platform::KnownDirectory& bundle,
                                  platform::SerialQueue& queue, Completion completion) override {
        terminated.push_back(identifier + " " + version);
        terminatedBundles.push_back(bundle);
        Status status = statuses.empty() ? kNoneOnRecord : statuses.front();
        if (!statuses.empty()) statuses.erase(statuses.begin());
        queue.async([completion = std::move(completion), status] { completion(status); });
    }
    void shutDown(std::function<void()> completion) override { completion(); }
    std::vector<std::string> terminated;
    std::vector<platform::KnownDirectory> terminatedBundles;
    std::vector<Status> statuses;
};

/// Reports that a test chooses, of the bundles at some place.
struct FakeAssertions final : platform::Assertions {
    std::vector<Dictionary> busyInstancesForBundleIdentifiers(
        const std::set<std::string>& identifiers, const std::string& bundlePath) override {
        std::vector<Dictionary> found;
        for (const std::string& identifier : identifiers) {
            auto [first, last] = reports.equal_range(identifier);
            for (; first != last; ++first)
                if (bundlePath.starts_with(place)) found.push_back(first->second);
        }
        return found;
    }
    std::multimap<std::string, Dictionary> reports;
    std::string place;
};

/// A registry in memory, which refuses what confined processes ask for. Its query keeps whatever
/// the filter keeps, or fails.
struct FakeWorkspace final : platform::Workspace {
    using List = platform::TDPlugInProxyList;
    using Ref = platform::TDPlugInProxyRef;

    std::unique_ptr<Observation> addObserver(platform::WorkspaceObserver& added) override {
        observer = &added;
        return std::make_unique<Observation>();
    }
    void activate() override { active = true; }
    Ref plugInWithUuid(const platform::Uuid& uuid) override {
        return first([&](const Ref& proxy) { return proxy->plugInUuid == uuid; });
    }
    Ref plugInAtPath(const std::string& path) override {
        return first([&](const Ref& proxy) { return proxy->bundlePath == path; });
    }
    List plugInsOfApplication(const std::string& path) override {
        List found;
        for (const auto& proxy : installed) {
            const auto& application = proxy->containingApplication;
            if (application && application->bundlePath == path) found.push_back(proxy);
        }
        return found;
    }
    List installedPlugIns() override { return installed; }
    platform::UntouchedBundles untouchedBundles() override { return {}; }
    std::optional<List> plugInsMatching(const Dictionary&, const Filter& filter) override {
        ++queries;
        if (queryFails) return std::nullopt;
        List found;
        for (const auto& proxy : installed) {
            if (!filter || filter(proxy->plugInIdentifier, proxy->entitlements.get()))
                found.push_back(proxy);
        }
        return found;
    }
    std::optional<platform::Error> registerPlugIn(const std::string& path,
                                                  platform::Requester requester) override {
        return change("add ", path, requester);
    }
    std::optional<platform::Error> unregisterPlugIn(const std::string& path,
                                                    platform::Requester requester) override {
        return change("remove ", path, requester);
    }
    std::optional<platform::Error> restoreContainer(const platform::TDPlugInProxy& proxy) override {
        restored.push_back(proxy.dataContainerPath.value_or(""));
        return lostContainers ? std::optional(platform::Error::posix(ENOSPC, "/")) : std::nullopt;
    }
    void clearSchemaCaches() override { ++schemaClears; }

    List installed;
    std::set<std::string> refused;
    std::vector<std::string> changes;
    std::function<void()> onChange;
    platform::WorkspaceObserver* observer = nullptr;
    bool active = false, queryFails = false, lostContainers = false;
    std::vector<std::string> restored;
    int queries = 0, schemaClears = 0;

  private:
    template <class Predicate>
    Ref first(Predicate matches) const {
        auto found = std::ranges::find_if(installed, matches);
        return found == installed.end() ? nullptr : *found;
    }
    std::optional<platform::Error> change(const char* verb, const std::string& path,
                                          platform::Requester requester) {
        changes.push_back(verb + path);
        if (onChange) onChange();
        if (requester == platform::Requester::Confined || refused.contains(path))
            return platform::Error{"test", 1, "refused"};
        return std::nullopt;
    }
};

/// What records need of the world, and records in it.
struct FakeWorld {
    std::shared_ptr<ZRDPlugIn> record(platform::TDPlugInProxyRef proxy) const {
        return ZRDPlugIn::initWithTDData(std::move(proxy), context);
    }
    std::shared_ptr<FakeAnnotations> annotations = std::make_shared<FakeAnnotations>();
    std::shared_ptr<FakeConsent> consent = std::make_shared<FakeConsent>();
    std::shared_ptr<FakeSandbox> sandbox = std::make_shared<FakeSandbox>();
    std::shared_ptr<FakeLauncher> launcher = std::make_shared<FakeLauncher>();
    std::shared_ptr<FakeAssertions> assertions = std::make_shared<FakeAssertions>();
    std::shared_ptr<FakeWorkspace> workspace = std::make_shared<FakeWorkspace>();
    std::shared_ptr<PlugInContext> context =
        std::make_shared<PlugInContext>(PlugInContext{.annotations = annotations,
                                                      .launcher = launcher,
                                                      .assertions = assertions,
                                                      .sandbox = sandbox,
                                                      .consent = consent,
                                                      .types = std::make_shared<FakeTypes>(),
                                                      .workspace = workspace});
};

/// Entitlements that every process has.
struct FakeCodeSigning final : platform::CodeSigning {
    struct Task final : platform::CodeSigningTask {
        explicit Task(const FakeCodeSigning& owner) : owner_(owner) {}
        Answer entitlement(const std::string& name) override {
            if (owner_.error) return {std::nullopt, owner_.error};
            const Value* value = owner_.entitlements.find(name);
            return {value ? std::optional(*value) : std::nullopt, std::nullopt};
        }
        const FakeCodeSigning& owner_;
    };
    std::unique_ptr<platform::CodeSigningTask> makeTask(const platform::AuditToken&) override {
        return std::make_unique<Task>(*this);
    }
    std::unique_ptr<platform::CodeSigningTask> makeTaskAtOnce(const platform::AuditToken&,
                                                              int) override {
        return std::make_unique<Task>(*this);
    }
    Dictionary entitlements;
    std::optional<platform::Error> error;
};

struct FakeNotifications final : platform::Notifications {
    void post(const std::string& name) override { posted.push_back(name); }
    void finish() override {}
    std::vector<std::string> posted;
};

/// A connection from this process; the test delivers its events and reads what was sent.
struct FakeConnection final : platform::Connection {
    pid_t pid() const override {
        if (whenAsked) std::exchange(whenAsked, nullptr)();
        return id;
    }
    const platform::AuditToken& auditToken() const override { return token; }
    platform::Origin origin() const override { return platform::Origin::of(token); }
    void setContext(std::shared_ptr<void> value) override { context = std::move(value); }
    void setEventHandler(EventHandler value) override { handler = std::move(value); }
    void resume() override { resumed = true; }
    void send(const platform::Message& reply) override {
        if (ProbeTrace::enablesGuarded) EVLOG_DEBUG(platform::Log::make("test", "peer"), "reply");
        sent.push_back(reply);
        isAnswered = true;
    }
    std::string description() const override { return "fake"; }

    void deliver(const platform::ConnectionEvent& event) {
        auto current = handler;
        const auto* error = std::get_if<platform::ConnectionError>(&event);
        if (error && error->kind == platform::ConnectionError::Kind::Invalid) handler = nullptr;
        if (current) current(event);
    }

    platform::AuditToken token = platform::AuditToken::ofSelf().value();
    pid_t id = token.pid();
    mutable std::function<void()> whenAsked;  // once, for its process id
    std::shared_ptr<void> context;
    EventHandler handler;
    bool resumed = false;
    std::vector<platform::Message> sent;
    std::atomic<bool> isAnswered = false;
};

}  // namespace zorvan
