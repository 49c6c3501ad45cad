#include "zrd/ZRDLumClient.h"

#include <fmt/format.h>

#include "Zorvan/LogHandles.h"
#include "platform/sandbox/Sandbox.h"
#include "zrd/Probes.h"
#include "zrd/Transaction.h"
#include "zrd/ZRDServer.h"

namespace zorvan {

using platform::ConnectionError;
using platform::Message;
using platform::Value;

namespace {

/// Longer executable paths count as not found.
constexpr std::size_t kMaxExecutablePath = 2048;
constexpr std::uint32_t kRequestCountReportInterval = 1000;

}  // namespace

ZRDLumClient::ZRDLumClient(const std::shared_ptr<platform::Connection>& connection,
                           std::shared_ptr<ZRDServer> server)
    : connection_(connection), server_(std::move(server)) {}

std::shared_ptr<ZRDLumClient> ZRDLumClient::initWithConnection(
    const std::shared_ptr<platform::Connection>& connection, std::shared_ptr<ZRDServer> server) {
    std::shared_ptr<ZRDLumClient> client(new ZRDLumClient(connection, std::move(server)));
    const platform::AuditToken& token = connection->auditToken();
    const auto& path = token.executablePath();
    if (path && path->size() < kMaxExecutablePath) {
        client->bundle_ = ZRBundle::initWithExecutablePath(*path);
        client->path_ = *path;
    }
    EVLOG_DEBUG(ops(), "new client {} {}", client->pid(), client->path_);
    probes::clientNew(client->pid());
    client->task_ = client->server_->services().codeSigning->makeTask(token);
    connection->setContext(client);
    connection->setEventHandler(
        [client](const platform::ConnectionEvent& event) { client->handleEvent(event); });
    connection->resume();
    return client;
}

pid_t ZRDLumClient::pid() const {
    auto connection = connection_.lock();
    return connection ? connection->pid() : 0;
}

std::optional<platform::AuditToken> ZRDLumClient::auditToken() const {
    auto connection = connection_.lock();
    return connection ? std::optional(connection->auditToken()) : std::nullopt;
}

void ZRDLumClient::handleEvent(const platform::ConnectionEvent& event) {
    if (const auto* message = std::get_if<Message>(&event)) {
        receive(*message);
    } else if (const auto* error = std::get_if<ConnectionError>(&event)) {
        switch (error->kind) {
            case ConnectionError::Kind::Invalid:
                dead();
                break;
            case ConnectionError::Kind::TerminationImminent:
                dying();
                break;
            default:
                EVLOG_ERROR(ops(), "unexpected error type from lum: {}", pub(*error));
        }
    } else {
        EVLOG_ERROR(ops(), "unexpected message: {} from: {}",
                    pub(std::get<platform::UnknownObject>(event)), pid());
    }
}

void ZRDLumClient::receive(const Message& message) {
    if (probes::requestInputEnabled()) probes::requestInput(pid(), describe(message).c_str());
    auto transaction = std::make_shared<Transaction>(message, shared_from_this());
    server_->submitWork([client = shared_from_this(), transaction = std::move(transaction)] {
        client->countRequest();
        transaction->dispatch();
    });
}

void ZRDLumClient::countRequest() {
    server_->mainQueue().assertCurrent();
    if (++requestCount_ % kRequestCountReportInterval == 0) {
        EVLOG_DEBUG(ops(), "client {} used {} requests so far", pid(), requestCount_);
    }
}

void ZRDLumClient::dying() {
    EVLOG_DEBUG(ops(), "client {} termination imminent", pid());
}

void ZRDLumClient::dead() {
    server_->unholdClient(*this);
    EVLOG_DEBUG(ops(), "client {} is dead", pid());
    setAcceptWork(false);
    // A hold that was being taken meanwhile is found here, or by its taker, who looks afterwards.
    server_->unholdClient(*this);
    probes::clientDone(pid());
}

std::optional<Value> ZRDLumClient::entitlementValueForKey(const std::string& name) const {
    auto answer = task_->entitlement(name);
    if (answer.error) EVLOG_ERROR(ops(), "error retrieving entitlements for client {}", pid());
    return answer.value;
}

bool ZRDLumClient::hasEntitlement(const std::string& name) const {
    auto value = entitlementValueForKey(name);
    return value && !platform::equalsFalse(*value);
}

bool ZRDLumClient::isSandboxed() const {
    auto connection = connection_.lock();
    return !connection || server_->services().sandbox->isSandboxed(connection->auditToken());
}

bool ZRDLumClient::isConfined() const {
    auto connection = connection_.lock();
    return !connection || server_->services().sandbox->isConfined(connection->auditToken());
}

std::string ZRDLumClient::description() const {
    const auto* address = static_cast<const void*>(this);
    auto connection = connection_.lock();
    if (!connection) return fmt::format("<ZRDLumClient {} NO CONNECTION>", address);
    return fmt::format("<ZRDLumClient {} con={} pid={} path={}>", address,
                       connection->description(), connection->pid(), path_);
}

}  // namespace zorvan
