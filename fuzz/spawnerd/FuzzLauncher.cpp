// The launcher's service, over its socket, by a host that may start one plug-in.
// Covers: platform/spawnerd/SpawnService.cpp platform/lum/PeerConnection.cpp

#include <sys/socket.h>
#include <sys/un.h>

#include <cstring>

#include "fuzz/Support.h"
#include "platform/lum/AuditToken.h"
#include "platform/lum/Listener.h"
#include "platform/spawnerd/Launcher.h"
#include "platform/spawnerd/Protocol.h"
#include "platform/spawnerd/SpawnService.h"
#include "platform/values/Cbor.h"
#include "tests/support/KnownDirectory.h"

using namespace platform;
using namespace platform::spawnerd;

namespace {

struct Service {
    Service() {
        const std::string bundle = fuzz::home().makeDirectory("A.appex");
        fuzz::home().write(
            "A.appex/Info.plist",
            "<plist><dict><key>QFBundleIdentifier</key><string>a</string></dict></plist>");
        std::filesystem::permissions(fuzz::home().write("A.appex/run", "#!/bin/true\n"),
                                     std::filesystem::perms::owner_all);
        const Dictionary overlay{{"QFBundlePackageType", "LUM!"},
                                 {"LUMService", Dictionary{{"_SandboxProfile", "plugin"}}}};
        const int refusal = service->grant(*AuditToken::ofSelf(),
                                           {bundle + "/run", test::known(bundle), {}}, overlay);
        fuzz::require(refusal == 0);
        executable = bundle + "/run";
        loop->post([this] { service->listen(); });
        settle();
    }
    void settle() {
        // What is looked at elsewhere comes back a little later.
        while (loop->runOnce(std::chrono::milliseconds(1))) continue;
    }

    std::shared_ptr<RunLoop> loop = std::make_shared<RunLoop>();
    // There is no bubblewrap here: a start fails where a process would be made.
    std::shared_ptr<SpawnService> service = SpawnService::make(
        fuzz::directories(), "zrd", loop, nullptr, nullptr, {"/nonexistent", "/nonexistent"});
    std::string executable;
    const std::string socket = *lum::socketPath(fuzz::directories(), serviceNameFor("zrd"));
};

UniqueFd connectTo(const std::string& path) {
    UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    fuzz::require(::connect(socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) ==
                  0);
    return socket;
}

/// A request with "executable": "@" names the one that may be started.
std::string named(std::string_view payload, const std::string& executable) {
    std::string bytes(payload);
    if (const std::size_t at = bytes.find("\x61@"); at != bytes.npos) {
        std::string text;
        encodeCbor(Value(executable), text);
        bytes.replace(at, 2, text);
    }
    return bytes;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static Service service;
    const UniqueFd socket = connectTo(service.socket);
    service.settle();
    for (const std::string_view part : fuzz::parts(fuzz::text(data, size), 8)) {
        if (part.empty()) continue;
        const std::string payload = named(part, service.executable);
        const std::string frame = bigEndian32(payload.size()) + payload;
        (void)::send(socket.get(), frame.data(), frame.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
    }
    ::shutdown(socket.get(), SHUT_WR);
    service.settle();
    return 0;
}
