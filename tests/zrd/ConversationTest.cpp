// What a whole conversation leaves in the log and tells tracers: every line at its level and in its
// place, with what is private hidden.

#include "Zorvan/Keys.h"
#include "platform/plist/PropertyList.h"
#include "platform/services/Preferences.h"
#include "tests/zrd/ProbeTrace.h"
#include "tests/zrd/TransactionTest.h"

namespace zorvan {

namespace {

using platform::ConnectionError;
using platform::Uuid;

class ConversationTest : public TransactionTest {
  protected:
    void SetUp() override {
        TransactionTest::SetUp();
        connection_ = std::make_shared<FakeConnection>();
        connection_->id = 7;
        names_[directory_.path()] = "DIR";
    }
    std::shared_ptr<platform::TDPlugInProxy> install(const char* name, Dictionary attributes = {},
                                                     Dictionary plugIn = {}) {
        auto proxy = makeProxy(name, std::move(attributes), std::move(plugIn));
        workspace_->installed.push_back(proxy);
        names_[proxy->plugInUuid.string()] = name;
        return proxy;
    }
    /// What has been said since the last call, with names for what differs from run to run.
    std::string said() {
        drain();
        std::string text = "\n";
        for (const std::string& line : log_.take()) text += line + '\n';
        for (const auto& [what, name] : names_)
            for (std::size_t at; (at = text.find(what)) != std::string::npos;)
                text.replace(at, what.size(), name);
        return text;
    }
    /// What a request makes be said, without the two lines that every request begins with.
    std::string said(const char* request, Dictionary contents) {
        contents.set("request", request);
        reply_ = ask(std::move(contents));
        const Value* token = reply_.find("uuids");
        if (token) names_[token->uuid()->string()] = "hold";
        const std::string text = said();
        const std::string start =
            fmt::format("\nops D: client 7 requested {0}\nprobe D: request 7 {0}", request);
        EXPECT_TRUE(text.starts_with(start)) << text;
        return text.substr(start.size());
    }

    LogLines log_{LogLines::Private::Hidden};
    ProbeTrace trace_;
    Dictionary reply_;
    std::map<std::string, std::string> names_;
};

TEST_F(ConversationTest, ArrivalAndRegistration) {
    log_.take();
    connect(connection_);
    EXPECT_EQ(said(), R"(
ops D: new client 7 <private>
probe D: client-new 7
)");
    ProbeTrace::enablesGuarded = true;
    ask({{"request", "bulk"}, {"flags", 1}});
    EXPECT_EQ(said(), R"(
probe D: request-input 7 {flags: 1, request: "bulk", version: 3}
ops D: client 7 requested bulk
probe D: request 7 bulk
ops I: bulk options 0x1 not supported
probe D: request-output 7 {}
peer D: reply
)");
    ProbeTrace::enablesGuarded = false;
    ask({});
    EXPECT_EQ(said(), R"(
ops D: client 7 requested (null)
probe D: request 7 (null)
)");
    ask({{"request", "bulk"}, {"version", 4}});
    EXPECT_EQ(said(), "\n");
    EXPECT_EQ(said("add", {{"paths", Array{"/gone"}}}), "\n");
    const std::string good = directory_.makeDirectory("good"),
                      bad = directory_.makeDirectory("bad");
    workspace_->refused = {bad, "/gone"};
    EXPECT_EQ(said("add", {{"paths", Array{good, bad}}}), R"(
probe D: plugin-add DIR/good
probe D: plugin-add DIR/bad
ops I: Tandry refused to register <private>: <private>
ops -: failed to register plug-in at <private>
)");
    codeSigning_->error = platform::Error{"POSIX", 5, "unreadable"};
    EXPECT_EQ(said("remove", {{"paths", Array{"/gone"}}}), R"(
probe D: plugin-remove /gone false
ops E: error retrieving entitlements for client 7
default -: refused request from pid=7 to remove plug-in at /gone - client lacks required entitlement
)");
    codeSigning_->error.reset();
    codeSigning_->entitlements = {{entitlement::kManager, true}};
    EXPECT_EQ(said("remove", {{"paths", Array{good, "/gone"}}}), R"(
probe D: plugin-remove DIR/good true
probe D: plugin-remove /gone false
ops I: Tandry refused to unregister <private>: <private>
)");
    client().setAcceptWork(false);
    deliver(platform::Message({{"request", "bulk"}, {"version", 3}}));
    EXPECT_EQ(said(), "\n");
    EXPECT_EQ(ask({{"version", 4}}), error(7, "unsupported protocol version 4 (current 3)"));
}

TEST_F(ConversationTest, Discovery) {
    platform::Preferences(services_.directories)
        .edit(kUserPreferences, [](Dictionary& preferences) {
            preferences = {{kExclusions, Array{Dictionary{{"Loud", true}}}}};
            return true;
        });
    connect(connection_);
    const auto found = install("found", {{"Rule", true}});
    const auto replacer =
        install("replacer", {}, {{"Shared", "none"}, {"VXExtensionProtocol", "P"}});
    replacer->bundlePath = "/Apps/Host.app/PlugIns/replacer";
    replacer->entitlements = Dictionary{{entitlement::kReplacePlugIn, "found"}};
    sandbox_->unreadable = {*replacer->bundlePath + "/none"};
    install("refused", {}, {{"VXExtensionHostEntitlement", "com.demand"}});
    install("excluded", {{"Loud", true}});
    install("odd", {{"VXExtensionVersion", 1}})->originalIdentifier.reset();
    install("bare")->dataContainerPath.reset();
    install("lost")->bundlePath.reset();
    install("half")->containingApplication = makeApplication("/Apps/Half.app", true);
    said();
    EXPECT_EQ(said("match", {{"flags", 0}}), R"(
td D: 8 installedPlugins: <private>
ops I: ignoring mis-configured plug-in at <private>: this plug-in has no sandbox data container
ops I: skipping td proxy <private> with nil bundleURL
ops I: skipping td proxy <private> because its app is a placeholder
ops D: TD reported 5 plug-ins (cache 0/5)
probe D: discover-raw 5
ops I: failed to make extension for <private> in plug-in at <private>: Permission denied
ops D: client 7 cannot use plugin refused: the host does not have the "com.demand" entitlement
ops D: client 7 plugin excluded globally excluded
ops E: failed to export matching plug-in odd: plug-in odd has no original identifier (Zorvan 12)
ops I: plug-in replacer overrides found
ops I: match returned 2 plug-ins
ops D: reply marshalled
)");
    workspace_->installed = {found};
    const Dictionary rules{{"Rule", Dictionary()}, {"Top", "?x"}, {"VXUserElection", "0"}};
    EXPECT_EQ(said("match", {{"rules", rules}}), R"(
ops D: td filter <private> -> 1
td D: 1 plugin(s) matching <private> = <private>
ops D: TD reported 1 plug-ins (cache 5/5)
probe D: discover-raw 1
extension D: evaluating VXExtension filter: <private> value: <private>
ops I: unrecognized match operator:<private>
ops I: match returned 0 plug-ins
ops D: reply marshalled
)");
    const Array one{found->plugInUuid};
    const Dictionary election{{"election", 1}},
        extensions{{found->plugInUuid.string(), Dictionary()}};
    EXPECT_EQ(said("annotate", {{"annotations", election}, {"uuids", one}}), R"(
ops D: client 7 plug-in <private>(found) annotation change: <private>
ops I: client 7 plug-in <private>(found) election := <private>
)");
    EXPECT_EQ(said("bulk-annotate", {{"annotations", extensions}}), R"(
ops D: bulk change requested for 1 plug-ins
ops D: client 7 bulk plug-in <private>(found) annotation change: <private>
)");
    server_->setCacheLimit(4);
    const Uuid unknown = Uuid::random();
    names_[unknown.string()] = "unknown";
    EXPECT_EQ(said("access", {{"uuids", Array{install("new")->plugInUuid, unknown}}}), R"(
ops I: purging cache for 5 > 4
ops I: Tandry cannot find plug-in with UUID:unknown
)");
}

TEST_F(ConversationTest, UseHoldAndEnd) {
    connect(connection_);
    const Dictionary keyboard{{"VXExtensionPointIdentifier", "com.orbel.keyboard-service"}};
    const auto used = install("used", {{"RequestsOpenAccess", true}}, keyboard);
    Dictionary info = used->infoPlist.get();
    info.set("QFBundleIdentifier", "com.bundle");
    info.set("LUMService", Dictionary());
    used->infoPlist = info;
    used->bundlePath = directory_.makeDirectory("used.appex");
    used->bundleIdentity = {3, 5};
    used->containingApplication = makeApplication(directory_.path());
    const auto lost = install("lost", {{"RequestsOpenAccess", true}}, keyboard);
    lost->bundlePath = "lost.appex";
    lost->containingApplication = makeApplication("lost.app");
    launcher_->refused = {*used->bundlePath};
    said();
    EXPECT_EQ(said("ready", {{"uuids", Array{used->plugInUuid, lost->plugInUuid}}}), R"(
probe D: plugin-ready used
probe D: plugin-ready lost
ops I: VSKAccessCopyInformationForBundle failed for <private>
td D: raw LUMService=<private>
ops I: assigning plug-in <private>(<private>) used to <private> sandbox
ops -: allowing host 7 <private> to use plug-in <private>(<private>) uuid=used at <private>
ops D: activation overlay=<private>
ops E: spawnerd error 13 trying to allow 7 <private> to use plug-in <private>(<private>) uuid=used at <private>
ops I: failed to create bundle for <private>
ops I: no LUMService for plug-in; database returned <private>
ops I: assigning plug-in <private>(<private>) lost to <private> sandbox
ops -: allowing host 7 <private> to use plug-in <private>(<private>) uuid=lost at <private>
ops E: failed to obtain execPath for plug-in <private>(lost) bundle=<private>
)");
    const auto refused = install("refused", {}, {{"VXExtensionHostEntitlement", "com.demand"}});
    EXPECT_EQ(said("ready", {{"uuids", Array{refused->plugInUuid}}}), R"(
probe D: plugin-ready refused
ops -: denied access to 7 for plugin <private>(refused): the host does not have the "com.demand" entitlement
)");
    workspace_->lostContainers = true;
    EXPECT_THAT(said("ready", {{"uuids", Array{used->plugInUuid}}}), testing::EndsWith(R"(
ops E: spawnerd error 28 trying to allow 7 <private> to use plug-in <private>(<private>) uuid=used at <private>
)"));
    assertions_->reports = {{"com.bundle", Dictionary()},
                            {"com.bundle", {{platform::kAssertionBundleIdentifier, "com.bundle"}}}};
    EXPECT_EQ(said("lock", {{"flags", ZRHoldApplications}, {"paths", Array{directory_.path()}}}),
              R"(
ops E: tenurd reported incomplete bundle for plug-in <private>/used
ops D: hold rejected. Busy plug-ins:<private>
)");
    EXPECT_EQ(said("lock", {{"flags", ZRHoldPlugIns}, {"paths", Array{"/"}}}), R"(
ops I: Tandry cannot find plug-in at path:<private>
)");
    EXPECT_EQ(said("lock", {{"flags", ZRHoldPlugIns}, {"paths", Array{*used->bundlePath}}}), R"(
ops D: hold request granted uuid:hold
)");
    const Value token = *reply_.find("uuids");
    EXPECT_EQ(said("ready", {{"uuids", Array{used->plugInUuid}}}), R"(
probe D: plugin-ready used
ops -: denied access to 7 for plugin <private>(used): the plug-in is on hold
)");
    EXPECT_EQ(said("lock", {{"uuids", Array{token}}}), R"(
ops D: releasing plug-in hold hold at client's request
)");

    used->bundleIdentifier = "com.bundle";
    used->bundleVersion = "7";
    launcher_->statuses = {0, 3, 22};
    std::promise<void> go;  // the launcher's answers come after all that it is asked
    server_->submitWork([blocked = go.get_future().share()] { blocked.wait(); });
    workspace_->observer->pluginsDidInstall({used});
    workspace_->observer->pluginsWillUninstall({});
    workspace_->observer->pluginsWillUninstall({used, used, lost});
    go.set_value();
    EXPECT_EQ(said(), R"(
ops -: plug-in INSTALLED:<private> <private>(<private>) used <private>
ops -: plug-in UNINSTALLED:<private> <private>(<private>) used <private>
ops -: plug-in UNINSTALLED:<private> <private>(<private>) used <private>
ops -: plug-in UNINSTALLED:<private> <private>(<private>) lost <private>
ops D: requesting spawnerd termination of plug-in: <private>(<private>) used
ops D: requesting spawnerd termination of plug-in: <private>(<private>) used
ops D: requesting spawnerd termination of plug-in: <private>(<private>) lost
ops D: spawnerd reported plug-ins have been terminated
ops D: spawnerd reported no plug-ins on record
ops I: spawnerd error attempting to terminate plug-ins: error=22
)");
    EXPECT_THAT(launcher_->terminated, testing::ElementsAre("com.bundle 7", "com.bundle 7", " "));
    EXPECT_EQ(launcher_->terminatedBundles.at(0),
              (platform::KnownDirectory{*used->bundlePath, {3, 5}}));

    said("lock", {{"flags", ZRHoldPlugIns}, {"paths", Array{*used->bundlePath}}});
    deliver(platform::UnknownObject{"[1, 2]"});
    for (auto kind : {ConnectionError::Kind::Interrupted,
                      ConnectionError::Kind::TerminationImminent, ConnectionError::Kind::Invalid})
        deliver(ConnectionError{kind, "gone"});
    EXPECT_EQ(said(), R"(
ops E: unexpected message: [1, 2] from: 7
ops E: unexpected error type from lum: connection interrupted: gone
ops D: client 7 termination imminent
ops D: releasing plug-in hold hold for dead client pid 7
ops D: client 7 is dead
probe D: client-done 7
)");
}

}  // namespace

}  // namespace zorvan
