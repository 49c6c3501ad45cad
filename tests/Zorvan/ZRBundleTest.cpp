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
    LogLines log;
    auto bundle = ZRBundle::initWithPath(path_);
    EXPECT_FALSE(bundle->infoDictionary());
    EXPECT_FALSE(bundle->bundleIdentifier());
    auto lines = log.take();
    for (const std::string& line :
         {"retrieve Info.plist for " + path_ + " through ",
          "convert Info.plist to dictionary: " + path_ + " source=(null)"})
        EXPECT_THAT(lines, testing::Contains(testing::StartsWith("ops I: failed to " + line)));
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
