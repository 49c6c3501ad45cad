#include "zrd/ZRDServer.h"

#include <mutex>

#include "Zorvan/LogHandles.h"
#include "platform/threads/RunLoop.h"
#include "zrd/HostExecutable.h"
#include "zrd/ZRDLumClient.h"

namespace zorvan {

namespace {

std::mutex serverMutex;  // guards theServer

std::shared_ptr<ZRDServer>& theServer() {
    static std::shared_ptr<ZRDServer> server;
    return server;
}

void reportTermination(platform::Launcher::Status status) {
    using platform::Launcher;
    if (status == Launcher::kDone) {
        EVLOG_DEBUG(ops(), "spawnerd reported plug-ins have been terminated");
    } else if (status == Launcher::kNoneOnRecord) {
        EVLOG_DEBUG(ops(), "spawnerd reported no plug-ins on record");
    } else {
        EVLOG_INFO(ops(), "spawnerd error attempting to terminate plug-ins: error={}", status);
    }
}

}  // namespace

ZRDServer::ZRDServer(const platform::Services& services)
    : ZRDatabase(services),
      lumQueue_("lum", *services.mainLoop),
      mainQueue_("service"),
      registrations_("registration") {}

ZRDServer::~ZRDServer() = default;

std::shared_ptr<ZRDServer> ZRDServer::initForService(const std::string& serviceName,
                                                     const std::optional<std::string>& databasePath,
                                                     const platform::Services& services) {
    std::shared_ptr<ZRDServer> server(new ZRDServer(services));
    if (!server->initWithDatabase(databasePath, server)) return nullptr;
    if (!server->listen(serviceName)) return nullptr;
    {
        std::lock_guard lock(serverMutex);
        theServer() = server;
    }
    server->setDelegate(server);
    server->service_->setEventHandler(
        [weak = std::weak_ptr(server)](const std::shared_ptr<platform::Connection>& connection) {
            if (auto self = weak.lock()) self->admit(connection);
        });
    server->userPrefs_ = std::make_unique<ZRDUserPrefs>(server->services().directories);
    // From here on what the scan announces finds a complete server.
    server->workspace().activate();
    return server;
}

bool ZRDServer::listen(const std::string& serviceName) {
    auto listener = platform::Listener::make(services().directories, serviceName, lumQueue_);
    if (!listener) {
        EVLOG_ERROR(ops(), "cannot listen on service {}: {}", pub(serviceName),
                    pub(listener.error()));
        return false;
    }
    service_ = std::move(*listener);
    return true;
}

/// Nothing is heard of the connection before: it is resumed once its record is there.
void ZRDServer::admit(const std::shared_ptr<platform::Connection>& connection) {
    HostExecutable::find(*connection, services().codeSigning, *services().looks,
                         [weak = weak_from_this(), connection](HostExecutable executable) {
                             if (auto self = weak.lock())
                                 ZRDLumClient::initWithConnection(connection, self,
                                                                  std::move(executable));
                         });
}

std::shared_ptr<ZRDServer> ZRDServer::server() {
    std::lock_guard lock(serverMutex);
    return theServer();
}

void ZRDServer::removedPlugIns(const platform::TDPlugInProxyList& plugIns) {
    for (const auto& proxy : plugIns) {
        EVLOG_DEBUG(ops(), "requesting spawnerd termination of plug-in: {}({}) {}",
                    proxy->bundleIdentifier, proxy->bundleVersion, pub(proxy->plugInUuid));
        const platform::KnownDirectory bundle{proxy->bundlePath.value_or(""),
                                              proxy->bundleIdentity};
        services().launcher->terminatePlugInInstances(proxy->bundleIdentifier, proxy->bundleVersion,
                                                      bundle, mainQueue_, reportTermination);
    }
}

void ZRDServer::run() {
    service_->resume();
    services().mainLoop->run();
}

}  // namespace zorvan
