#include <algorithm>
#include <chrono>
#include <filesystem>

#include "Zorvan/Keys.h"
#include "platform/lum/Limits.h"
#include "tests/zrd/TransactionTest.h"

namespace zorvan {

namespace {

using platform::ConnectionError;
using platform::Uuid;
using testing::ElementsAre;
using testing::IsEmpty;

/// Two plug-ins of one application, where "lock" and the registry's paths agree.
class HoldsTest : public TransactionTest {
  protected:
    void SetUp() override {
        TransactionTest::SetUp();
        for (auto [name, kind] : {std::pair("com.a", "VXObject"), {"com.b", "#Data"}}) {
            auto proxy = makeProxy(name, {}, {{"VXExtensionProtocol", kind}});
            proxy->bundlePath = directory_.makeDirectory(std::string(name) + ".appex");
            proxy->containingApplication = makeApplication(directory_.path());
            Dictionary info = proxy->infoPlist.get();
            info.set("QFBundleIdentifier", std::string("bundle.") + name);
            proxy->infoPlist = info;
            workspace_->installed.push_back(proxy);
        }
        a_ = *workspace_->installed[0]->bundlePath;
        b_ = *workspace_->installed[1]->bundlePath;
    }
    Dictionary lock(std::uint64_t flags, Array paths) {
        return ask({{"request", "lock"}, {"flags", flags}, {"paths", paths}});
    }
    static Uuid tokenOf(const Dictionary& reply) {
        const Value* token = reply.find("uuids");
        return token ? token->uuid().value() : Uuid();
    }
    Dictionary release(Array tokens) { return ask({{"request", "lock"}, {"uuids", tokens}}); }
    std::size_t posts() { return std::exchange(notifications_->posted, {}).size(); }

    std::string a_, b_;
};

TEST_F(HoldsTest, WhatIsHeldIsNeitherFoundNorMadeReady) {
    const Uuid token = tokenOf(lock(ZRHoldApplications, {directory_.path()}));
    EXPECT_EQ(posts(), 1u);
    EXPECT_EQ(launcher_->markers, 1);
    EXPECT_THAT(launcher_->takenBack, ElementsAre(a_, b_));
    EXPECT_THAT(match({}), IsEmpty());
    codeSigning_->entitlements = {{entitlement::kManager, true}};
    EXPECT_THAT(match({{"flags", ZRDiscoverAll}}), ElementsAre("com.a", "com.b"));
    for (const auto& held : workspace_->installed)
        EXPECT_EQ(ask({{"request", "ready"}, {"uuids", Array{held->plugInUuid}}}),
                  error(11, "access to plugin " + *held->plugInIdentifier +
                                " denied: the plug-in is on hold"));
    EXPECT_THAT(launcher_->granted, IsEmpty());

    const Uuid second = tokenOf(lock(ZRHoldPlugIns, {a_}));
    EXPECT_EQ(posts(), 1u);
    EXPECT_EQ(release({7, Uuid::random(), token}), Dictionary());
    EXPECT_EQ(posts(), 1u);
    EXPECT_THAT(match({}), ElementsAre("com.b")) << "another hold has it still";
    EXPECT_EQ(release({second, second}), Dictionary());
    EXPECT_THAT(match({}), ElementsAre("com.a", "com.b"));
    EXPECT_EQ(launcher_->markers, 0);
}

TEST_F(HoldsTest, BusyPlugInsKeepTheirApplicationInService) {
    assertions_->reports = {{"bundle.com.b", Dictionary()},
                            {"bundle.com.b", {{platform::kAssertionBundleIdentifier, "bundle.x"}}},
                            {"bundle.com.b", {{platform::kAssertionBundleIdentifier, "bundle.y"}}}};
    Dictionary refusal = error(14, "plug-ins are busy");
    refusal.set("conflicts", Array{Dictionary{{"bundle-identifier", "bundle.x"}}});
    EXPECT_EQ(lock(ZRHoldApplications, {directory_.path(), directory_.path()}), refusal);
    EXPECT_THAT(server_->holds(), IsEmpty());
    EXPECT_EQ(posts(), 0u);
    assertions_->place = "/elsewhere";
    const Uuid token = tokenOf(lock(ZRHoldApplications, {directory_.path()}));
    EXPECT_EQ(server_->holds().size(), 1u) << "only the name is the same";
    release({token});
    assertions_->place.clear();
    EXPECT_TRUE(lock(ZRHoldPlugIns, {b_}).contains("uuids")) << "not asked for a plug-in's path";
    assertions_->reports = {{"bundle.com.a", Dictionary()}};
    EXPECT_TRUE(lock(ZRHoldApplications, {directory_.path()}).contains("uuids"))
        << "who does not say what it is does not count";
}

TEST_F(HoldsTest, WhatComesToAHeldPlaceIsHeld) {
    const auto comes = [&](std::size_t index, const char* path) {
        auto proxy = makeProxy("com.new");
        proxy->bundlePath = directory_.path(path);
        proxy->containingApplication =
            makeApplication(std::filesystem::path(*proxy->bundlePath).parent_path());
        workspace_->installed.resize(index);
        workspace_->installed.push_back(proxy);
        return ask({{"request", "ready"}, {"uuids", Array{proxy->plugInUuid}}});
    };
    const Dictionary held = error(11, "access to plugin com.new denied: the plug-in is on hold");
    const Uuid plugIn = tokenOf(lock(ZRHoldPlugIns, {b_}));
    EXPECT_EQ(comes(1, "com.b.appex"), held);
    EXPECT_THAT(match({}), ElementsAre("com.a"));
    EXPECT_NE(comes(1, "com.c.appex"), held);
    release({plugIn});
    EXPECT_NE(comes(1, "com.b.appex"), held);

    directory_.makeDirectory("Empty.app");
    const Uuid application = tokenOf(lock(ZRHoldApplications, {directory_.path("Empty.app")}));
    EXPECT_EQ(comes(1, "Empty.app/com.b.appex"), held);
    EXPECT_NE(comes(1, "com.b.appex"), held);
    EXPECT_EQ(comes(1, "Empty.app/com.c.appex"), held);
    release({application});
    EXPECT_NE(comes(1, "Empty.app/com.b.appex"), held);

    EXPECT_TRUE(lock(ZRHoldApplications, {directory_.path("Empty.app")}).contains("uuids"));
    Array places;
    for (std::size_t i = 0; i < server_->holdPool().mostOfOne(); ++i)
        places.append(directory_.makeDirectory("places/" + std::to_string(i)));
    EXPECT_EQ(lock(ZRHoldApplications, places), error(11, "too many holds"));
}

TEST_F(HoldsTest, BadHoldsAreRefusedAtTheFirstPath) {
    const std::string gone = directory_.path("gone"), other = directory_.makeDirectory("other");
    const Dictionary flags = error(4, "invalid request format (unsupported hold flags)");
    EXPECT_EQ(lock(ZRHoldPlugIns, {a_, gone}), error(9, "invalid path: " + gone));
    EXPECT_EQ(lock(ZRHoldPlugIns, {a_, other}), error(9, "no plug-in at path:" + other));
    EXPECT_EQ(lock(ZRHoldPlugIns, {"a"}), error(9, "absolute path required: a"));
    for (std::uint64_t bad : {0, 3, 4}) EXPECT_EQ(lock(bad, {a_}), flags);
    EXPECT_EQ(lock(3, {gone}), error(9, "invalid path: " + gone));
    EXPECT_EQ(ask({{"request", "lock"}, {"flags", 1}, {"uuids", "x"}}),
              error(4, "invalid request format"));
    EXPECT_THAT(server_->holds(), IsEmpty());
    EXPECT_TRUE(lock(3, {}).contains("uuids")) << "nobody looks at the flags";
    EXPECT_TRUE(lock(ZRHoldApplications, {other}).contains("uuids"));
}

TEST_F(HoldsTest, ADyingClientGivesItsHoldsBackAndHadAQuarterOfAll) {
    auto other = std::make_shared<FakeConnection>();
    connect(other);
    other->deliver(platform::Message(
        {{"request", "lock"}, {"version", 3}, {"flags", ZRHoldPlugIns}, {"paths", Array{b_}}}));
    answer(*other);
    constexpr std::size_t kHolds = 4095;
    for (std::size_t i = 0; i < kHolds; ++i)
        EXPECT_TRUE(lock(ZRHoldPlugIns, {a_}).contains("uuids"));
    EXPECT_EQ(lock(ZRHoldPlugIns, {a_}), error(11, "too many holds"));
    // The others must not have to wait, neither for these nor for the end of those.
    Array unknown;
    for (std::size_t i = 0; i < 200'000; ++i) unknown.append(Uuid::random());
    const auto begin = std::chrono::steady_clock::now();
    release(std::move(unknown));
    EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::seconds(1));
    posts();
    deliver(ConnectionError{ConnectionError::Kind::Invalid, "gone"});
    EXPECT_EQ(posts(), kHolds);
    EXPECT_EQ(server_->holds().size(), 1u);
    EXPECT_EQ(launcher_->markers, 1);
    other->deliver(ConnectionError{ConnectionError::Kind::Invalid, "gone"});
    EXPECT_THAT(server_->holds(), IsEmpty());
}

TEST_F(HoldsTest, AHoldThatIsTakenWhileItsClientDiesGoesWithIt) {
    const auto die = [&] { deliver(ConnectionError{ConnectionError::Kind::Invalid, "gone"}); };
    // Its holds have been looked for before the new one is there: its taker sees that it is dead.
    launcher_->atNewWork = die;
    const auto dying = client().shared_from_this();
    lock(ZRHoldPlugIns, {a_});
    EXPECT_FALSE(dying->acceptWork());
    EXPECT_THAT(server_->holds(), IsEmpty());

    // The whole request is served between the first look for its holds and its death.
    connection_ = std::make_shared<FakeConnection>();
    connect(connection_);
    deliver(platform::Message(
        {{"request", "lock"}, {"version", 3}, {"flags", ZRHoldPlugIns}, {"paths", Array{a_}}}));
    LogLines log;  // so that the line of its death asks for its process
    Dictionary reply;
    connection_->whenAsked = [&] { reply = answer(*connection_); };
    die();
    EXPECT_TRUE(reply.contains("uuids"));
    EXPECT_THAT(server_->holds(), IsEmpty());
}

}  // namespace

}  // namespace zorvan
