// What a peer sends to the broker of tokens.
// Covers: platform/sandbox/SandboxBroker.cpp

#include <sys/socket.h>
#include <sys/un.h>

#include <cstring>

#include "fuzz/Support.h"
#include "platform/lum/Listener.h"
#include "platform/sandbox/SandboxBroker.h"
#include "platform/threads/RunLoop.h"
#include "tests/support/KnownDirectory.h"

using namespace platform;

namespace {

struct Broker {
    void settle() {
        while (loop.poll() > 0) continue;
    }

    RunLoop loop;
    const SandboxTokens tokens = *SandboxTokens::make("zrd");
    const std::string bundle = fuzz::home().makeDirectory("A.appex");
    const std::string token = *tokens.issue(test::known(bundle), ".");
    const std::unique_ptr<SandboxBroker> broker =
        std::move(*SandboxBroker::make(fuzz::directories(), "zrd", tokens, loop));
    const std::string socket = *lum::socketPath(fuzz::directories(), sandboxServiceName("zrd"));
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static Broker broker;
    UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, broker.socket.c_str(), sizeof address.sun_path - 1);
    fuzz::require(::connect(socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) ==
                  0);
    for (const std::string_view part : fuzz::parts(fuzz::text(data, size), 3)) {
        std::string bytes(part);
        if (const std::size_t at = bytes.find('@'); at != bytes.npos)
            bytes.replace(at, 1, broker.token);
        (void)::send(socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
        broker.settle();
    }
    ::shutdown(socket.get(), SHUT_WR);
    broker.settle();
    return 0;
}
