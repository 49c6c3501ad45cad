#include "zrd/ZRDServer.h"

#include "tests/zrd/TransactionTest.h"

namespace zorvan {

namespace {

using testing::ElementsAre;
using testing::IsEmpty;

using ZRDServerTest = TransactionTest;

TEST_F(ZRDServerTest, TheLauncherEndsInstancesOfRemovedPlugIns) {
    workspace_->installed = {makeProxy("com.a"), makeProxy("com.b")};
    auto removed = std::make_shared<platform::TDPlugInProxy>(*workspace_->installed[0]);
    removed->bundleIdentifier = "bundle.a";
    removed->bundleVersion = "7";
    removed->bundleIdentity = {3, 5};
    launcher_->statuses = {0, 3, 22};
    LogLines log;
    workspace_->observer->pluginsWillUninstall({});
    EXPECT_THAT(log.take(), IsEmpty());
    workspace_->observer->pluginsWillUninstall({removed, removed, workspace_->installed[1]});
    drain();
    EXPECT_THAT(launcher_->terminated, ElementsAre("bundle.a 7", "bundle.a 7", " "));
    EXPECT_EQ(launcher_->terminatedBundles.at(0),
              (platform::KnownDirectory{*removed->bundlePath, {3, 5}}));
    auto lines = log.take();
    std::erase_if(
        lines, [](const std::string& line) { return line.find("spawnerd") == std::string::npos; });
    const std::string request = "ops D: requesting spawnerd termination of plug-in: ";
    EXPECT_THAT(lines, testing::IsSupersetOf(
                           {request + "bundle.a(7) " + removed->plugInUuid.string(),
                            request + "() " + workspace_->installed[1]->plugInUuid.string(),
                            std::string("ops D: spawnerd reported plug-ins have been terminated"),
                            std::string("ops D: spawnerd reported no plug-ins on record"),
                            std::string("ops I: spawnerd error attempting to terminate plug-ins: "
                                        "error=22")}));
}

}  // namespace

}  // namespace zorvan
