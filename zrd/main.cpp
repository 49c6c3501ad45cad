#include <cstdlib>
#include <functional>
#include <utility>

#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "Zorvan/ZRPlugInCore.h"
#include "platform/Services.h"
#include "platform/lum/ServiceSocket.h"
#include "platform/services/Preferences.h"
#include "platform/system/Process.h"
#include "platform/tandry/DiskWorkspace.h"
#include "platform/threads/TerminationWatch.h"
#include "zrd/CommandLine.h"
#include "zrd/ZRDServer.h"

namespace {

/// What the administrator says of the limits of plug-ins, read afresh.
platform::LauncherSettings limits(const platform::Directories& directories) {
    return [preferences = std::make_shared<platform::Preferences>(directories)](const auto& key) {
        preferences->synchronize(zorvan::kLimitPreferences);
        return preferences->value(zorvan::kLimitPreferences, key);
    };
}

/// The services of this machine. Without a registry the server cannot be constructed. `failed` is
/// the launcher's.
platform::Services diskServices(const std::string& serviceName,
                                std::shared_ptr<platform::RunLoop> mainLoop,
                                std::function<void()> failed) {
    platform::Services services;
    services.directories = platform::Directories::fromEnvironment();
    services.mainLoop = std::move(mainLoop);
    // First, while there are no other threads: these fork.
    services.launcher = platform::makeLauncher(services.directories, serviceName, services.mainLoop,
                                               limits(services.directories), std::move(failed));
    services.sandbox =
        platform::makeKernelSandbox(services.directories, serviceName, *services.mainLoop);
    services.looks = std::make_shared<platform::PeerLooks>(*services.mainLoop);
    services.pathLooks = std::make_shared<platform::PeerLooks>(*services.mainLoop);
    services.bundleLooks = std::make_shared<platform::PlaceLooks>(*services.mainLoop);
    services.codeSigning = platform::makeFileCodeSigning();
    services.assertions = platform::makeFileAssertions(services.directories);
    services.consent = platform::makeFileConsent(services.directories);
    services.notifications = platform::makeFileNotifications(services.directories);
    services.types = platform::makeMimeTypes(services.directories);
    services.sdks = std::make_shared<platform::SdkDictionaries>(services.directories);
    auto workspace = platform::tandry::openDiskWorkspace(services.directories, *services.sdks,
                                                         &zorvan::ZRPlugInCore::mergeDictionary);
    if (workspace) {
        services.workspace = std::move(*workspace);
    } else {
        EVLOG_ERROR(zorvan::ops(), "cannot open the application registry: {}",
                    platform::pub(workspace.error()));
    }
    return services;
}

/// What is on disk is whole at any moment. A request that a slow disk holds up must not hold up the
/// end as well, so nothing else is waited for.
[[noreturn]] void leave(const platform::Services& services, int status) {
    platform::lum::removeServiceSockets();
    services.notifications->finish();
    std::_Exit(status);
}

}  // namespace

int main(int argc, char* argv[]) {
    platform::openStandardDescriptors();
    // Before the first line: nobody may be reading it.
    platform::prepareDaemonProcess();
    EVLOG_INFO(zorvan::ops(), "zrd is launching");
    auto options = zorvan::CommandLine::parse(argc, argv);
    if (!options) return 2;
    const auto mainLoop = std::make_shared<platform::RunLoop>();
    platform::Services services;
    // Before there are other threads; heard once the loop runs.
    const platform::TerminationWatch termination(
        *mainLoop, [&] { services.launcher->shutDown([&] { mainLoop->stop(); }); });
    services = diskServices(options->serviceName, mainLoop, [&] {
        // For whoever starts the daemon anew.
        services.launcher->shutDown([&] { leave(services, EXIT_FAILURE); });
    });
    auto server =
        zorvan::ZRDServer::initForService(options->serviceName, options->databasePath, services);
    if (!server) {
        EVLOG_ERROR(zorvan::ops(), "unable to construct server");
        return 1;
    }
    server->setVerbose(options->verbose);
    server->setCacheLimit(options->cacheLimit);
    mainLoop->post(platform::notifyServiceManagerReady);
    // What an earlier daemon held is free, and a crash may have kept its last posts from being
    // written.
    server->notifyAnnotationChange();
    server->run();
    leave(services, EXIT_SUCCESS);
}
