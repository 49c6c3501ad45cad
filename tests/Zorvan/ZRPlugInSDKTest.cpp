#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Zorvan/ZRPlugInCore.h"
#include "platform/plist/PropertyList.h"
#include "platform/services/SdkDictionaries.h"
#include "platform/system/Directories.h"
#include "tests/Zorvan/LogLines.h"
#include "tests/support/TemporaryDirectory.h"

namespace zorvan {
namespace {

using platform::Array;
using platform::Dictionary;
using platform::Value;
using testing::ElementsAre;
using testing::IsEmpty;

TEST(SdkMerge, FollowsTheRuleOfEachKeyAtEveryLevel) {
    struct Case {
        const char* key;
        Value sdk;
        Value own;
        Value merged;
    };
    const Dictionary dictionary{{"x", 1}};
    for (const auto& [key, sdk, own, merged] : {
             Case{"Timeout", 30, 5, 5},
             {"CleanTimeout", 30, 5, 30},
             {"CleanTimeout", dictionary, 5, dictionary},
             {"Shared", Array{"a", "b"}, Array{"b", "c", "b"}, Array{"b", "c", "a"}},
             {"Shared", Array{"a", 1}, Array{2, "a"}, Array{"a"}},
             {"Shared", Array{"a"}, "c", "c"},
             {"Shared", "a", Array{"c"}, Array{"c"}},
             {"Shared", dictionary, Dictionary{}, Dictionary{}},
             {"Any", dictionary, "text", "text"},
             {"Any", "text", dictionary, dictionary},
             {"Any", dictionary, Dictionary{{"y", 2}}, Dictionary{{"x", 1}, {"y", 2}}},
         }) {
        Dictionary from{{key, sdk}, {"added", 1}};
        const Dictionary into{{key, own}, {"kept", 2}};
        const Dictionary expected{{key, merged}, {"added", 1}, {"kept", 2}};
        EXPECT_EQ(ZRPlugInCore::mergeDictionary(from, into), expected) << key;
        EXPECT_EQ(ZRPlugInCore::mergeDictionary({{"in", from}}, {{"in", into}}),
                  (Dictionary{{"in", expected}}))
            << key;
        EXPECT_EQ(into.size(), 2u);
    }
}

class SdkResolution : public testing::Test {
  protected:
    SdkResolution() { directories_.dataHome = directory_.path(); }

    void registerSdk(const std::string& name, const Dictionary& sdk) {
        directory_.write("zorvan/SDKs/" + name + ".plist", *platform::writeXmlPropertyList(sdk));
    }

    /// A record with this plug-in dictionary, resolved.
    std::unique_ptr<ZRPlugInCore> resolved(const Value& extension, Dictionary infoPlist = {}) {
        infoPlist.set("VXExtension", extension);
        auto record = ZRPlugInCore::initWithName("a", "/a", infoPlist, {}, {});
        platform::SdkDictionaries sdks(directories_);
        record->resolveSDK(sdks);
        return record;
    }

    test::TemporaryDirectory directory_;
    platform::Directories directories_;
    LogLines log_{LogLines::Private::Hidden};
};

TEST_F(SdkResolution, CompletesTheInfoPlistFromTheExtensionPoint) {
    registerSdk("point", {{"VXExtension",
                           Dictionary{{"VXExtensionProtocol", "Given"},
                                      {"VXExtensionAttributes", Dictionary{{"kind", "sdk"}}}}},
                          {"QFBundleShortVersionString", "2.3"}});
    auto record = resolved(Dictionary{{"VXExtensionPointIdentifier", "point"}});
    EXPECT_EQ(record->protocolSpec(), Value("Given"));
    EXPECT_EQ(*record->attributes(),
              Value(Dictionary{{"VXExtensionVersion", "2.3"}, {"kind", "sdk"}}));
    EXPECT_TRUE(record->infoKey("VXExtension")->dictionary()->contains("VXExtensionProtocol"));
    EXPECT_THAT(log_.take(), IsEmpty());
}

TEST_F(SdkResolution, WithoutAnSdkOnlyCanonicalizes) {
    auto version = [](const ZRPlugInCore& record) { return record.version(); };
    auto record = resolved(Dictionary{{"VXExtensionPointIdentifier", "unknown"}});
    EXPECT_EQ(*version(*record), Value("1"));
    EXPECT_THAT(log_.take(), ElementsAre("ops -: plug-in sdk \"unknown\" not registered"));
    EXPECT_EQ(*version(*resolved(Dictionary{}, {{"QFBundleShortVersionString", "2.3"}})),
              Value("2.3"));
    EXPECT_EQ(*version(*resolved(
                  Dictionary{{"VXExtensionAttributes", Dictionary{{"VXExtensionVersion", 9}}}})),
              Value(9));
    EXPECT_EQ(*version(*resolved(Dictionary{{"VXExtensionAttributes", "text"}})), Value("1"));
}

TEST_F(SdkResolution, RefusesSdkNamesThatAreNoTextAndRecordsWithoutInfoPlist) {
    auto record = resolved(Dictionary{{"VXExtensionPointIdentifier", 7}});
    EXPECT_EQ(record->version(), nullptr);
    EXPECT_THAT(log_.take(), ElementsAre("ops E: invalid SDK key:7"));
    platform::SdkDictionaries sdks(directories_);
    auto bare = ZRPlugInCore::initWithName("a", "/a", {}, Dictionary{}, {});
    EXPECT_THROW(bare->resolveSDK(sdks), ZRInternalInconsistency);
}

}  // namespace
}  // namespace zorvan
