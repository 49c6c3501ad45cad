#include "zrd/ZRDPlugIn.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Zorvan/Keys.h"
#include "tests/Zorvan/LogLines.h"
#include "tests/zrd/Fakes.h"
#include "zrd/RuleSet.h"

namespace zorvan {

namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

class ZRDPlugInTest : public testing::Test {
  protected:
    FakeWorld world_;
    FakeHost host_;
};

TEST_F(ZRDPlugInTest, TakesItsFactsFromTheRegistry) {
    auto proxy = makeProxy("com.a", {{"Color", "red"}}, {{"Key", 3}});
    proxy->registrationDate = {-1.9};
    proxy->originalIdentifier = "com.original";
    proxy->onSystemPartition = true;
    proxy->entitlements = Dictionary{{"zero", 0}, {"no", "NO"}, {"off", false}};
    auto plugIn = world_.record(proxy);
    ASSERT_TRUE(plugIn);
    EXPECT_EQ(plugIn->uuid(), proxy->plugInUuid);
    EXPECT_EQ(plugIn->containingPath(), "/Apps/Host.app");
    EXPECT_EQ(plugIn->localizedContainingName(), "Host");
    EXPECT_EQ(plugIn->originalIdentifier(), "com.original");
    EXPECT_EQ(plugIn->lastModified(), -1);
    proxy->registrationDate = {2147483648.0};
    EXPECT_EQ(world_.record(proxy)->lastModified(), INT32_MAX);
    proxy->registrationDate = {-2147483649.0};
    EXPECT_EQ(world_.record(proxy)->lastModified(), INT32_MIN);
    EXPECT_TRUE(plugIn->onSystemVolume());
    EXPECT_EQ(*plugIn->attribute("Color"), Value("red"));
    EXPECT_EQ(*plugIn->pluginKey("Key"), Value(3));
    EXPECT_EQ(*plugIn->infoKey("Top"), Value("top"));
    EXPECT_FALSE(plugIn->infoKey("Key"));
    EXPECT_TRUE(plugIn->hasEntitlement("no"));
    EXPECT_FALSE(plugIn->hasEntitlement("zero") || plugIn->hasEntitlement("off"));

    EXPECT_FALSE(plugIn->localizedName());
    plugIn->setLocalizedName("Mine");
    EXPECT_EQ(plugIn->localizedName(), "Mine");
    plugIn->setLocalizedContainingName(std::nullopt);
    EXPECT_EQ(plugIn->localizedContainingName(), "Host");
}

TEST_F(ZRDPlugInTest, AFormHasTheNamesAsTheyAreNow) {
    const auto plugIn = world_.record(makeProxy("com.a"));
    using platform::UntouchedBundles;
    const UntouchedBundles all(std::make_shared<UntouchedBundles::Paths>());
    const auto name = [&](const char* key) {
        std::optional<ZRError> error;
        auto draft = plugIn->draftForm(all, error);
        const auto form = plugIn->completedForm(*draft, platform::Wait::Allowed);
        const Value* found = form->find(key);
        return found ? describe(*found) : "none";
    };
    // One name changes while a form is made.
    bool isFirst = true;
    world_.sandbox->onIssue = [&] {
        if (std::exchange(isFirst, false)) plugIn->setLocalizedName("Name");
    };
    EXPECT_EQ(name("localizedDisplayName"), "none");
    EXPECT_EQ(name("localizedDisplayName"), "Name");
    plugIn->setLocalizedShortName("N");
    EXPECT_EQ(name("localizedShortName"), "N");
    plugIn->setLocalizedContainingName("App");
    EXPECT_EQ(name("localizedContainingDisplayName"), "App");
}

TEST_F(ZRDPlugInTest, HubProtocolVersionIsDeclaredOrTellsTheOldStyle) {
    auto version = [&](Dictionary plugIn, bool oldStyle) {
        auto proxy = makeProxy("com.a", {}, std::move(plugIn));
        Dictionary info = proxy->infoPlist.get();
        if (oldStyle) info.set("Zorvan", Dictionary());
        proxy->infoPlist = info;
        return world_.record(proxy)->hubProtocolVersion();
    };
    EXPECT_EQ(version({{"HubProtocolVersion", 3}}, true), 3u);
    EXPECT_EQ(version({}, true), 1u);
    EXPECT_EQ(version({}, false), 2u);
    EXPECT_EQ(version({{"HubProtocolVersion", "3"}}, false), 2u);
    EXPECT_EQ(version({{"HubProtocolVersion", std::uint64_t{1} << 32}}, false), UINT32_MAX);
    EXPECT_EQ(version({{"HubProtocolVersion", -1}}, false), 0u);
}

TEST_F(ZRDPlugInTest, RefusesWhatIsMisconfiguredAndSaysWhy) {
    auto refusal = [&](auto&& damage) -> std::string {
        auto proxy = makeProxy("com.a");
        damage(*proxy);
        LogLines log;
        bool made = world_.record(proxy) != nullptr;
        auto lines = log.take();
        return made ? "made" : lines.empty() ? "silent" : lines.size() > 1 ? "twice" : lines[0];
    };
    using Proxy = platform::TDPlugInProxy;
    EXPECT_EQ(refusal([](Proxy& proxy) { proxy.bundlePath.reset(); }), "silent");
    EXPECT_THAT(refusal([](Proxy& proxy) { proxy.plugInIdentifier.reset(); }),
                HasSubstr("missing identifier in plug-in at /Apps/"));
    EXPECT_EQ(refusal([](Proxy& proxy) { proxy.infoPlist = Dictionary(); }),
              "ops I: ignoring mis-configured plug-in at /Apps/Host.app/PlugIns/"
              "com.a.appex: missing \"VXExtensionAttributes\" key in Info.plist or SDK");
    for (bool inside : {true, false})
        EXPECT_THAT(refusal([inside](Proxy& proxy) {
                        proxy.dataContainerPath.reset();
                        if (!inside) proxy.containingApplication.reset();
                    }),
                    HasSubstr("this plug-in has no sandbox data container"));
    EXPECT_THAT(refusal([](Proxy& proxy) {
                    proxy.containingApplication.reset();
                    proxy.bundlePath = "/Systems/a.appex";
                }),
                HasSubstr("plug-ins outside containing apps must be in /System"));
    EXPECT_EQ(refusal([](Proxy& proxy) {
                  proxy.containingApplication.reset();
                  proxy.bundlePath = "/System/Library/a.appex";
              }),
              "made");
    EXPECT_EQ(refusal([](Proxy& proxy) {  // a data plug-in needs no container
                  proxy = *makeProxy("com.a", {}, {{"VXExtensionProtocol", "#Data"}});
                  proxy.dataContainerPath.reset();
              }),
              "made");
}

TEST_F(ZRDPlugInTest, AnnotationKeyIsTheReplacedIdentifierWhenItIsText) {
    auto key = [&](Dictionary entitlements) {
        auto proxy = makeProxy("com.a");
        proxy->entitlements = std::move(entitlements);
        return std::string(world_.record(proxy)->annotationKey());
    };
    EXPECT_EQ(key({}), "com.a");
    EXPECT_EQ(key({{"com.orbel.developer.replace-plugin", "com.b"}}), "com.b");
    EXPECT_EQ(key({{"com.orbel.developer.replace-plugin", ""}}), "");
    EXPECT_EQ(key({{"com.orbel.developer.replace-plugin", Array{"com.b"}}}), "com.a");
}

TEST_F(ZRDPlugInTest, PruningDropsKeysOfTheBuildTools) {
    EXPECT_EQ(ZRDPlugIn::prunedInfoDictionaryFor({{"DTx", 1}, {"DT", 1}, {"dtx", 1}, {"D", 1}}),
              (Dictionary{{"dtx", 1}, {"D", 1}}));
}

TEST_F(ZRDPlugInTest, AdmissionJudgesTheRestrictionThenTheDemand) {
    const std::string demandReason = "the host does not have the \"com.e\" entitlement";
    const std::string malformed = "invalid host restriction entitlement";
    auto plugIn = world_.record(makeProxy("com.a", {}, {{"VXExtensionHostEntitlement", "com.e"}}));
    auto reason = [&](std::optional<Value> restriction, std::optional<Value> held) {
        host_.entitlements = {};
        if (restriction) host_.entitlements.set(entitlement::kAllowedPlugIns, *restriction);
        if (held) host_.entitlements.set("com.e", *held);
        return plugIn->allowForClient(host_).value_or("");
    };
    EXPECT_EQ(reason(std::nullopt, std::nullopt), demandReason);
    EXPECT_EQ(reason(std::nullopt, false), demandReason);
    EXPECT_EQ(reason(std::nullopt, 0), demandReason);
    for (Value held : {Value(true), Value("no"), Value(2)}) EXPECT_EQ(reason({}, held), "");
    EXPECT_EQ(reason(Dictionary(), true), "");
    EXPECT_EQ(reason(Dictionary{{"VXExtensionIdentifier", "com.a"}}, true), "");
    EXPECT_EQ(reason(Dictionary{{"VXExtensionIdentifier", "com.b"}}, std::nullopt),
              "the host's plug-in entitlement does not allow this plug-in");
    EXPECT_EQ(reason(Array{"com.a"}, std::nullopt), malformed);
    EXPECT_EQ(reason(false, true), malformed);
    Dictionary many;  // each holds, but all are too much to ask
    for (std::size_t i = 0; i <= 4 * RuleSet::kMaxRules; ++i) many.set(std::to_string(i), false);
    EXPECT_EQ(reason(many, true), malformed);

    plugIn = world_.record(makeProxy("com.a"));
    EXPECT_EQ(reason(std::nullopt, std::nullopt), "");
    plugIn = world_.record(makeProxy("com.a", {}, {{"VXExtensionHostEntitlement", 1}}));
    EXPECT_NE(reason(std::nullopt, true), "");
}

TEST_F(ZRDPlugInTest, GrantedServicesAreThoseOfTheApplicationAround) {
    auto plugIn = world_.record(makeProxy("com.a"));
    world_.consent->records = {{{"granted", true}, {"service", "s1"}},
                               {{"granted", false}, {"service", "s2"}},
                               {{"service", "s3"}},
                               {{"granted", true}, {"service", 4}}};
    EXPECT_THAT(plugIn->allowedVSKServices(), ElementsAre("s1"));

    world_.consent->records.reset();
    LogLines log;
    EXPECT_THAT(plugIn->allowedVSKServices(), IsEmpty());
    EXPECT_THAT(log.take(),
                ElementsAre(HasSubstr("ops I: VSKAccessCopyInformationForBundle failed for")));
    auto outside = makeProxy("com.a");
    outside->containingApplication.reset();
    outside->bundlePath = "/System/a.appex";
    EXPECT_THAT(world_.record(outside)->allowedVSKServices(), IsEmpty());
    EXPECT_THAT(log.take(), IsEmpty());
}

}  // namespace

}  // namespace zorvan
