#include "tests/support/HungMount.h"

#include <atomic>
#include <filesystem>

#include "tests/platform/tandry/RegistryFixture.h"

namespace platform::tandry {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

class HungMountTest : public RegistryTest {
  protected:
    void SetUp() override {
        if (!test::HungMount::isPossible()) GTEST_SKIP() << "only root mounts what hangs";
        watching.quiet = 20ms;
        watching.longest = 40ms;
        watching.retry = watching.patience = 200ms;
        writePlist("home/zorvan/SDKs/point.plist", {{"sdk", true}});
        addPlugIn(apps + "A.app/PlugIns/A.appex", "a", kPoint);
        addPlugIn(apps + "B.app/PlugIns/B.appex", "b");
        addPlugIn("far/F.app/PlugIns/F.appex", "f");
        fs::create_symlink("far", files.path("via"));
        fs::create_symlink(files.path("via/F.app"), files.path(apps + "F.app"));
        start();
        for (const char* name : {"a", "b", "f"}) uuids[name] = plugIn(name)->plugInUuid;
        recorder.take();
    }
    void TearDown() override {
        hung.end();  // before the registry's end, which waits for its threads
        stop();
    }
    void expectKept(std::initializer_list<const char*> names) {
        for (const char* name : names) {
            const auto record = plugIn(name);
            EXPECT_TRUE(record && record->plugInUuid == uuids[name]) << name;
        }
    }

    const Dictionary kPoint{{"VXExtensionAttributes", Dictionary()},
                            {"VXExtensionPointIdentifier", "point"}};
    std::map<std::string, Uuid> uuids;
    test::HungMount hung;
    std::atomic<bool> isHung = false;
};

TEST_F(HungMountTest, WhatLeadsThereStaysAsItIsWhileOthersComeAndGo) {
    // Where only links lead, where all look for defaults, and within an application.
    for (const std::string& place :
         {std::string("far"), std::string("home/zorvan/SDKs"), apps + "B.app/PlugIns"}) {
        SCOPED_TRACE(place);
        ASSERT_TRUE(hung.begin(files.path(place)));
        addPlugIn(apps + "N.app/PlugIns/N.appex", "n");
        EXPECT_THAT(recorder.take(1), ElementsAre("+n"));
        fs::remove_all(files.path(apps + "N.app"));
        EXPECT_THAT(recorder.take(1), ElementsAre("-n"));
        start();
        expectKept({"a", "b", "f"});
        hung.end();
        recorder.take();
    }
}

TEST_F(HungMountTest, AWalkIsGivenUpInItsMidst) {
    ErrorLines errors;
    onMerge = [&] {
        if (isHung.exchange(true)) return;
        EXPECT_TRUE(hung.begin(files.path(apps + "B.app")));
    };
    settle();  // the threads that walk see it
    addPlugIn(apps + "B.app/PlugIns/B.appex", "b", {}, {{"changed", true}});
    addPlugIn(apps + "A.app/PlugIns/A.appex", "a", kPoint, {{"changed", true}});
    EXPECT_THAT(recorder.take(2), ElementsAre("-a", "+a"));
    expectKept({"b", "f"});
    EXPECT_EQ(registerPlugIn(files.path(apps + "B.app"))->code, ETIMEDOUT);
    hung.end();
    EXPECT_THAT(recorder.take(2), ElementsAre("-b", "+b"));
    expectKept({"f"});
    EXPECT_THAT(errors.lines, testing::Contains(HasSubstr("giving up a walk")).Times(1));
}

}  // namespace
}  // namespace platform::tandry
