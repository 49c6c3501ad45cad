#include <filesystem>

#include "tests/platform/tandry/RegistryFixture.h"

namespace platform::tandry {
namespace {

namespace fs = std::filesystem;

TEST_F(RegistryTest, RegistersByPathAcrossRestarts) {
    const std::string loose = addPlugIn("opt/Loose.appex", "loose");
    const std::string app = addApplication("opt/App.app");
    const std::string inside = addPlugIn("opt/App.app/PlugIns/A.appex", "a");
    addPlugIn("opt/App.app/PlugIns/B.appex", "b");
    files.makeDirectory("opt/App.app/PlugIns/Broken.appex");
    start();
    EXPECT_EQ(workspace->registerPlugIn(loose), std::nullopt);
    EXPECT_EQ(workspace->registerPlugIn(inside), std::nullopt);
    EXPECT_THAT(recorder.take(), ElementsAre("+loose", "+a"));
    EXPECT_EQ(plugIn("a")->containingApplication, workspace->applicationAtPath(app));
    const Uuid uuid = plugIn("a")->plugInUuid;
    EXPECT_EQ(workspace->registerPlugIn(app), std::nullopt);
    EXPECT_THAT(recorder.take(), ElementsAre("+b"));
    start();
    EXPECT_THAT(installed(), ElementsAre("a", "b", "loose"));
    EXPECT_THAT(recorder.take(), IsEmpty());
    EXPECT_EQ(plugIn("a")->plugInUuid, uuid);

    addPlugIn("opt/App.app/PlugIns/B.appex", "b", {}, {{"changed", true}});
    EXPECT_EQ(workspace->registerPlugIn(app), std::nullopt);
    EXPECT_THAT(recorder.take(), ElementsAre("-b", "+b"));
    EXPECT_EQ(plugIn("a")->plugInUuid, uuid);

    EXPECT_TRUE(workspace->unregisterPlugIn(files.path("opt")));
    EXPECT_EQ(workspace->unregisterPlugIn(app), std::nullopt);
    EXPECT_THAT(recorder.take(), ElementsAre("-a", "-b"));
    EXPECT_EQ(workspace->applicationAtPath(app), nullptr);
    EXPECT_TRUE(workspace->unregisterPlugIn(app));
    fs::remove_all(loose);
    EXPECT_EQ(workspace->unregisterPlugIn(loose), std::nullopt);
    start();
    EXPECT_THAT(installed(), IsEmpty());
    EXPECT_THAT(recorder.take(), ElementsAre("-loose"));
}

TEST_F(RegistryTest, RefusesWithTheReason) {
    start();
    const std::string broken = files.path("opt/Broken.appex");
    files.write("opt/Broken.appex/Info.plist", "broken");
    addApplication("opt/Empty.app");
    for (const std::string& path : {broken, files.path("opt/Empty.app"), files.path("missing"),
                                    files.path("opt/Broken.appex/Info.plist")}) {
        std::optional<Error> error = workspace->registerPlugIn(path);
        ASSERT_TRUE(error) << path;
        EXPECT_THAT(error->text, HasSubstr(path));
        EXPECT_TRUE(workspace->unregisterPlugIn(path)) << path;
    }
    addPlugIn("opt/Broken.appex", "mended");
    EXPECT_EQ(workspace->registerPlugIn(broken), std::nullopt);
    // A registered bundle that breaks goes; mended, it is back without another registration.
    files.write("opt/Broken.appex/Info.plist", "");
    EXPECT_TRUE(workspace->registerPlugIn(broken));
    EXPECT_THAT(recorder.take(), ElementsAre("+mended", "-mended"));
    addPlugIn("opt/Broken.appex", "mended");
    start();
    EXPECT_THAT(installed(), ElementsAre("mended"));
}

TEST_F(RegistryTest, AnUnregisteredBundleStaysForgottenUntilItChanges) {
    addApplication(apps + "A.app");
    const std::string a = addPlugIn(apps + "A.app/PlugIns/A.appex", "a");
    addPlugIn(apps + "A.app/PlugIns/B.appex", "b");
    const std::string app = files.path(apps + "A.app");
    start();
    EXPECT_EQ(workspace->unregisterPlugIn(a), std::nullopt);
    EXPECT_TRUE(workspace->unregisterPlugIn(a));
    start();
    EXPECT_THAT(installed(), ElementsAre("b"));
    EXPECT_EQ(workspace->registerPlugIn(a), std::nullopt);
    EXPECT_THAT(installed(), ElementsAre("a", "b"));

    // Edited, and then removed without a scan in between.
    addPlugIn(apps + "A.app/PlugIns/A.appex", "a", {}, {{"edited", true}});
    EXPECT_EQ(workspace->unregisterPlugIn(app), std::nullopt);
    start();
    EXPECT_THAT(installed(), IsEmpty());
    EXPECT_TRUE(workspace->applicationAtPath(app));
    addPlugIn(apps + "A.app/PlugIns/A.appex", "a", {}, {{"edited", "again"}});
    start();
    EXPECT_THAT(installed(), ElementsAre("a"));
    EXPECT_EQ(workspace->registerPlugIn(app), std::nullopt);
    EXPECT_THAT(installed(), ElementsAre("a", "b"));
}

}  // namespace
}  // namespace platform::tandry
