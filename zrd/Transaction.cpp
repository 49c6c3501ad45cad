#include "zrd/Transaction.h"

#include <fmt/format.h>

#include <utility>

#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "platform/lum/Limits.h"
#include "platform/values/Value.h"
#include "zrd/Probes.h"
#include "zrd/RequestPaths.h"
#include "zrd/ZRDLumClient.h"
#include "zrd/ZRDPlugIn.h"
#include "zrd/ZRDServer.h"

namespace zorvan {

using platform::Dictionary;
using platform::Value;

namespace {

bool isTooLong(const platform::Array& list) {
    return list.size() > platform::lum::kMaxListed;
}

std::shared_ptr<RequestPaths> pathsOf(const platform::Message& request) {
    const Value* type = request.find(message::kRequest);
    if (!type || !type->string()) return nullptr;
    const std::string_view name = type->string()->view();
    const Value* tokens = request.find(message::kUuids);
    const bool isLock = name == request::kLock && !(tokens && tokens->array());
    if (name != request::kAdd && name != request::kRemove && !isLock) return nullptr;
    const Value* paths = request.find(message::kPaths);
    if (!paths || !paths->array() || paths->array()->empty() || isTooLong(*paths->array()))
        return nullptr;
    return std::make_shared<RequestPaths>(*paths->array());
}

}  // namespace

Transaction::Transaction(platform::Message request, std::shared_ptr<ZRDLumClient> client)
    : client_(std::move(client)),
      request_(std::move(request)),
      paths_(pathsOf(request_)),
      reply_(platform::Message::replyTo(request_)) {}

ZRDServer& Transaction::server() const {
    return *client_->server();
}

platform::Origin Transaction::origin() const {
    return client_->origin();
}

std::uint64_t Transaction::unsignedUnder(const char* key) const {
    const Value* value = request_.find(key);
    return value ? value->unsignedInteger().value_or(0) : 0;
}

void Transaction::dispatch() {
    struct Entry {
        const char* type;
        void (Transaction::*handler)();
    };
    static constexpr Entry kHandlers[] = {
        {request::kAdd, &Transaction::addPlugIns},
        {request::kRemove, &Transaction::removePlugIns},
        {request::kBulk, &Transaction::bulkPlugIns},
        {request::kMatch, &Transaction::matchPlugIns},
        {request::kReady, &Transaction::readyPlugIns},
        {request::kAccess, &Transaction::accessPlugIns},
        {request::kAnnotate, &Transaction::annotatePlugIns},
        {request::kBulkAnnotate, &Transaction::bulkAnnotatePlugIns},
        {request::kLock, &Transaction::lockDownPlugIns},
    };
    server().mainQueue().assertCurrent();

    const Value* typeValue = request_.find(message::kRequest);
    const auto* type = typeValue ? typeValue->string() : nullptr;
    version_ = unsignedUnder(message::kVersion);
    if (version_ != kProtocolVersion && version_ != kProtocolVersionWithoutForms) {
        return fail(kZRErrorVersion,
                    fmt::format("unsupported protocol version {} (current {})",
                                static_cast<std::int32_t>(version_.load()), kProtocolVersion));
    }
    if (!client_->acceptWork()) return;

    const std::string typeCopy = type ? type->string() : "";
    const char* typeText = type ? typeCopy.c_str() : nullptr;
    EVLOG_DEBUG(ops(), "client {} requested {}", client_->pid(), pub(typeText));
    probes::request(client_->pid(), typeText);
    if (!type) return fail(kZRErrorInvalidRequest, "invalid request format (missing type)");
    for (const auto& [name, handler] : kHandlers) {
        if (*type == name) return (this->*handler)();
    }
    fail(kZRErrorInvalidRequest, "unrecognized request");
}

void Transaction::lookAtBundles(std::vector<platform::PlaceLooks::Look> looks,
                                std::function<void(const std::vector<bool>& done)> then) {
    if (looks.empty()) return then({});
    const auto done = std::make_shared<std::vector<bool>>();
    auto goOn = onServiceQueue([done, then = std::move(then)] { then(*done); });
    server().services().bundleLooks->make(
        std::move(looks), [done, goOn = std::move(goOn)](const std::vector<bool>& found) {
            *done = found;
            goOn();
        });
}

std::function<void()> Transaction::onServiceQueue(std::function<void()> then) {
    return [self = shared_from_this(), then = std::move(then)]() mutable {
        ZRDServer& server = self->server();
        // Handed on, so that nothing of the request goes on the caller's thread.
        server.submitWork([self = std::move(self), then = std::move(then)] { then(); });
    };
}

const platform::Array* Transaction::requestedPaths() {
    const Value* paths = request_.find(message::kPaths);
    if (paths && paths->array() && !isTooLong(*paths->array())) return paths->array();
    fail(kZRErrorInvalidRequest, "invalid request format");
    return nullptr;
}

std::optional<Transaction::NamedPath> Transaction::namedPath(const platform::Array& paths,
                                                             std::size_t index) {
    const auto* text = paths[index].string();
    if (!text) {
        fail(kZRErrorInvalidRequest, "invalid request format");
        return std::nullopt;
    }
    const std::string path = text->string();
    if (!path.starts_with('/')) {
        fail(kZRErrorPath, fmt::format("absolute path required: {}", path));
        return std::nullopt;
    }
    auto resolved = paths_->resolved(index);
    if (!resolved) return NamedPath{path, false};
    return NamedPath{*std::move(resolved), true};
}

bool Transaction::marshalPaths(const std::function<Walk(const NamedPath&)>& callback) {
    const platform::Array* paths = requestedPaths();
    if (!paths) return false;
    for (std::size_t i = 0; i < paths->size(); ++i) {
        const auto path = namedPath(*paths, i);
        if (!path || callback(*path) == Walk::Stop) return false;
    }
    return true;
}

bool Transaction::processUuidList(
    const std::function<Walk(const std::shared_ptr<ZRDPlugIn>&)>& callback, std::size_t first) {
    const Value* uuids = request_.find(message::kUuids);
    if (!uuids || !uuids->array()) {
        fail(kZRErrorInvalidRequest, "invalid request format (uuid)");
        return false;
    }
    if (isTooLong(*uuids->array())) return failForBadUuids();
    for (std::size_t i = first; i < uuids->array()->size(); ++i) {
        auto uuid = (*uuids->array())[i].uuid();
        if (!uuid) return failForBadUuids();
        auto plugIn = server().findPlugIn(*uuid);
        if (!plugIn) {
            fail(kZRErrorInvalidRequest, "no such plugin (uuid not found)");
            return false;
        }
        if (callback(plugIn) == Walk::Stop) return false;
    }
    return true;
}

bool Transaction::failForBadUuids() {
    fail(kZRErrorInvalidRequest, "invalid request (bad uuid array)");
    return false;
}

void Transaction::addAnnotationForPlugIn(const ZRDPlugIn& plugIn, Dictionary& in) const {
    // A form has an empty annotation from its record: left as it is, it keeps its encoded bytes.
    if (auto annotation = server().annotationForPlugIn(plugIn))
        in.set(form::kAnnotations, *std::move(annotation));
}

void Transaction::done() {
    syncAnnotations();
    if (probes::requestOutputEnabled()) {
        probes::requestOutput(client_->pid(), describe(reply_).c_str());
    }
    if (auto connection = client_->connection()) connection->send(reply_);
}

void Transaction::fail(std::int32_t code, const std::string& message) {
    reply_.set(message::kErrorCode, code);
    reply_.set(message::kError, message);
    done();
}

void Transaction::fail(std::int32_t code, const ZRError& error) {
    reply_.set(message::kErrorCode, error.domain == kZRErrorDomain ? error.code : code);
    if (error.description) reply_.set(message::kError, *error.description);
    done();
}

}  // namespace zorvan
