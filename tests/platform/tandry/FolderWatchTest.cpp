#include "platform/tandry/FolderWatch.h"

#include <sys/stat.h>

#include <filesystem>
#include <fstream>

#include "tests/platform/tandry/RegistryFixture.h"

namespace platform::tandry {
namespace {

namespace fs = std::filesystem;

Touches::value_type inWhole(const std::string& scope) {
    return {scope, true};
}

Touches::value_type inPieces(const std::string& scope) {
    return {scope, false};
}

class FolderWatchTest : public testing::Test {
  protected:
    test::TemporaryDirectory files;
};

TEST_F(FolderWatchTest, TellsWhatWasTouched) {
    const std::string folder = files.makeDirectory("folder");
    const std::string bundle = files.makeDirectory("folder/A.app");
    FolderWatch watch;
    watch.beginWalk(true);
    watch.markEntries(folder, ".app");
    watch.markContents(bundle, "the bundle");
    watch.endWalk();
    EXPECT_THAT(watch.takeTouched(), IsEmpty());

    files.write("folder/A.app/Info.plist", "x");
    EXPECT_THAT(watch.takeTouched(), ElementsAre(inPieces("the bundle")));
    // A writer may keep its file open for ever.
    std::ofstream open(bundle + "/Info.plist");
    open << "y" << std::flush;
    EXPECT_THAT(watch.takeTouched(), ElementsAre(inPieces("the bundle")));
    files.makeDirectory("folder/.B.app.tmp");
    EXPECT_THAT(watch.takeTouched(), IsEmpty());
    fs::rename(files.path("folder/.B.app.tmp"), files.path("folder/B.app"));
    EXPECT_THAT(watch.takeTouched(), ElementsAre(inWhole(folder + "/B.app")));
    fs::rename(bundle, files.path("folder/C.app"));
    EXPECT_THAT(watch.takeTouched(),
                ElementsAre(inPieces(folder + "/A.app"), inWhole(folder + "/C.app"),
                            inPieces("the bundle")));
    // What happens last to a scope counts.
    fs::rename(files.path("folder/B.app"), files.path("old"));
    fs::rename(files.path("folder/C.app"), files.path("folder/B.app"));
    fs::rename(files.path("folder/B.app"), files.path("folder/C.app"));
    EXPECT_THAT(watch.takeTouched(),
                ElementsAre(inPieces(folder + "/B.app"), inWhole(folder + "/C.app"),
                            inPieces("the bundle")));
    fs::rename(folder, files.path("elsewhere"));
    EXPECT_THAT(watch.takeTouched(), ElementsAre(inPieces("")));
}

TEST_F(FolderWatchTest, AWayIsFollowedThroughMissingFoldersAndLinks) {
    files.makeDirectory("one/target");
    fs::create_symlink("one", files.path("link"));
    fs::create_symlink("link/target/late/later", files.path("start"));
    FolderWatch watch;
    auto changesAfter = [&](const auto& change) {
        watch.beginWalk(true);
        watch.markWay(files.path("start/end"));
        watch.releaseUnmarked({});
        watch.endWalk();
        watch.takeTouched();
        files.write("bustle", "x");
        if (fs::exists(files.path("one"))) files.write("one/bustle", "x");
        EXPECT_THAT(watch.takeTouched(), IsEmpty());
        change();
        return watch.takeTouched() == Touches{inPieces("")};
    };
    const fs::path target = files.path("one/target");
    EXPECT_TRUE(changesAfter([&] { fs::create_directory(target / "late"); }));
    EXPECT_TRUE(changesAfter([&] { fs::create_directories(target / "late/later/end"); }));
    EXPECT_TRUE(changesAfter([&] { fs::rename(target, files.path("one/away")); }));
    EXPECT_TRUE(changesAfter([&] { fs::rename(files.path("one/away"), target); }));
    EXPECT_TRUE(changesAfter([&] { fs::rename(files.path("one"), files.path("two")); }));
    EXPECT_TRUE(changesAfter([&] {
        fs::create_symlink("two", files.path("new-link"));
        fs::rename(files.path("new-link"), files.path("link"));
    }));
    EXPECT_TRUE(changesAfter([&] { fs::remove_all(files.path("two/target/late/later")); }));
    fs::create_symlink("loop", files.path("loop"));
    watch.beginWalk(true);
    watch.markWay(files.path("loop/x"));
}

TEST_F(FolderWatchTest, AnOverflowTouchesEverything) {
    const std::string folder = files.makeDirectory("folder");
    const std::string a = files.write("folder/a", "");
    const std::string b = files.write("folder/b", "");
    FolderWatch watch;
    watch.beginWalk(true);
    watch.markContents(folder, "folder");
    int most = 0;
    std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> most;
    // Equal events in a row count once.
    for (int i = 0; i <= most / 2; ++i)
        for (const std::string& file : {a, b}) ::chmod(file.c_str(), 0600);
    Touches touched;
    for (Touches next = watch.takeTouched(); !next.empty(); next = watch.takeTouched())
        touched.merge(next);
    EXPECT_THAT(touched, ElementsAre(inPieces(""), inPieces("folder")));
    files.write("folder/c", "");
    EXPECT_THAT(watch.takeTouched(), ElementsAre(inPieces("folder")));
}

}  // namespace
}  // namespace platform::tandry
