// The launcher's service, over its socket, by a host that may start one plug-in. Each part of an
// input is a request, or a step that its first letter names: see `take`. "@" stands for the
// executable that may be started, "%" for the instance that was started last, "#" for a long text.
// Covers: platform/spawnerd/SpawnService.cpp platform/spawnerd/SpawnServiceStart.cpp
// Covers: platform/spawnerd/SpawnRequest.cpp platform/lum/PeerConnection.cpp

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>

#include "fuzz/Support.h"
#include "platform/lum/AuditToken.h"
#include "platform/lum/Frame.h"
#include "platform/lum/Limits.h"
#include "platform/lum/Listener.h"
#include "platform/spawnerd/Launcher.h"
#include "platform/spawnerd/Protocol.h"
#include "platform/spawnerd/SpawnService.h"
#include "platform/values/Cbor.h"
#include "tests/support/KnownDirectory.h"

using namespace platform;
using namespace platform::spawnerd;

namespace {

constexpr std::chrono::milliseconds kStep{10};
constexpr int kMaxSteps = 200;

/// Stands in for bubblewrap, in namespaces that can be limited: says that it is the first process
/// of a sandbox, waits at the gate, and does what the plug-in's first argument says.
std::string bubblewrap() {
    std::array<char, 64> name{};
    fuzz::require(::readlink("/proc/self/ns/pid", name.data(), name.size() - 1) > 0);
    const std::string link = name.data();
    const std::string inode = link.substr(link.find('[') + 1, link.find(']') - link.find('[') - 1);
    const std::string file =
        fuzz::home().write("bubblewrap",
                           "#!/bin/sh\n"
                           "[ -n \"$INSIDE\" ] || INSIDE=1 exec unshare -U -n \"$0\" \"$@\"\n"
                           "[ \"${11}\" = fail ] && exit 2\n"
                           "echo '{\"child-pid\":' $$ ',\"pid-namespace\":' " +
                               inode +
                               " '}' >&$4\n"
                               "eval \"exec $4>&-\"\n"
                               "head -c 1 <&$6 > /dev/null\n"
                               "[ \"${11}\" = stay ] && exec sleep 1000\n"
                               "echo ended\n");
    std::filesystem::permissions(file, std::filesystem::perms::owner_all);
    return file;
}

struct Service {
    Service() {
        fuzz::home().write(
            "A.appex/Info.plist",
            "<plist><dict><key>QFBundleIdentifier</key><string>a</string></dict></plist>");
        std::filesystem::permissions(fuzz::home().write("A.appex/run", "#!/bin/true\n"),
                                     std::filesystem::perms::owner_all);
        grant();
        loop->post([this] { service->listen(); });
        settle();
    }

    void grant() const {
        const Dictionary overlay{{"QFBundlePackageType", "LUM!"},
                                 {"LUMService", Dictionary{{"_SandboxProfile", "plugin"}}}};
        auto grant =
            Grant::make(fuzz::directories(), {executable, test::known(bundle), {}}, overlay);
        fuzz::require(grant && service->grant(*AuditToken::ofSelf(), std::move(*grant)) == 0);
    }
    /// The bundle, away or back.
    void move(bool away) const {
        const std::string other = fuzz::home().path("B.appex");
        if (std::filesystem::exists(bundle) == away)
            std::filesystem::rename(away ? bundle : other, away ? other : bundle);
    }
    std::size_t settle() const {
        std::size_t all = 0;
        // What is looked at elsewhere comes back a little later.
        while (loop->runOnce(std::chrono::milliseconds(1))) ++all;
        return all;
    }
    /// As the daemon does when the plug-in is removed. Nothing is left for the next input.
    void endAll() const {
        service->takeBack(bundle);
        bool isDone = false;
        service->terminate([](const Grant&) { return true; }, [&](bool) { isDone = true; });
        for (int i = 0; i < kMaxSteps && !isDone; ++i) loop->runOnce(kStep);
        fuzz::require(isDone);
        settle();
        grant();
    }

    const std::string bundle = fuzz::home().makeDirectory("A.appex");
    const std::string executable = bundle + "/run";
    std::shared_ptr<RunLoop> loop = std::make_shared<RunLoop>();
    std::shared_ptr<SpawnService> service = SpawnService::make(
        fuzz::directories(), "zrd", loop, nullptr, nullptr, {bubblewrap(), "/nonexistent"});
    const std::string socket = *lum::socketPath(fuzz::directories(), serviceNameFor("zrd"));
};

class Host {
  public:
    explicit Host(const Service& service) : service_(service) { connect(); }

    /// Does one step: of a request, what its letter says. Any other part is a request.
    void take(std::string_view part) {
        const std::string_view rest = part.substr(1);
        switch (part.front()) {
            case '=':  // bytes as they are
                return send(rest);
            case '*':  // many requests, whose replies are not read meanwhile
                return sendMany(frame(rest), rest.find("\x65start") != rest.npos);
            case '!':
                (void)::send(socket_.get(), "!", 1, MSG_OOB | MSG_NOSIGNAL | MSG_DONTWAIT);
                service_.settle();
                return;
            case '+':  // another connection
                return connect();
            case '^':  // a request, and the plug-in is made ready anew while it starts
                return sendInTurn(frame(rest));
            case '~':  // the bundle has gone
                return service_.move(true);
            default:
                request(part);
        }
    }
    bool hasStarted() const { return hasStarted_; }

    void end() {
        ::shutdown(socket_.get(), SHUT_WR);
        service_.settle();
        receive();
    }

  private:
    void connect() {
        socket_.reset(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        std::strncpy(address.sun_path, service_.socket.c_str(), sizeof address.sun_path - 1);
        fuzz::require(
            ::connect(socket_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) == 0);
        reader_ = lum::FrameReader(1u << 20);
        service_.settle();
    }

    /// More than wait in a connection, or, where that costs little, than a socket holds replies to.
    void sendMany(std::string_view frame, bool areStarts) {
        int count = areStarts || frame.size() > lum::kMaxDecodedAtOnce ? 80 : 400;
        std::string all;
        while (--count >= 0) all += frame;
        send(all);
    }

    /// What is looked at elsewhere meanwhile was granted before.
    void sendInTurn(const std::string& bytes) {
        (void)::send(socket_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
        while (service_.loop->poll() > 0) continue;
        service_.grant();
        service_.settle();
    }

    /// What takes its time is awaited, if it is answered at all.
    void request(std::string_view payload) {
        constexpr int kSteps = 30;
        receive();
        const std::string bytes = frame(payload);
        const auto decoded = lum::decodePayload(
            std::make_shared<const std::string>(bytes.substr(lum::kFrameHeaderSize)),
            lum::FrameKind::Request);
        const auto* message = std::get_if<Message>(&decoded);
        const Value* asked = message ? message->find(kRequest) : nullptr;
        const bool isLarge = bytes.size() > lum::kMaxDecodedAtOnce;
        send(bytes);
        const bool isAwaited = isLarge ? !std::holds_alternative<UnknownObject>(decoded)
                                       : asked && *asked == Value(kStart);
        for (int i = 0; i < kSteps && isAwaited && !isAnswered(); ++i)
            service_.loop->runOnce(kStep);
        receive();
    }

    std::string frame(std::string_view payload) {
        std::string bytes(payload);
        hasStarted_ |= replace(bytes, "\x61@", service_.executable);
        replace(bytes, "\x61%", last_);
        replace(bytes, "\x61#", std::string(20000, 'x'));
        return bigEndian32(bytes.size()) + bytes;
    }

    static bool replace(std::string& bytes, std::string_view mark, const Value& value) {
        const std::size_t at = bytes.find(mark);
        if (at == bytes.npos) return false;
        std::string encoded;
        encodeCbor(value, encoded);
        bytes.replace(at, mark.size(), encoded);
        return true;
    }

    void send(std::string_view bytes) {
        while (!bytes.empty()) {
            const ssize_t count =
                ::send(socket_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
            if (count < 0 && errno != EAGAIN) return;
            if (count > 0) bytes.remove_prefix(static_cast<std::size_t>(count));
            if (service_.settle() == 0 && count < 0 && !service_.loop->runOnce(kStep)) return;
        }
    }

    bool isAnswered() const {
        pollfd state{socket_.get(), POLLIN, 0};
        return ::poll(&state, 1, 0) > 0;
    }

    /// Every reply is one.
    void receive() {
        char buffer[4096];
        ssize_t count = 0;
        while ((count = ::recv(socket_.get(), buffer, sizeof buffer, MSG_DONTWAIT)) > 0) {
            std::string_view input(buffer, static_cast<std::size_t>(count));
            while (!input.empty()) {
                auto payload = reader_.take(input);
                fuzz::require(bool(payload));
                if (!*payload) continue;
                const auto reply = lum::decodePayload(*payload, lum::FrameKind::Reply);
                const auto* message = std::get_if<Message>(&reply);
                fuzz::require(message);
                if (const Value* instance = message->find(kInstance)) last_ = *instance;
            }
            service_.settle();
        }
    }

    const Service& service_;
    UniqueFd socket_;
    lum::FrameReader reader_{1u << 20};
    Value last_{0};
    bool hasStarted_ = false;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const Service service;
    Host host(service);
    for (const std::string_view part : fuzz::parts(fuzz::text(data, size), 12))
        if (!part.empty()) host.take(part);
    host.end();
    service.move(false);
    if (host.hasStarted()) service.endAll();
    return 0;
}
