#include "Zorvan/ZRBundle.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <utility>

#include "platform/plist/PropertyList.h"
#include "tests/Zorvan/LogLines.h"
#include "tests/support/TemporaryDirectory.h"

namespace zorvan {
namespace {

using platform::Dictionary;

class ZRBundleTest : public testing::Test {
  protected:
    void writeInfoPlist(const Dictionary& infoPlist) {
        directory_.write("A.app/Info.plist", *platform::writeXmlPropertyList(infoPlist));
    }

    test::TemporaryDirectory directory_;
    std::string path_ = directory_.makeDirectory("A.app");
};

TEST_F(ZRBundleTest, AnswersForABundleAndForItsExecutable) {
    writeInfoPlist({{"QFBundleIdentifier", "com.example.a"}, {"QFBundleExecutable", "run"}});
    std::string executable = directory_.write("A.app/run", "");
    for (const auto& bundle :
         {ZRBundle::initWithPath(path_), ZRBundle::initWithExecutablePath(executable)}) {
        ASSERT_TRUE(bundle);
        EXPECT_EQ(bundle->path(), path_);
        EXPECT_EQ(bundle->executablePath(), executable);
        EXPECT_EQ(bundle->supportPath(), path_);
        EXPECT_EQ(bundle->plugInsPath(), path_ + "/PlugIns");
        EXPECT_EQ(bundle->bundleIdentifier(), "com.example.a");
    }
    EXPECT_FALSE(ZRBundle::initWithPath("relative"));
    EXPECT_EQ(ZRBundle::initForMainBundle()->path(), std::nullopt) << "this program has none";
}

TEST_F(ZRBundleTest, TakesAnExecutableOutsideBundlesForABundlePath) {
    std::string bare = directory_.write("bare", "");
    auto bundle = ZRBundle::initWithExecutablePath(bare);
    ASSERT_TRUE(bundle);
    EXPECT_EQ(bundle->path(), bare);
    EXPECT_EQ(bundle->executablePath(), bare);
}

TEST_F(ZRBundleTest, ReadsTheInfoPlistAfresh) {
    LogLines log(LogLines::Private::Hidden);
    auto bundle = ZRBundle::initWithPath(path_);
    EXPECT_FALSE(bundle->infoDictionary());
    EXPECT_FALSE(bundle->bundleIdentifier());
    EXPECT_THAT(
        log.take(),
        testing::ElementsAre(
            "ops I: failed to retrieve Info.plist for <private> through <private>",
            "ops I: failed to convert Info.plist to dictionary: <private> source=<private>"));
    writeInfoPlist({{"QFBundleIdentifier", 7}});
    EXPECT_EQ(bundle->infoDictionary(), (Dictionary{{"QFBundleIdentifier", 7}}));
    EXPECT_FALSE(bundle->bundleIdentifier());
}

TEST_F(ZRBundleTest, ReadsNothingThatLiesOutside) {
    writeInfoPlist({{"QFBundleExecutable", "run"}});
    std::filesystem::rename(path_ + "/Info.plist", path_ + "/moved.plist");
    for (const auto& [target, name] : {std::pair{std::string("moved.plist"), "/run"},
                                       {"../A.app/moved.plist", ""},
                                       {path_ + "/moved.plist", ""}}) {
        std::filesystem::remove(path_ + "/Info.plist");
        std::filesystem::create_symlink(target, path_ + "/Info.plist");
        const auto bundle = ZRBundle::initWithExecutablePath(path_ + "/run");
        EXPECT_EQ(bundle->executablePath(), path_ + name) << target;
    }
}

}  // namespace
}  // namespace zorvan
