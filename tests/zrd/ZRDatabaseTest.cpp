#include "zrd/ZRDatabase.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Zorvan/Keys.h"
#include "tests/Zorvan/LogLines.h"
#include "tests/support/TemporaryDirectory.h"
#include "tests/zrd/Fakes.h"

namespace zorvan {

namespace {

using platform::TDPlugInProxyRef;
using testing::AllOf;
using testing::Contains;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::Not;
using testing::UnorderedElementsAre;

struct TestDatabase final : ZRDatabase {
    static std::shared_ptr<TestDatabase> make(platform::Services services,
                                              const std::string& path) {
        std::shared_ptr<TestDatabase> database(new TestDatabase(std::move(services)));
        return database->initWithDatabase(path, database) ? database : nullptr;
    }

  private:
    using ZRDatabase::ZRDatabase;
};

class ZRDatabaseTest : public testing::Test {
  protected:
    void SetUp() override {
        platform::Services services;
        services.workspace = workspace_;
        services.notifications = notifications_;
        services.sandbox = std::make_shared<FakeSandbox>();
        database_ = TestDatabase::make(services, directory_.path("Annotations"));
        database_->setCacheLimit(100);
    }

    std::shared_ptr<platform::TDPlugInProxy> install(const std::string& identifier,
                                                     Dictionary entitlements = {}) {
        auto proxy = makeProxy(identifier);
        proxy->entitlements = std::move(entitlements);
        workspace_->installed.push_back(proxy);
        return proxy;
    }
    void elect(const TDPlugInProxyRef& proxy, Value election) {
        database_->setAnnotation(Dictionary{{"election", std::move(election)}},
                                 *database_->plugInForProxy(proxy));
    }
    std::vector<std::string> find(const Dictionary& query) {
        std::vector<std::string> identifiers;
        const auto found = database_->findPlugIns(&query);
        for (const auto& plugIn : found.value()) identifiers.push_back(plugIn->identifier());
        return identifiers;
    }

    ::test::TemporaryDirectory directory_;
    std::shared_ptr<FakeWorkspace> workspace_ = std::make_shared<FakeWorkspace>();
    std::shared_ptr<FakeNotifications> notifications_ = std::make_shared<FakeNotifications>();
    std::shared_ptr<TestDatabase> database_;
};

TEST_F(ZRDatabaseTest, WithoutARegistryThereIsNone) {
    EXPECT_FALSE(TestDatabase::make({}, directory_.path("Other")));
}

TEST_F(ZRDatabaseTest, OverItsLimitTheWholeCacheGoes) {
    database_->setCacheLimit(2);
    std::vector<ZRDPlugInRef> records;
    LogLines log;
    for (const char* name : {"a", "b", "c"})
        records.push_back(database_->plugInForProxy(install(name)));
    EXPECT_THAT(log.take(), IsEmpty());
    EXPECT_EQ(database_->findPlugIn(records[0]->uuid()), records[0]);
    EXPECT_EQ(database_->plugInForProxy(records[0]->tdproxy()), records[0]);

    auto last = database_->plugInForProxy(install("d"));
    EXPECT_THAT(log.take(), ElementsAre("ops I: purging cache for 3 > 2"));
    EXPECT_EQ(workspace_->schemaClears, 1);
    EXPECT_EQ(database_->findPlugIn(last->uuid()), last);
    EXPECT_NE(database_->findPlugIn(records[0]->uuid()), records[0]);
}

TEST_F(ZRDatabaseTest, UninstalledPlugInsLeaveTheCache) {
    auto proxy = install("com.a");
    auto record = database_->plugInForProxy(proxy);
    workspace_->installed.clear();
    EXPECT_EQ(database_->findPlugIn(record->uuid()), record);
    LogLines log;
    workspace_->observer->pluginsWillUninstall({proxy, makeProxy("never-cached")});
    EXPECT_FALSE(database_->findPlugIn(record->uuid()));
    EXPECT_THAT(log.take(), ElementsAre(HasSubstr("ops -: plug-in UNINSTALLED: com.a() "),
                                        HasSubstr("ops -: plug-in UNINSTALLED: never-cached() "),
                                        "ops I: Tandry cannot find plug-in with UUID:" +
                                            record->uuid().string()));

    // A record built from what the registry has dropped meanwhile would never leave it again.
    EXPECT_TRUE(database_->plugInForProxy(proxy));
    EXPECT_FALSE(database_->findPlugIn(record->uuid()));
}

TEST_F(ZRDatabaseTest, LooksUpByPathAndByApplication) {
    auto good = install("good"), bad = install("bad");
    bad->dataContainerPath.reset();
    EXPECT_EQ(database_->findPlugInAtPath(*good->bundlePath)->uuid(), good->plugInUuid);
    EXPECT_EQ(database_->plugInsWithinApplication("/Apps/Host.app")->size(), 1u);
    LogLines log;
    EXPECT_FALSE(database_->plugInsWithinApplication("/Apps/None.app"));
    EXPECT_FALSE(database_->findPlugInAtPath("/none"));
    EXPECT_THAT(log.take(), ElementsAre("ops I: Tandry cannot find plug-in at path:/none"));
    EXPECT_FALSE(database_->findPlugIn(bad->plugInUuid));
    EXPECT_THAT(log.take(), ElementsAre(HasSubstr("ignoring mis-configured plug-in")));
}

TEST_F(ZRDatabaseTest, RegistrationFailuresAreErrors) {
    workspace_->refused = {"/x"};
    constexpr auto kHost = platform::Requester::Unconfined;
    EXPECT_FALSE(database_->addPlugIn("/y", kHost) || database_->removePlugIn("/y", kHost));
    EXPECT_EQ(database_->addPlugIn("/x", kHost),
              ZRErrorWithCode(2, "Tandry failed to register the plug-in"));
    EXPECT_EQ(database_->removePlugIn("/x", kHost),
              ZRErrorWithCode(2, "Tandry failed to deregister the plug-in"));
    database_->notifyAnnotationChange();
    EXPECT_THAT(notifications_->posted, ElementsAre("com.orbel.zorvan.annotation-change"));
}

TEST_F(ZRDatabaseTest, SkipsRecordsThatCannotBeUsed) {
    auto good = install("good");
    workspace_->installed.push_back(good);  // twice
    install("lost")->bundlePath.reset();
    install("half")->containingApplication = makeApplication("/Apps/Half.app", true);
    install("bad")->dataContainerPath.reset();
    EXPECT_THAT(find({}), ElementsAre("good"));
    EXPECT_EQ(workspace_->queries, 0);
    workspace_->queryFails = true;
    const Dictionary query{{"K", "v"}};
    EXPECT_FALSE(database_->findPlugIns(&query));
    EXPECT_EQ(database_->findPlugIns(nullptr)->size(), 1u);
}

TEST_F(ZRDatabaseTest, TheElectionNarrowsByUsablePatterns) {
    const char* autoElect = entitlement::kAutoElectPlugIn;
    elect(install("one"), 257);
    elect(install("zero"), (std::uint64_t{1} << 63) + 256);
    elect(install("minus"), -1);
    install("never");
    install("sharing", {{entitlement::kReplacePlugIn, "one"}});
    install("text", {{autoElect, "yes"}});
    install("auto", {{autoElect, 2}});
    // Elections that nobody has looked up yet: "text" and "auto" have no annotation.
    EXPECT_THAT(find({{"VXUserElection", "1"}}), UnorderedElementsAre("one", "sharing", "auto"));
    EXPECT_THAT(find({{"VXUserElection", "=0"}}), UnorderedElementsAre("zero", "never", "text"));
    EXPECT_THAT(find({{"VXUserElection", Array{"1", "255"}}}),
                UnorderedElementsAre("one", "sharing", "auto", "minus", "text"));
    EXPECT_THAT(find({{"VXUserElection", "="}}), IsEmpty());
    EXPECT_THAT(find({{"VXUserElection", "ö"}}), IsEmpty());
    EXPECT_THAT(find({{"VXUserElection", Array{}}}), IsEmpty());
    for (Value unusable : {Value(""), Value("*"), Value("-1"), Value(1), Value(true),
                           Value(Array{"1", "-1"}), Value(Array{"1", 0}), Value("\u00d7")}) {
        EXPECT_EQ(find({{"VXUserElection", unusable}}).size(), 7u) << describe(unusable);
    }
    LogLines log;
    find({{"VXUserElection", "1"}});
    EXPECT_THAT(log.take(), AllOf(Contains("ops D: td filter one -> 1").Times(2),
                                  Contains("ops D: td filter never -> 0")));
    find({{"Other", "1"}});
    EXPECT_THAT(log.take(), Not(Contains(HasSubstr("td filter"))));
}

TEST_F(ZRDatabaseTest, PlugInsMayElectThemselvesWhenTheUserHasNotChosen) {
    auto stored = [&](const TDPlugInProxyRef& proxy) {
        return database_->annotationForPlugIn(*database_->plugInForProxy(proxy));
    };
    const Dictionary entitled{{entitlement::kAutoElectPlugIn, true}};
    EXPECT_EQ(stored(install("fresh", entitled)), (Dictionary{{"election", 1}}));
    EXPECT_FALSE(stored(install("off", {{entitlement::kAutoElectPlugIn, 0}})));

    auto proxy = install("chosen", entitled);
    const Dictionary extension{{"k", "v"}};
    for (int election : {-1, 2, 0}) {
        database_->setAnnotation(Dictionary{{"election", election}, {"extension", extension}},
                                 *database_->plugInForProxy(proxy));
        workspace_->observer->pluginsWillUninstall({proxy});  // so that the record is built again
        EXPECT_EQ(stored(proxy), (Dictionary{{"election", election == 0 ? 1 : election},
                                             {"extension", extension}}));
    }
    EXPECT_THAT(notifications_->posted, IsEmpty());
}

}  // namespace

}  // namespace zorvan
