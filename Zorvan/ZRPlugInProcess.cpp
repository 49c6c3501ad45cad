#include "Zorvan/ZRPlugInProcess.h"

#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <future>
#include <mutex>
#include <utility>
#include <variant>

#include "Zorvan/Keys.h"
#include "Zorvan/ZRPlugInCore.h"
#include "platform/lum/ClientConnection.h"
#include "platform/spawnerd/Protocol.h"
#include "platform/system/Directories.h"
#include "platform/system/Files.h"
#include "platform/threads/SerialQueue.h"

namespace zorvan {

using platform::ClientConnection;
using platform::Message;
using platform::Value;
namespace spawnerd = platform::spawnerd;

namespace {

/// How long the end of an object waits for its plug-in's.
constexpr std::chrono::seconds kPatience{5};

ZRError posixError(int errnum, const std::string& what) {
    const auto error = platform::Error::posix(errnum, what);
    return ZRError{error.domain, error.code, error.text};
}

/// Why the launcher did not do what it was asked, or none.
std::optional<ZRError> errorIn(const ClientConnection::Reply& reply) {
    if (const auto* broken = std::get_if<platform::ConnectionError>(&reply))
        return ZRErrorWithCode(kZRErrorInvalidRequest, describe(*broken));
    const auto& message = std::get<Message>(reply);
    const Value* code = message.find(spawnerd::kErrorCode);
    if (!code) return std::nullopt;
    const Value* text = message.find(spawnerd::kError);
    return ZRError{"POSIX", static_cast<int>(code->numberAsInteger().value_or(EPROTO)),
                   text && text->string() ? std::optional(text->string()->string()) : std::nullopt};
}

std::optional<int> statusIn(const ClientConnection::Reply& reply) {
    const auto* message = std::get_if<Message>(&reply);
    const Value* status = message ? message->find(spawnerd::kStatus) : nullptr;
    const auto number = status ? status->unsignedInteger() : std::nullopt;
    return number ? std::optional(static_cast<int>(*number)) : std::nullopt;
}

Message requestOf(const char* type) {
    return Message(platform::Dictionary{{spawnerd::kRequest, type}});
}

}  // namespace

struct ZRPlugInProcess::State {
    explicit State(const std::string& service)
        : connection(platform::Directories::fromEnvironment(), spawnerd::serviceNameFor(service),
                     queue) {}

    std::uint64_t instance = 0;  // set by `start`

    std::mutex mutex;
    std::condition_variable change;
    // Guarded by the mutex.
    bool hasEnded = false;
    std::optional<int> status;
    EndHandler handler;

    // The connection goes before the queue that it delivers on, and that before what is used there.
    platform::SerialQueue queue{"zrd_plugin"};
    ClientConnection connection;

    /// On the queue.
    void end(std::optional<int> endStatus) {
        EndHandler called;
        {
            const std::lock_guard lock(mutex);
            hasEnded = true;
            status = endStatus;
            called = std::exchange(handler, nullptr);
        }
        change.notify_all();
        if (called) called(endStatus);
    }
};

ZRPlugInProcess::ZRPlugInProcess(const char* serviceName)
    : state_(std::make_unique<State>(serviceName ? serviceName : kDefaultServiceName)) {}

std::unique_ptr<ZRPlugInProcess> ZRPlugInProcess::start(const char* serviceName,
                                                        const std::string& executable,
                                                        const std::vector<std::string>& arguments,
                                                        std::optional<ZRError>& error) {
    std::unique_ptr<ZRPlugInProcess> process(new ZRPlugInProcess(serviceName));
    error = process->ask(executable, arguments);
    return error ? nullptr : std::move(process);
}

std::unique_ptr<ZRPlugInProcess> ZRPlugInProcess::start(const char* serviceName,
                                                        const ZRPlugInCore& plugIn,
                                                        const std::vector<std::string>& arguments,
                                                        std::optional<ZRError>& error) {
    const auto name = plugIn.infoKey("QFBundleExecutable");
    if (!name || !name->string() || !platform::isSafeName(*name->string())) {
        error = posixError(EINVAL, "the executable of " + plugIn.path());
        return nullptr;
    }
    return start(serviceName, platform::joinPath(plugIn.path(), *name->string()), arguments, error);
}

std::optional<ZRError> ZRPlugInProcess::ask(const std::string& executable,
                                            const std::vector<std::string>& arguments) {
    Message request = requestOf(spawnerd::kStart);
    request.set(spawnerd::kExecutable, executable);
    platform::Array values;
    for (const std::string& argument : arguments) values.append(argument);
    request.set(spawnerd::kArguments, std::move(values));

    std::promise<ClientConnection::Reply> answer;
    state_->connection.resume();
    state_->connection.sendWithReply(
        std::move(request),
        [&answer](const ClientConnection::Reply& reply) { answer.set_value(reply); });
    const ClientConnection::Reply reply = answer.get_future().get();
    auto error = errorIn(reply);
    if (!error) {
        const auto& message = std::get<Message>(reply);
        const Value* instance = message.find(spawnerd::kInstance);
        state_->instance = instance ? instance->unsignedInteger().value_or(0) : 0;
        connection_ = message.takeDescriptor();
        if (!state_->instance || !connection_)
            error = posixError(EPROTO, "the launcher's reply for " + executable);
    }
    if (error) {
        state_->end(std::nullopt);
        return error;
    }
    Message wait = requestOf(spawnerd::kWait);
    wait.set(spawnerd::kInstance, state_->instance);
    state_->connection.sendWithReply(std::move(wait),
                                     [state = state_.get()](const ClientConnection::Reply& ended) {
                                         state->end(statusIn(ended));
                                     });
    return std::nullopt;
}

ZRPlugInProcess::~ZRPlugInProcess() {
    terminate();
    std::unique_lock lock(state_->mutex);
    state_->change.wait_for(lock, kPatience, [this] { return state_->hasEnded; });
}

void ZRPlugInProcess::terminate() {
    {
        const std::lock_guard lock(state_->mutex);
        if (state_->hasEnded) return;
    }
    Message request = requestOf(spawnerd::kTerminate);
    request.set(spawnerd::kInstance, state_->instance);
    // That it is done shows where its end is waited for.
    state_->connection.sendWithReply(std::move(request), [](const auto&) {});
}

std::optional<int> ZRPlugInProcess::wait() {
    std::unique_lock lock(state_->mutex);
    state_->change.wait(lock, [this] { return state_->hasEnded; });
    return state_->status;
}

void ZRPlugInProcess::setEndHandler(EndHandler handler) {
    const std::lock_guard lock(state_->mutex);
    if (!state_->hasEnded) {
        state_->handler = std::move(handler);
    } else if (handler) {
        state_->queue.async(
            [handler = std::move(handler), status = state_->status] { handler(status); });
    }
}

}  // namespace zorvan
