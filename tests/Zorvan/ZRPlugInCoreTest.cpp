#include "Zorvan/ZRPlugInCore.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "tests/Zorvan/LogLines.h"

namespace zorvan {
namespace {

using platform::Array;
using platform::Dictionary;
using platform::Uuid;
using platform::Value;
using testing::ElementsAre;
using testing::IsEmpty;

std::unique_ptr<ZRPlugInCore> plugIn(const std::string& path, Dictionary plugInDictionary) {
    return ZRPlugInCore::initWithName("com.example.a", path, std::nullopt,
                                      std::move(plugInDictionary), std::nullopt);
}

TEST(ZRPlugInCore, IsMadeFromCompleteDescriptionsOnly) {
    LogLines log(LogLines::Private::Hidden);
    auto make = [](std::optional<std::string> name, std::optional<std::string> path,
                   std::optional<Value> bundleInfo) {
        return ZRPlugInCore::initWithName(name, path, bundleInfo, Dictionary{{"own", 1}}, {});
    };
    EXPECT_FALSE(make("a", {}, {}));
    EXPECT_THAT(log.take(), IsEmpty());
    EXPECT_FALSE(make({}, "/p", {}));
    EXPECT_THAT(log.take(), ElementsAre("ops E: missing identifier in plug-in at <private>"));
    for (const Value& malformed :
         {Value("text"), Value(Dictionary{{"VXExtension", "text"}}),
          Value(Dictionary{{"VXExtension", Array{}}}), Value(Dictionary{{"Zorvan", Dictionary{}}})})
        EXPECT_FALSE(make("a", "/p", malformed)) << describe(malformed);
    const char* line =
        "ops -: malformed plug-in dictionary in plug-in <private> at <private>: <private>";
    EXPECT_THAT(log.take(), ElementsAre(line, line, line, line));

    EXPECT_EQ(make("a", "/p", {})->plugInDictionary(), (Dictionary{{"own", 1}}));
    Dictionary multiple{{"Multiple", false}};
    auto record = make("a", "/p", Dictionary{{"VXExtension", multiple}, {"top", 2}});
    EXPECT_EQ(record->plugInDictionary(), multiple);
    EXPECT_EQ(*record->infoKey("top"), Value(2));
    EXPECT_THAT(log.take(), ElementsAre("ops -: multiplexed plug-ins (Multiple key) obsolete and "
                                        "ignored"));
}

TEST(ZRPlugInCore, IsEqualByUuidAlone) {
    Uuid uuid = Uuid::random();
    auto a = ZRPlugInCore::initWithName("a", "/a", {}, {}, uuid);
    auto b = ZRPlugInCore::initWithName("b", "/b", {}, {}, uuid);
    EXPECT_EQ(*a, *b);
    EXPECT_EQ(a->hash(), b->hash());
    EXPECT_NE(*plugIn("/a", {}), *plugIn("/a", {}));
}

TEST(ZRPlugInCore, DiagnosesItsFirstDefect) {
    Dictionary defective{{"EmbeddedCode", false}, {"PassProxy", 1}, {"PrincipalClass", "Own"}};
    auto expectDefect = [](const std::string& path, const Dictionary& dictionary,
                           std::optional<std::string> text) {
        std::optional<ZRError> expected;
        if (text) expected = ZRError{"Zorvan", 12, text};
        EXPECT_EQ(plugIn(path, dictionary)->diagnose(), expected) << text.value_or("none");
    };
    EXPECT_EQ(ZRPlugInCore::initWithName("", "/a", {}, {}, {})->diagnose()->description,
              "missing identifier (no VXExtensionIdentifier, nor even QFBundleIdentifier)");
    for (const char* path : {"/a.plugin", "/a.APPEX"})
        expectDefect(path, defective, "missing \"VXExtensionProtocol\" key in Info.plist or SDK");
    const char* path = "/a.appex";
    expectDefect(path, defective, "missing \"VXExtensionAttributes\" key in Info.plist or SDK");
    defective.set("VXExtensionAttributes", Dictionary{});
    expectDefect(path, defective, "Application Extensions may not use the \"PrincipalClass\" key");
    defective.set("PrincipalClass", "VXObject");
    expectDefect(path, defective, "the \"PassProxy\" key is not supported on this platform");
    defective.remove("PassProxy");
    expectDefect(path, defective, "hybrid plug-ins are not supported on this platform");
    defective.remove("EmbeddedCode");
    expectDefect(path, defective, std::nullopt);
}

/// Reads its plug-in dictionary from elsewhere, as the daemon's record does.
class OtherPlugIn : public ZRPlugInCore {
  public:
    using ZRPlugInCore::initialize;
    const Value* pluginKey(std::string_view key) const override { return elsewhere.find(key); }

    Dictionary elsewhere{
        {"VXExtensionProtocol", "#Data"},
        {"VXExtensionAttributes", Dictionary{{"VXExtensionVersion", 7}}},
        {"VXExtensionPointIdentifier", "com.example.point"},
        {"Dedicated", true},
    };
};

TEST(ZRPlugInCore, DerivesEverythingThroughItsLookups) {
    OtherPlugIn record;
    ASSERT_TRUE(record.initialize("a", "/a", {}, Dictionary{{"EmbeddedCode", 1}}, {}));
    EXPECT_TRUE(record.isData());
    EXPECT_TRUE(record.isDedicated());
    EXPECT_FALSE(record.isHybrid());
    EXPECT_EQ(*record.version(), Value(7));
    EXPECT_EQ(*record.sdkSpec(), Value("com.example.point"));
    EXPECT_EQ(record.embeddedProtocolSpec(), Value("#Data"));
    EXPECT_EQ(record.principalSpec(), std::nullopt);
    record.elsewhere = {{"VXExtensionAttributes", "text"}};
    EXPECT_EQ(record.version(), nullptr);
    for (const Value& yes : {Value("YES"), Value("True"), Value("1"), Value(2)}) {
        record.elsewhere.set("Dedicated", yes);
        EXPECT_TRUE(record.isDedicated()) << describe(yes);
    }
    for (const Value& no : {Value("no"), Value("2"), Value("yes "), Value(""), Value(0.0)}) {
        record.elsewhere.set("Dedicated", no);
        EXPECT_FALSE(record.isDedicated()) << describe(no);
    }
}

template <class Work>
std::string inconsistency(Work&& work) {
    try {
        work();
    } catch (const ZRInternalInconsistency& caught) {
        return caught.text();
    }
    return "";
}

TEST(ZRPlugInCore, ReportsBrokenInvariants) {
    LogLines log;
    OtherPlugIn unbuilt;
    EXPECT_EQ(inconsistency([&] { unbuilt.hash(); }), "self.uuid");
    EXPECT_EQ(inconsistency([&] { plugIn("/a", {})->oldStyle(); }),
              "unknown plug-in configuration style");
    EXPECT_EQ(log.take().size(), 2u);
    Dictionary both{{"VXExtension", Dictionary{}}, {"Zorvan", Dictionary{}}};
    EXPECT_FALSE(ZRPlugInCore::initWithName("a", "/a", both, {}, {})->oldStyle());
}

}  // namespace
}  // namespace zorvan
