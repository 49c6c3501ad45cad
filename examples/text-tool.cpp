// A text tool that plug-ins extend, as a host's developer would write it.
//
//     text-tool              lists the plug-ins that transform text
//     text-tool IDENTIFIER   sends standard input through one of them, to standard output

#include <fmt/core.h>
#include <sys/socket.h>
#include <unistd.h>

#include <csignal>
#include <future>
#include <thread>

#include "Zorvan/Keys.h"
#include "Zorvan/ZRDaemonClient.h"
#include "Zorvan/ZRPlugInCore.h"
#include "Zorvan/ZRPlugInProcess.h"

using zorvan::ZRDaemonClient;
using zorvan::ZRPlugInCore;
using Reply = ZRDaemonClient::Reply;

namespace {

int fail(const zorvan::ZRError& error) {
    fmt::print(stderr, "text-tool: {}\n", zorvan::describe(error));
    return 3;
}

/// Waits for the reply to a request, which is made with the callback that it is given.
template <class Request>
Reply ask(Request request) {
    auto answer = std::make_shared<std::promise<Reply>>();
    request([answer](const Reply& reply) { answer->set_value(reply); });
    return answer->get_future().get();
}

/// Copies to the end of the input, or until nobody takes the output any more.
void copy(int from, int to) {
    char buffer[65536];
    for (ssize_t count; (count = ::read(from, buffer, sizeof buffer)) > 0;) {
        for (ssize_t done = 0, written; done < count; done += written) {
            written = ::write(to, buffer + done, static_cast<std::size_t>(count - done));
            if (written < 0) return;
        }
    }
}

/// The exit status of the plug-in, which was made ready.
int sendThrough(const ZRPlugInCore& plugIn) {
    std::optional<zorvan::ZRError> error;
    const auto process = zorvan::ZRPlugInProcess::start(nullptr, plugIn, {}, error);
    if (!process) return fail(*error);
    const int connection = process->connection();
    // Both ways at once: the plug-in may answer before it has read everything.
    const std::jthread sender([connection] {
        copy(STDIN_FILENO, connection);
        ::shutdown(connection, SHUT_WR);
    });
    copy(connection, STDOUT_FILENO);
    ::shutdown(connection, SHUT_RDWR);
    return process->wait().value_or(3);
}

}  // namespace

int main(int argc, char** argv) {
    std::signal(SIGPIPE, SIG_IGN);
    const auto client = ZRDaemonClient::initWithServiceName(nullptr);
    platform::Dictionary rules{{zorvan::key::kExtensionPoint, "com.example.text-transform"},
                               {zorvan::rule::kUserElection, "<>2"}};  // not what the user ignores
    if (argc > 1) rules.set(zorvan::key::kExtensionIdentifier, argv[1]);
    auto reply = ask([&](auto callback) { client->matchPlugIns(rules, 0, callback); });
    if (auto error = ZRDaemonClient::errorInReply(reply)) return fail(*error);
    const auto& message = std::get<platform::Message>(reply);
    const auto forms = client->convertFromLum(*message.find(zorvan::message::kMatches));
    for (const platform::Value& form : *forms->array()) {
        const auto plugIn = ZRPlugInCore::initWithForm(*form.dictionary());
        if (!plugIn) continue;
        if (argc > 1) {
            reply =
                ask([&](auto callback) { client->readyPlugIns({plugIn->uuid()}, 0, callback); });
            if (auto error = ZRDaemonClient::errorInReply(reply)) return fail(*error);
            return sendThrough(*plugIn);
        }
        fmt::print("{:<14} {}\n", plugIn->localizedName().value_or(""), plugIn->identifier());
    }
    if (argc == 1) return 0;
    fmt::print(stderr, "text-tool: no plug-in {} that transforms text\n", argv[1]);
    return 1;
}
