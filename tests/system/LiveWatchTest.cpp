// Applications that come, change and go while the daemon runs.

#include <fcntl.h>
#include <stdio.h>

#include <algorithm>
#include <chrono>
#include <csignal>
#include <filesystem>

#include "tests/system/SystemTest.h"

namespace test {

namespace {

namespace fs = std::filesystem;
using testing::ElementsAre;
using testing::IsEmpty;
using Clock = std::chrono::steady_clock;

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr int kSlowness = 10;
#else
constexpr int kSlowness = 1;
#endif

class LiveWatch : public SystemTest {
  protected:
    fs::path at(const std::string& relative) const { return home_.path(relative); }

    /// Waits until a match finds just these, and notes how long it took.
    void expectSoon(const std::vector<std::string>& plugIns, const std::string& step) {
        const auto changed = Clock::now();
        EXPECT_TRUE(waitUntil([&] { return match() == plugIns; })) << step;
        delays_.push_back(Clock::now() - changed);
    }
    /// A busy machine may delay one step, but not half of them.
    void expectHalfASecond() {
        std::ranges::sort(delays_);
        EXPECT_LT(delays_.at(delays_.size() / 2), kSlowness * std::chrono::milliseconds(500));
        delays_.clear();
    }
    std::string uuidOf(const std::string& identifier) {
        const auto found = forms({{"VXExtensionIdentifier", identifier}});
        return found.size() == 1 ? found[0].find("uuid")->string()->string() : "";
    }

    std::vector<Clock::duration> delays_;
};

TEST_F(LiveWatch, MatchesFollowTheDisk) {
    start();
    EXPECT_THAT(match(), IsEmpty());
    writePlugIn("new/A.app/PlugIns/one.appex", info("one"));
    writePlugIn("new/A.app/PlugIns/two.appex", info("two"));
    fs::create_directories(at(kApps));
    fs::copy(at("new/A.app"), at(kApps) / "A.app", fs::copy_options::recursive);
    expectSoon({"one 1", "two 1"}, "copied in");
    const std::string one = uuidOf("one"), two = uuidOf("two");

    writePlugIn("newer/one.appex", info("one", "2"));
    fs::rename(at("newer/one.appex/Info.plist"), at(plugInPath("A", "one")) / "Info.plist");
    expectSoon({"one 2", "two 1"}, "a file replaced by rename");
    EXPECT_NE(uuidOf("one"), one);
    EXPECT_EQ(uuidOf("two"), two);
    writePlugIn("newer/two.appex", info("two", "2"));
    fs::rename(at(plugInPath("A", "two")), at("old-two"));
    fs::rename(at("newer/two.appex"), at(plugInPath("A", "two")));
    expectSoon({"one 2", "two 2"}, "a bundle replaced by rename");

    home_.write(kApps + std::string("A.app/.placeholder"), "");
    expectSoon({}, "a placeholder");
    fs::remove(at(kApps) / "A.app/.placeholder");
    expectSoon({"one 2", "two 2"}, "no placeholder any more");

    // As package managers do it: under another name at first, one file after another.
    const std::string unpacked = kApps + std::string(".B.app.unpacking");
    writePlugIn(unpacked + "/PlugIns/three.appex", info("three"));
    fs::rename(at(unpacked), at(kApps) / "B.app");
    expectSoon({"one 2", "three 1", "two 2"}, "renamed into place");
    for (const char* name : {"three", "four", "five"})
        writePlugIn(plugInPath("B", name), info(name, "4"));
    home_.write(plugInPath("B", "five") + "/Info.plist.new", "unfinished");
    expectSoon({"five 4", "four 4", "one 2", "three 4", "two 2"}, "written in place");

    fs::rename(at(kApps) / "B.app", at(kApps) / "C.app");
    fs::remove_all(at(plugInPath("C", "four")));
    fs::remove_all(at(plugInPath("A", "one")));
    expectSoon({"five 4", "three 4", "two 2"}, "renamed and removed");
    EXPECT_EQ(*forms({{"VXExtensionIdentifier", "five"}}).at(0).find("path"),
              Value(home_.path(plugInPath("C", "five"))));
    fs::remove_all(at(kApps) / "A.app");
    expectSoon({"five 4", "three 4"}, "an application removed");
    fs::rename(at("data/zorvan"), at("data/away"));
    expectSoon({}, "the directory above renamed");
    fs::rename(at("data/away"), at("data/zorvan"));
    expectSoon({"five 4", "three 4"}, "and back");
    expectHalfASecond();

    const std::string five = uuidOf("five");
    // Matches see a change just before it is stored; the answer to a registration comes after.
    EXPECT_EQ(add({home_.path(plugInPath("C", "five"))}), "");
    stop(SIGTERM);
    start();
    EXPECT_EQ(uuidOf("five"), five);
}

TEST_F(LiveWatch, NothingOutsideTheBundlesStopsIt) {
    writePlugIn(plugInPath("A", "one"), info("one"));
    start();
    EXPECT_THAT(match(), ElementsAre("one 1"));
    // At once: the daemon makes anew what is missing.
    const std::string obstacle = home_.write("obstacle", "in the way");
    ASSERT_EQ(::renameat2(AT_FDCWD, obstacle.c_str(), AT_FDCWD,
                          at("data/zorvan/Containers").c_str(), RENAME_EXCHANGE),
              0);
    fs::remove(at("data/zorvan/Tandry.db"));
    writePlugIn(plugInPath("A", "one"), info("one", "2"));
    fs::create_symlink("loop.app", at(kApps) / "loop.app");
    EXPECT_TRUE(waitUntil([&] { return zrd_->errLines("loop.app") == 1; }));
    fs::remove(at("data/zorvan/Containers"));
    writePlugIn(plugInPath("A", "two"), info("two"));
    EXPECT_TRUE(waitUntil([&] { return !uuidOf("two").empty(); })) << zrd_->err();
    EXPECT_EQ(zrd_->errLines("loop.app"), 1u);
}

}  // namespace

}  // namespace test
