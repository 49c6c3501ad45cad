#include "zrd/ZRDLumClient.h"

#include <fmt/format.h>

#include "Zorvan/LogHandles.h"
#include "platform/sandbox/Sandbox.h"
#include "zrd/Probes.h"
#include "zrd/RequestPaths.h"
#include "zrd/Transaction.h"
#include "zrd/ZRDServer.h"

namespace zorvan {

using platform::ConnectionError;
using platform::Message;
using platform::Value;

namespace {

constexpr std::uint32_t kRequestCountReportInterval = 1000;

}  // namespace

ZRDLumClient::ZRDLumClient(const std::shared_ptr<platform::Connection>& connection,
                           std::shared_ptr<ZRDServer> server, HostExecutable executable)
    : connection_(connection), server_(std::move(server)), executable_(std::move(executable)) {}

std::shared_ptr<ZRDLumClient> ZRDLumClient::initWithConnection(
    const std::shared_ptr<platform::Connection>& connection, std::shared_ptr<ZRDServer> server,
    HostExecutable executable) {
    std::shared_ptr<ZRDLumClient> client(
        new ZRDLumClient(connection, std::move(server), std::move(executable)));
    EVLOG_DEBUG(ops(), "new client {} {}", client->pid(), client->path());
    probes::clientNew(client->pid());
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

platform::Origin ZRDLumClient::origin() const {
    auto connection = connection_.lock();
    return connection ? connection->origin() : platform::Origin();
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
    if (transaction->paths()) return resolvePaths(transaction);
    submit(std::move(transaction));
}

/// Its next request comes only after this one, so that it is the only one to wait.
void ZRDLumClient::resolvePaths(const std::shared_ptr<Transaction>& transaction) {
    auto client = shared_from_this();
    auto connection = connection_.lock();
    if (!connection) return;  // nobody is there to be answered
    server_->services().pathLooks->look(
        connection->origin(),
        [client, paths = transaction->paths()](platform::PeerLooks::Pace& pace) {
            paths->resolve(pace, [&] { return client->acceptWork(); });
        },
        [client, transaction](bool, std::size_t resolved) {
            transaction->paths()->settle(resolved);
            client->submit(transaction);
        });
}

void ZRDLumClient::submit(std::shared_ptr<Transaction> transaction) {
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
    auto answer = executable_.task->entitlement(name);
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
                       connection->description(), connection->pid(), path());
}

}  // namespace zorvan
