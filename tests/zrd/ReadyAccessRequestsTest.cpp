#include <cstdlib>
#include <filesystem>

#include "Zorvan/Keys.h"
#include "platform/lum/Limits.h"
#include "tests/support/KnownDirectory.h"
#include "tests/zrd/TransactionTest.h"
#include "zrd/ZRDPlugInSignature.h"

namespace zorvan {

namespace {

using testing::Contains;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

class ReadyAccessTest : public TransactionTest {
  protected:
    void SetUp() override {
        TransactionTest::SetUp();
        workspace_->installed = {
            makeProxy("com.a"), makeProxy("com.data", {}, {{"VXExtensionProtocol", "#Data"}}),
            makeProxy("com.c", {}, {{"VXExtensionHostEntitlement", "com.demand"}}),
            makeProxy("com.d")};
    }
    Dictionary ask(const char* request, std::vector<int> plugIns) {
        Array uuids;
        for (int i : plugIns) uuids.append(workspace_->installed[i]->plugInUuid);
        return TransactionTest::ask({{"request", request}, {"uuids", uuids}});
    }
    std::string executable(int i) { return *workspace_->installed[i]->bundlePath; }
};

TEST_F(ReadyAccessTest, AllAreAdmittedBeforeAnyIsEnabled) {
    EXPECT_EQ(ask("ready", {0, 2, 3}),
              error(11,
                    "access to plugin com.c denied: the host does not have the "
                    "\"com.demand\" entitlement"));
    EXPECT_THAT(launcher_->granted, IsEmpty());
    codeSigning_->entitlements = {{"com.demand", true}};
    EXPECT_EQ(ask("ready", {0, 1, 2, 0}), Dictionary());
    ASSERT_EQ(launcher_->granted.size(), 2u);
    EXPECT_EQ(launcher_->granted[0].first, executable(0));
    EXPECT_EQ(launcher_->granted[1].first, executable(2));
    EXPECT_EQ(ask("ready", {}), Dictionary());
    EXPECT_EQ(ask("ready", {1}), Dictionary()) << "data needs no admission";

    launcher_->refused = {executable(0)};
    launcher_->granted.clear();
    EXPECT_EQ(ask("ready", {0, 3}),
              error(4, "unable to enable plug-in com.a(" +
                           workspace_->installed[0]->plugInUuid.string() + ")"));
    EXPECT_EQ(launcher_->granted.size(), 1u) << "the others are enabled all the same";
    launcher_->refused.insert(executable(3));
    EXPECT_EQ(ask("ready", {3, 0}),
              error(4, "unable to enable plug-in com.d(" +
                           workspace_->installed[3]->plugInUuid.string() + ")"));
}

TEST_F(ReadyAccessTest, WhatIsAsItWasNeedsNoLook) {
    int checks = 0;
    launcher_->onCheck = [&] { ++checks; };
    for (const bool renews : {true, true, false}) {
        launcher_->renews = renews;
        EXPECT_EQ(ask("ready", {0, 3}), Dictionary());
    }
    EXPECT_EQ(checks, 4);
    EXPECT_EQ(launcher_->granted.size(), 6u);
    EXPECT_EQ(launcher_->granted[2], launcher_->granted[0]);
}

TEST_F(ReadyAccessTest, WhatIsHeldWhileItIsLookedAtIsNotEnabled) {
    const auto plugIn = server_->findPlugIn(workspace_->installed[0]->plugInUuid);
    launcher_->onCheck = [&] {
        auto share = server_->holdPool().draw({1, 1, 0});
        server_->addHold(std::make_shared<ZRDPlugInHold>(
            HoldSubject{{plugIn}, {}}, client().weak_from_this(), *std::move(share), *launcher_));
    };
    EXPECT_EQ(ask("ready", {0, 3}),
              error(11, "access to plugin com.a denied: the plug-in is on hold"));
    const auto last = workspace_->installed.back();
    launcher_->onCheck = [&] { workspace_->installed = {}; };
    EXPECT_EQ(TransactionTest::ask({{"request", "ready"}, {"uuids", Array{last->plugInUuid}}}),
              error(4, "no such plugin (uuid not found)"));
    EXPECT_THAT(launcher_->granted, IsEmpty());
}

TEST_F(ReadyAccessTest, ListsHaveAnEnd) {
    const Array uuids(std::vector<Value>(platform::lum::kMaxListed + 1, platform::Uuid::random()));
    for (const char* request : {"ready", "access", "annotate"})
        EXPECT_EQ(TransactionTest::ask({{"request", request},
                                        {"uuids", uuids},
                                        {"annotations", Dictionary{{"election", 1}}}}),
                  error(4, "invalid request (bad uuid array)"));
    Dictionary annotations;
    for (std::size_t i = 0; i < uuids.size(); ++i)
        annotations.set(platform::Uuid::random().string(), Dictionary());
    EXPECT_EQ(TransactionTest::ask({{"request", "bulk-annotate"}, {"annotations", annotations}}),
              error(4, "invalid request format (bad annotations dictionary)"));
    const Array paths(std::vector<Value>(uuids.size(), "/"));
    for (const char* request : {"add", "lock"})
        EXPECT_EQ(TransactionTest::ask({{"request", request}, {"paths", paths}}),
                  error(4, "invalid request format"));
}

TEST_F(ReadyAccessTest, AccessGivesOneTokenForEach) {
    const Dictionary reply = ask("access", {0, 0, 1});
    const auto& tokens = *reply.find("extensions")->array();
    ASSERT_EQ(tokens.size(), 3u);
    EXPECT_NE(tokens[0], tokens[1]);
    EXPECT_THAT(*tokens[2].string(), HasSubstr(executable(1)));
    EXPECT_EQ(*ask("access", {}).find("extensions"), Value(Array()));
    sandbox_->unreadable = {executable(1)};
    EXPECT_EQ(ask("access", {0, 1}),
              error(4, "cannot create extension to " + executable(1) + ": 13"));
    const Dictionary unknown = error(4, "no such plugin (uuid not found)");
    for (const char* request : {"ready", "access"})
        EXPECT_EQ(TransactionTest::ask(
                      {{"request", request}, {"uuids", Array{platform::Uuid::random()}}}),
                  unknown);
}

TEST_F(ReadyAccessTest, OthersHaveTheirTurnsBetweenTheTokensOfALongRequest) {
    Array uuids;
    for (int i = 0; i < 1000; ++i) uuids.append(workspace_->installed[i % 2]->plugInUuid);
    for (const char* name : {"a", "b", "c", "d", "e", "f", "g", "h", "i", "j"}) {
        const Dictionary shared{{"Shared", "x"}, {"VXExtensionProtocol", "P"}};
        const auto plugIn = makeProxy(name, {}, shared);
        plugIn->bundlePath = std::string("/Apps/Host.app/PlugIns/") + name;
        workspace_->installed.push_back(plugIn);
    }
    for (const char* request : {"access", "match"}) {
        std::promise<void> begin;
        server_->submitWork([&] { begin.get_future().wait(); });
        deliver(platform::Message({{"request", request}, {"version", 3}, {"uuids", uuids}}));
        bool wasFirst = true;
        server_->submitWork([&] { wasFirst = connection_->isAnswered; });
        begin.set_value();
        const Dictionary reply = answer(*connection_);
        EXPECT_FALSE(wasFirst);
        const Value* matches = reply.find("matches");
        if (!matches) continue;
        for (const Value& form : *matches->packed()->value()->array())
            EXPECT_EQ(form.dictionary()->find("extensions")->dictionary()->size(), 1u);
    }
}

TEST_F(ReadyAccessTest, MatchGivesTokensWithEachForm) {
    sandbox_->distant = {executable(0), executable(2)};
    EXPECT_EQ(ask("access", {0, 1, 2}).find("extensions")->array()->size(), 3u);
    const Dictionary chosen{{"election", 1}};
    const Array first{workspace_->installed[0]->plugInUuid};
    TransactionTest::ask({{"request", "annotate"}, {"annotations", chosen}, {"uuids", first}});
    const Value matches = *TransactionTest::ask({{"request", "match"}}).find("matches");
    const Array& forms = *matches.packed()->value()->array();
    EXPECT_EQ(*forms[0].dictionary()->find("annotations"), Value(chosen));
    for (const Value& form : forms) {
        const Dictionary& extensions = *form.dictionary()->find("extensions")->dictionary();
        EXPECT_EQ(extensions.size(), 1u);
        EXPECT_TRUE(extensions.contains("."));
    }

    // Of those on one slow file system not always the same comes last.
    workspace_->installed.clear();
    for (const char* name : {"com.e", "com.f"}) {
        auto proxy = makeProxy(name);
        sandbox_->distant.insert(*(proxy->bundlePath = std::string("/proc/") + name + ".appex"));
        workspace_->installed.push_back(proxy);
    }
    std::set<std::string> last;
    for (int i = 0; i < 100 && last.size() < 2; ++i) {
        match({});
        last.insert(sandbox_->latest);
    }
    EXPECT_EQ(last.size(), 2u);
}

std::optional<ZRError> enable(const ZRDPlugIn& plugIn, const FakeHost& host) {
    return plugIn.enableForClient(host,
                                  plugIn.prepareForClient(host, plugIn.overlayForClient(host)));
}

/// The overlay with which a record is enabled for a host.
Dictionary overlayOf(const FakeWorld& world, const platform::TDPlugInProxyRef& proxy) {
    EXPECT_EQ(enable(*world.record(proxy), FakeHost()), std::nullopt);
    return world.launcher->granted.back().second;
}

TEST(Enabling, TheOverlayFixesEnvironmentAndSandbox) {
    FakeWorld world;
    auto proxy = makeProxy("com.a");
    Dictionary info = proxy->infoPlist.get();
    info.set("LUMService",
             Dictionary{{"EnvironmentVariables", Dictionary{{"HOME", "/mine"}, {"OWN", "1"}}},
                        {"_SandboxProfile", "none"},
                        {"Kept", 7}});
    proxy->infoPlist = info;
    ::setenv("ZRTEST_SDK", "sdk", 1);
    std::optional<LogLines> log(std::in_place);
    EXPECT_EQ(overlayOf(world, proxy),
              (Dictionary{
                  {"QFBundlePackageType", "LUM!"},
                  {"LUMService", Dictionary{{"EnvironmentVariables",
                                             Dictionary{{"HOME", "/mine"},
                                                        {"OWN", "1"},
                                                        {"QFFIXED_USER_HOME", "/Containers/com.a"},
                                                        {"TMPDIR", "/Containers/com.a/tmp"},
                                                        {"ZRTEST_SDK", "sdk"}}},
                                            {"Kept", 7},
                                            {"_OmitSandboxParameters", true},
                                            {"_SandboxProfile", "plugin"}}}}));
    ::unsetenv("ZRTEST_SDK");
    const std::string uuid = proxy->plugInUuid.string();
    EXPECT_THAT(log->take(),
                ElementsAre(HasSubstr("td D: raw LUMService={"),
                            "ops I: assigning plug-in com.a(1) " + uuid + " to plugin sandbox",
                            "ops -: allowing host 7 /Apps/Host.app/Host to use plug-in com.a(1) "
                            "uuid=" +
                                uuid + " at " + *proxy->bundlePath,
                            HasSubstr("ops D: activation overlay={")));

    auto bare = makeProxy("com.data", {}, {{"VXExtensionProtocol", "#Data"}});
    bare->dataContainerPath.reset();
    log.emplace(LogLines::Private::Hidden);
    EXPECT_EQ(*overlayOf(world, bare).find("LUMService"),
              Value(Dictionary{{"EnvironmentVariables", Dictionary()},
                               {"_OmitSandboxParameters", true},
                               {"_SandboxProfile", "plugin"}}));
    EXPECT_THAT(log->take(),
                testing::IsSupersetOf(
                    {std::string("ops I: no LUMService for plug-in; database returned <private>"),
                     "ops D: no data container for plug-in <private>(<private>) " +
                         bare->plugInUuid.string() + " at <private>"}));

    FakeHost gone;
    gone.token.reset();
    EXPECT_EQ(enable(*world.record(proxy), gone)->code, 4);
}

TEST(Enabling, TheProfileFollowsTheExtensionPointAndTheUsersConsent) {
    FakeWorld world;
    const auto profile = [&](const char* point, Dictionary attributes) {
        const Dictionary overlay = overlayOf(
            world, makeProxy("com.p", attributes, {{"VXExtensionPointIdentifier", point}}));
        return *overlay.find("LUMService")->dictionary()->find("_SandboxProfile")->string();
    };
    const char* keyboard = "com.orbel.keyboard-service";
    const Dictionary open{{"RequestsOpenAccess", true}};
    EXPECT_EQ(profile("com.other", {}), "plugin");
    EXPECT_EQ(profile("com.orbel.netvane.filter-data", {}), "network-filter");
    EXPECT_EQ(profile("com.orbel.glimse.extension.preview", {}), "glimsed");
    EXPECT_EQ(profile(keyboard, open), "keyboard") << "without the user's consent";
    world.consent->records = {
        {Dictionary{{"granted", true}, {"service", platform::kKeyboardNetworkConsent}}}};
    EXPECT_EQ(profile(keyboard, open), "plugin");
    EXPECT_EQ(profile(keyboard, {{"RequestsOpenAccess", "true"}}), "keyboard");
    EXPECT_EQ(profile(keyboard, {}), "keyboard");
}

TEST(Enabling, OnlyWhatHasATokenIsShared) {
    using Augmented = ZRDPlugIn::Augmented;
    const auto augment = [](const ZRDPlugIn& plugIn, Dictionary& form) {
        return plugIn.augmentForm(form, platform::Wait::Allowed);
    };
    FakeWorld world;
    auto proxy = makeProxy(
        "com.a", {},
        {{"Shared", Array{"in", 7, "../out", "none", "in"}}, {"VXExtensionProtocol", "P"}});
    proxy->bundlePath = "/Apps/Host.app/PlugIns/a.plugin";
    const std::string path = *proxy->bundlePath;
    world.sandbox->unreadable = {path + "/none", path + "/../out"};
    LogLines log(LogLines::Private::Hidden);
    Dictionary form;
    EXPECT_EQ(augment(*world.record(proxy), form), Augmented::ForNow);
    const Dictionary& extensions = *form.find("extensions")->dictionary();
    EXPECT_EQ(extensions.size(), 1u);
    EXPECT_TRUE(extensions.contains("in"));
    EXPECT_EQ(world.sandbox->issued, 1) << "a name counts once";
    Array names;
    for (int i = 0; i < 100; ++i) names.append(std::to_string(i));
    EXPECT_EQ(world.record(proxy)->issueResourceExtensions(names, platform::Wait::Never)->size(),
              64u);
    const char* failed =
        "ops I: failed to make extension for <private> in plug-in at <private>: Permission denied";
    EXPECT_THAT(
        log.take(),
        ElementsAre(failed, failed, "ops I: plug-in at <private> shares more than 64 resources"));
    auto single = makeProxy("com.a", {}, {{"Shared", "in"}, {"VXExtensionProtocol", "P"}});
    single->bundlePath = proxy->bundlePath;
    EXPECT_EQ(augment(*world.record(single), form), Augmented::ForNow)
        << "another file may take its place";
    EXPECT_TRUE(form.find("extensions")->dictionary()->contains("in"));
    auto unshared = makeProxy("com.b", {}, {{"VXExtensionProtocol", "P"}});
    unshared->bundlePath = "/Apps/Host.app/PlugIns/b.plugin";
    Dictionary untouched;
    EXPECT_EQ(augment(*world.record(unshared), untouched), Augmented::ForGood);
    EXPECT_EQ(untouched, Dictionary());
}

TEST(Enabling, AFormsTokenIsUsedAgainOnlyWhileTheBundleIsInItsPlace) {
    ::test::TemporaryDirectory directory;
    FakeWorld world;
    const auto proxy = makeProxy("com.a");
    const std::string path = directory.makeDirectory("PlugIns/a.appex");
    proxy->bundlePath = path;
    proxy->bundleIdentity = ::test::known(path).identity;
    const auto record = world.record(proxy);
    platform::UntouchedBundles untouched;
    const auto token = [&] {
        std::optional<ZRError> error;
        auto draft = record->draftForm(untouched, error);
        const auto form = record->completedForm(*draft, platform::Wait::Never);
        const Value* found = form->find("extensions")->dictionary()->find(".");
        return found ? found->string()->string() : std::string("none");
    };
    const std::string first = token();
    EXPECT_EQ(token(), first);
    std::filesystem::rename(path, directory.path("moved"));
    std::filesystem::create_directory_symlink(directory.path("moved"), path);
    world.sandbox->unreadable = {path};
    EXPECT_EQ(token(), "none");
    using Untouched = platform::UntouchedBundles;
    untouched = Untouched(std::make_shared<const Untouched::Paths>());
    EXPECT_EQ(token(), first) << "nobody looks at what is known";
    untouched = Untouched(std::make_shared<const Untouched::Paths>(Untouched::Paths{path}));
    EXPECT_EQ(token(), "none") << "but at what is not";
    std::filesystem::remove(path);
    directory.makeDirectory("PlugIns/a.appex");
    EXPECT_EQ(token(), "none");
    std::filesystem::remove(path);
    std::filesystem::rename(directory.path("moved"), path);
    EXPECT_EQ(token(), first);
}

TEST(Enabling, TheLauncherIsToldOfTheVeryBundle) {
    FakeWorld world;
    const auto proxy = makeProxy("com.a");
    proxy->bundleIdentity = {7, 11};
    EXPECT_EQ(enable(*world.record(proxy), FakeHost()), std::nullopt);
    const platform::ExternalService& service = world.launcher->services.at(0);
    EXPECT_EQ(service.bundle.path, *proxy->bundlePath);
    EXPECT_EQ(service.bundle.identity, proxy->bundleIdentity);
    EXPECT_EQ(service.container, *proxy->dataContainerPath);
    // Which somebody may have removed.
    EXPECT_EQ(world.workspace->restored, std::vector{*proxy->dataContainerPath});
    world.workspace->lostContainers = true;
    EXPECT_TRUE(enable(*world.record(proxy), FakeHost()));
    EXPECT_EQ(world.launcher->services.size(), 1u);
}

TEST(Signature, StandsForNoRealOne) {
    const ZRDPlugInSignature one("/a"), other("/a");
    EXPECT_EQ(one.cdhash().bytes().size(), 20u);
    EXPECT_NE(one.cdhash(), other.cdhash());
    EXPECT_EQ(one.requirement(), "dummy requirement");
}

}  // namespace

}  // namespace zorvan
