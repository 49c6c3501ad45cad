#include "zrd/ZRDAnnotationStore.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>

#include "platform/plist/PropertyList.h"
#include "platform/system/Directories.h"
#include "platform/system/Files.h"
#include "tests/Zorvan/LogLines.h"
#include "tests/support/TemporaryDirectory.h"
#include "tests/zrd/Fakes.h"
#include "tests/zrd/ProbeTrace.h"

namespace zorvan {

namespace {

using testing::AllOf;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::StartsWith;

/// {"version": 16, "data": {"a": {"election": 1}}}
constexpr std::string_view kBinary(
    "bplist00"
    "\xd2\x01\x02\x03\x04"
    "Tdata"
    "Wversion"
    "\xd1\x05\x06"
    "\x10\x10"
    "Qa"
    "\xd1\x07\x08"
    "Xelection"
    "\x10\x01"
    "\x08\x0d\x12\x1a\x1d\x1f\x21\x24\x2d"
    "\0\0\0\0\0\0\x01\x01\0\0\0\0\0\0\0\x09\0\0\0\0\0\0\0\0\0\0\0\0\0\0\0\x2f",
    88);

class AnnotationStoreTest : public testing::Test {
  protected:
    void open() { store_ = ZRDAnnotationStore::initWithDatabase(path_, {}); }
    std::string text() const { return *platform::readFile(path_, 1 << 20); }
    Dictionary root() const { return *platform::readPropertyListFile(path_)->dictionary(); }
    std::shared_ptr<ZRDPlugIn> plugIn(const char* identifier, Dictionary entitlements = {}) {
        auto proxy = makeProxy(identifier);
        proxy->entitlements = std::move(entitlements);
        return world_.record(proxy);
    }

    ::test::TemporaryDirectory directory_;
    const std::string path_ = directory_.path("Annotations");
    FakeWorld world_;
    std::unique_ptr<ZRDAnnotationStore> store_;
};

TEST_F(AnnotationStoreTest, WhatCannotBeLoadedIsReportedOnceAndReplacedByTheFirstChange) {
    auto xml = [](Dictionary root) { return *platform::writeXmlPropertyList(std::move(root)); };
    const Dictionary data{{"old", Dictionary{{"election", 1}}}};
    const std::pair<std::string, const char*> cases[] = {
        {"garbage", "PropertyList"},
        {"", "PropertyList"},
        {xml({{"version", 15}, {"data", data}}), "found database version 15 needed version 16"},
        {xml({{"data", data}}), "found database version 0 needed version 16"},
        {xml({{"version", "16"}, {"data", data}}), "found database version 0 needed version 16"},
        {xml({{"version", 16}, {"data", "none"}}), "data"},
        {xml({{"version", 16}}), "data"},
    };
    for (const auto& [bytes, reason] : cases) {
        directory_.write("Annotations", bytes);
        LogLines log(LogLines::Private::Hidden);
        const ProbeTrace trace;
        open();
        EXPECT_THAT(
            log.take(),
            ElementsAre(
                StartsWith(*reason == 'P' ? "probe D: db-load PropertyList "
                                          : "probe D: db-load Zorvan 7"),
                AllOf(StartsWith("ops E: unable to load annotation database:" + path_ + " error:"),
                      HasSubstr(reason), HasSubstr(" (resetting)"))));
        EXPECT_THAT(store_->annotations(), IsEmpty());
        EXPECT_EQ(text(), bytes);
        store_->setAnnotation(Dictionary{{"election", 2}}, *plugIn("a"));
        EXPECT_EQ(root(), (Dictionary{{"version", 16},
                                      {"data", Dictionary{{"a", Dictionary{{"election", 2}}}}}}));
        EXPECT_THAT(log.take(), IsEmpty());
    }
}

TEST_F(AnnotationStoreTest, AMissingFileIsAnEmptyStore) {
    LogLines log;
    const ProbeTrace trace;
    open();
    EXPECT_THAT(store_->annotations(), IsEmpty());
    EXPECT_THAT(log.take(), ElementsAre("probe D: db-load POSIX 2"));
    EXPECT_FALSE(std::filesystem::exists(path_));
}

TEST_F(AnnotationStoreTest, ReadsBinaryAndWritesXml) {
    directory_.write("Annotations", kBinary);
    open();
    EXPECT_EQ(*store_->annotationForIdentifier("a"), (Dictionary{{"election", 1}}));
    store_->setAnnotation(Dictionary(), *plugIn("b"));
    EXPECT_THAT(text(), StartsWith("<?xml"));
    open();
    EXPECT_EQ(store_->annotations(),
              (Dictionary{{"a", Dictionary{{"election", 1}}}, {"b", Dictionary()}}));

    // A control character, which the text could not give back.
    std::string unstorable(kBinary);
    unstorable[unstorable.find("Qa") + 1] = '\x01';
    directory_.write("Annotations", unstorable);
    LogLines log(LogLines::Private::Hidden);
    open();
    EXPECT_THAT(store_->annotations(), IsEmpty());
    EXPECT_THAT(log.take(), ElementsAre("ops E: leaving out an annotation that cannot be stored: "
                                        "<private> in " +
                                        path_));
}

TEST_F(AnnotationStoreTest, ChangesMergeAndNoneRemoves) {
    open();
    auto own = plugIn("a"), replacer = plugIn("r", {{"com.orbel.developer.replace-plugin", "a"}});
    const Dictionary extension{{"k", Array{1, "x"}}};
    store_->setAnnotation(Dictionary{{"election", 1}}, *own);
    store_->setAnnotation(Dictionary{{"extension", extension}}, *replacer);
    store_->setAnnotation(Dictionary{{"election", 2}}, *own);
    const Dictionary merged{{"election", 2}, {"extension", extension}};
    open();
    EXPECT_EQ(*store_->annotationForPlugIn(*own), merged);
    EXPECT_EQ(*store_->annotationForPlugIn(*replacer), merged);
    store_->setAnnotation(std::nullopt, *replacer);
    EXPECT_FALSE(store_->annotationForPlugIn(*own));
    EXPECT_EQ(*root().find("data"), Value(Dictionary()));
}

TEST_F(AnnotationStoreTest, WhatIsWrittenPieceByPieceIsWhatWouldBeWrittenAtOnce) {
    open();
    Dictionary expected;
    const auto change = [&](const char* key, std::optional<Dictionary> extension) {
        const std::optional<Dictionary> annotation =
            extension ? std::optional(Dictionary{{"extension", *extension}}) : std::nullopt;
        store_->setAnnotation(annotation, *plugIn(key));
        if (annotation)
            expected.set(key, *annotation);
        else
            expected.remove(key);
        EXPECT_EQ(text(),
                  *platform::writeXmlPropertyList(Dictionary{{"version", 16}, {"data", expected}}))
            << key;
    };
    const Dictionary deep{{"a", Dictionary{{"b", Dictionary{{"c", Array{Dictionary()}}}}}}};
    const Dictionary sly{{"\n\t\t<key>", "\n\t</dict>\n"}, {"data", platform::Data("\n\t\t<key>")}};
    for (int run : {1, 2}) {
        change("m", Dictionary());
        change("z", sly);
        change("\n\t\t<key>m&", deep);
        change("a", sly);
        change("m", deep);
        change("none", std::nullopt);
        change("z", std::nullopt);
        if (run == 1) open();
    }
    for (const char* key : {"a", "m", "\n\t\t<key>m&"}) change(key, std::nullopt);
    change("m", sly);
    open();
    EXPECT_EQ(store_->annotations(), expected);
}

TEST_F(AnnotationStoreTest, AFailedSaveKeepsTheChangeForTheNextOne) {
    directory_.makeDirectory("Annotations");  // nothing can be written in its place
    LogLines log(LogLines::Private::Hidden);
    open();
    log.take();
    auto a = plugIn("a");
    store_->setAnnotation(Dictionary{{"election", 1}}, *a);
    EXPECT_THAT(log.take(), ElementsAre(StartsWith("ops E: unable to save annotations:" + path_ +
                                                   " error:" + path_)));
    std::filesystem::remove(path_);
    store_->setAnnotation(Dictionary(), *plugIn("b"));
    EXPECT_TRUE(root().find("data")->dictionary()->contains("a"));
}

TEST_F(AnnotationStoreTest, ACrashOfTheMachineLeavesWhatWasSynced) {
    const auto a = plugIn("a");
    open();
    store_->setAnnotation(Dictionary{{"election", 1}}, *a);
    const auto changeTwice = [&] {
        for (int election : {2, 3})
            store_->setAnnotation(Dictionary{{"election", election}}, *a, std::nullopt,
                                  platform::Sync::Later);
    };
    const auto elected = [&] { return *store_->annotationForPlugIn(*a); };
    for (const char* spoilt : {"", "<?xml version"}) {
        changeTwice();
        directory_.write("Annotations", spoilt);
        LogLines log(LogLines::Private::Hidden);
        open();
        EXPECT_THAT(log.take(), ElementsAre(HasSubstr("going back to those before")));
        EXPECT_EQ(elected(), (Dictionary{{"election", 1}}));
    }
    // That of the daemon alone leaves all, and then that is synced.
    changeTwice();
    open();
    EXPECT_EQ(elected(), (Dictionary{{"election", 3}}));
    EXPECT_FALSE(platform::lastSyncedFile(path_));
    changeTwice();
    EXPECT_TRUE(platform::lastSyncedFile(path_));
    store_->sync();
    EXPECT_FALSE(platform::lastSyncedFile(path_));
}

TEST_F(AnnotationStoreTest, WhatHostsStoreLeavesRoomForElections) {
    open();
    const Array text{std::string(16u << 20, 'x')};
    const auto fits = [&](std::size_t texts) {
        const Dictionary data{{"k", Array(std::vector<Value>(texts, text))}};
        return store_->hasRoomFor(Dictionary{{"extension", data}}, *plugIn("a"));
    };
    EXPECT_TRUE(fits(11));
    EXPECT_FALSE(fits(13));
}

TEST_F(AnnotationStoreTest, TheDefaultPlaceIsMadePrivateAndItsLackStopsTheDaemon) {
    platform::Directories directories;
    directories.stateHome = directory_.path("deep/state");
    const std::string url = ZRDAnnotationStore::defaultDatabaseURL(directories);
    EXPECT_EQ(url, directories.stateHome + "/com.orbel.zorvan/Annotations");
    struct stat status {};
    ASSERT_EQ(
        ::stat(platform::joinPath(directories.stateHome, "com.orbel.zorvan").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777, 0700u);

    auto inconsistency = [&](std::string stateHome) -> std::string {
        directories.stateHome = std::move(stateHome);
        try {
            return ZRDAnnotationStore::defaultDatabaseURL(directories);
        } catch (const ZRInternalInconsistency& error) {
            return error.text();
        }
    };
    EXPECT_THAT(inconsistency(""), HasSubstr("unable to locate user directory: errno "));
    EXPECT_THAT(inconsistency("/" + std::string(1022, 'x')), HasSubstr("unable to locate"));
    EXPECT_THAT(inconsistency("/" + std::string(1021, 'x')), StartsWith("unable to create"));
    EXPECT_THAT(inconsistency(directory_.write("file", "")),
                StartsWith("unable to create plugin annotations directory:"));
}

}  // namespace

}  // namespace zorvan
