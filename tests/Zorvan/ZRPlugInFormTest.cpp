#include <gtest/gtest.h>

#include "Zorvan/ZRPlugInCore.h"

namespace zorvan {
namespace {

using platform::Data;
using platform::Dictionary;
using platform::Uuid;
using platform::Value;

const Dictionary kInfoPlist{
    {"VXExtension", Dictionary{{"VXExtensionAttributes", Dictionary{{"VXExtensionVersion", 2}}}}},
    {"QFBundleIdentifier", "com.example.a"},
};

std::unique_ptr<ZRPlugInCore> completePlugIn() {
    Dictionary infoPlist = kInfoPlist;
    infoPlist.set("QFBundleInfoPlistURL", "file:///a.appex/Info.plist");
    auto record = ZRPlugInCore::initWithName("com.example.a", "/a.appex", infoPlist, {}, {});
    record->setOriginalIdentifier("com.example.original");
    return record;
}

Dictionary exported(const ZRPlugInCore& record) {
    std::optional<ZRError> error;
    auto form = record.exportForm(error);
    EXPECT_FALSE(error);
    return form.value_or(Dictionary());
}

TEST(PlugInForm, OfABareRecordHasTheElevenKeys) {
    auto record = completePlugIn();
    Dictionary form = exported(*record);
    EXPECT_EQ(form, (Dictionary{{"hubProtocolVersion", 1},
                                {"path", "/a.appex"},
                                {"systemResident", false},
                                {"identifier", "com.example.a"},
                                {"original-identifier", "com.example.original"},
                                {"version", 2},
                                {"bundleInfo", kInfoPlist},
                                {"info", *kInfoPlist.find("VXExtension")},
                                {"uuid", record->uuid().string()},
                                {"lastmodified", 0},
                                {"annotations", Dictionary{}}}));
    EXPECT_EQ(ZRPlugInCore::initWithForm(form)->annotations(), Dictionary{});
}

TEST(PlugInForm, SharesAnInfoPlistThatItNeedNotChange) {
    auto record = ZRPlugInCore::initWithName("a", "/a.appex", kInfoPlist, {}, {});
    record->setOriginalIdentifier("a");
    Dictionary form = exported(*record);
    EXPECT_EQ(form.find("bundleInfo")->dictionary()->begin(), kInfoPlist.begin());
}

TEST(PlugInForm, SurvivesTheRoundTrip) {
    auto record = completePlugIn();
    record->setOnSystemVolume(true);
    record->setHubProtocolVersion(0);
    record->setLastModified(-5);
    record->setEntitlements(Dictionary{{"com.example.right", true}});
    record->setContainingPath("/A.app");
    record->setLocalizedContainingName("Äpp");
    record->setLocalizedName("Name");
    record->setLocalizedShortName("N");
    record->setCdhash(Data("hash"));
    record->setRequirement("anchor");
    record->setAnnotation("election", 1);
    Dictionary form = exported(*record);
    EXPECT_EQ(form.size(), 16u);

    auto read = ZRPlugInCore::initWithForm(form);
    ASSERT_TRUE(read);
    EXPECT_EQ(exported(*read), form);
    EXPECT_EQ(*read, *record);
    EXPECT_EQ(read->hubProtocolVersion(), 0u);
    EXPECT_EQ(read->cdhash(), std::nullopt);
    EXPECT_EQ(read->requirement(), std::nullopt);
}

TEST(PlugInForm, NeedsEveryFactThatItAlwaysCarries) {
    auto missing = [](const ZRPlugInCore& record) {
        std::optional<ZRError> error;
        EXPECT_FALSE(record.exportForm(error));
        EXPECT_EQ(error->code, kZRErrorPlugIn);
        return error->description.value_or("");
    };
    auto record = completePlugIn();
    record->setOriginalIdentifier(std::nullopt);
    EXPECT_EQ(missing(*record), "plug-in com.example.a has no original identifier");
    auto bare = ZRPlugInCore::initWithName("a", "/a", {}, {}, {});
    bare->setOriginalIdentifier("a");
    EXPECT_EQ(missing(*bare), "plug-in a has no version attribute");
    const Dictionary& plugInDictionary = *kInfoPlist.find("VXExtension")->dictionary();
    auto unread = ZRPlugInCore::initWithName("a", "/a", {}, plugInDictionary, {});
    unread->setOriginalIdentifier("a");
    EXPECT_EQ(missing(*unread), "plug-in a has no Info.plist");
}

TEST(PlugInForm, IsReadWithDefaultsForWhatIsMissingOrOfTheWrongType) {
    Dictionary form{{"path", "/a"}, {"identifier", "a"}};
    for (const char* key :
         {"hubProtocolVersion", "original-identifier", "hash", "requirement", "lastmodified",
          "entitlements", "containingPath", "systemResident", "annotations", "uuid",
          "localizedDisplayName", "localizedShortName", "localizedContainingDisplayName"}) {
        Dictionary wrong = form;
        wrong.set(key, platform::Date{1});
        for (const Dictionary& incomplete : {form, wrong}) {
            auto record = ZRPlugInCore::initWithForm(incomplete);
            ASSERT_TRUE(record) << key;
            EXPECT_EQ(record->hubProtocolVersion(), 1u);
            EXPECT_EQ(record->lastModified(), 0);
            EXPECT_FALSE(record->onSystemVolume());
            EXPECT_FALSE(record->originalIdentifier() || record->containingPath() ||
                         record->entitlements() || record->annotations() || record->cdhash() ||
                         record->requirement() || record->localizedName() ||
                         record->localizedShortName() || record->localizedContainingName() ||
                         record->plugInDictionary())
                << key;
        }
    }
    for (const char* key : {"path", "identifier", "bundleInfo"}) {
        Dictionary wrong = form;
        wrong.set(key, 1);
        EXPECT_FALSE(ZRPlugInCore::initWithForm(wrong)) << key;
    }
    Dictionary beyond = form;
    beyond.set("hubProtocolVersion", -1);
    beyond.set("lastmodified", 1e300);
    EXPECT_EQ(ZRPlugInCore::initWithForm(beyond)->hubProtocolVersion(), 0u);
    EXPECT_EQ(ZRPlugInCore::initWithForm(beyond)->lastModified(), INT32_MAX);
}

TEST(PlugInForm, UpdatesAnnotationsOnly) {
    auto record = completePlugIn();
    record->setAnnotation("election", 2);
    Dictionary first = *record->annotations();
    record->setAnnotation("extension", Dictionary{});
    record->setAnnotation("election", std::nullopt);
    EXPECT_EQ(first, (Dictionary{{"election", 2}}));
    EXPECT_EQ(record->annotations(), (Dictionary{{"extension", Dictionary{}}}));
    record->updateFromForm({{"annotations", first}, {"original-identifier", "other"}});
    EXPECT_EQ(record->annotations(), first);
    EXPECT_EQ(record->originalIdentifier(), "com.example.original");
    record->updateFromForm({});
    EXPECT_EQ(record->annotations(), std::nullopt);
}

}  // namespace
}  // namespace zorvan
