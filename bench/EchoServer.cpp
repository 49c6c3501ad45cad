#include "bench/EchoServer.h"

#include <sys/epoll.h>
#include <sys/socket.h>

#include <fstream>
#include <iterator>
#include <map>
#include <vector>

#include "bench/Failure.h"
#include "bench/Frames.h"
#include "bench/Measure.h"

namespace bench {

namespace {

void serveOneByOne(int listener, const std::string& reply) {
    std::vector<char> buffer(64u << 10);
    for (;;) {
        platform::UniqueFd peer(::accept(listener, nullptr, nullptr));
        if (!peer) failErrno("accept");
        while (tryReceive(peer.get(), buffer)) sendAll(peer.get(), reply);
    }
}

void watch(int epoll, int descriptor) {
    epoll_event event{};
    event.events = EPOLLIN;
    event.data.fd = descriptor;
    if (::epoll_ctl(epoll, EPOLL_CTL_ADD, descriptor, &event) < 0) failErrno("epoll_ctl");
}

void serveMany(int listener, const std::string& reply) {
    platform::UniqueFd epoll(::epoll_create1(EPOLL_CLOEXEC));
    watch(epoll.get(), listener);
    std::map<int, platform::UniqueFd> peers;
    std::vector<char> buffer(64u << 10);
    epoll_event events[32];
    for (;;) {
        const int count = ::epoll_wait(epoll.get(), events, std::size(events), -1);
        if (count < 0) failErrno("epoll_wait");
        for (int i = 0; i < count; ++i) {
            const int ready = events[i].data.fd;
            if (ready == listener) {
                const int peer = ::accept(listener, nullptr, nullptr);
                if (peer < 0) failErrno("accept");
                peers.emplace(peer, platform::UniqueFd(peer));
                watch(epoll.get(), peer);
            } else if (tryReceive(ready, buffer)) {
                sendAll(ready, reply);
            } else {
                peers.erase(ready);
            }
        }
    }
}

std::vector<std::string> argumentsFor(EchoKind kind, const std::string& socketPath,
                                      const std::string& replyFile, std::string_view reply) {
    std::ofstream(replyFile, std::ios::binary) << reply;
    return {kEchoOption, kind == EchoKind::Many ? "many" : "blocking", socketPath, replyFile};
}

}  // namespace

EchoServer::EchoServer(const std::string& root, const std::string& name, std::string_view reply,
                       EchoKind kind)
    : socketPath_(root + "/" + name + ".sock"),
      process_("/proc/self/exe",
               argumentsFor(kind, socketPath_, root + "/" + name + ".reply", reply), {},
               root + "/echo.log") {
    waitForSocket(socketPath_, process_);
}

int serveEcho(const std::string& kind, const std::string& socketPath,
              const std::string& replyFile) {
    std::ifstream file(replyFile, std::ios::binary);
    const std::string reply{std::istreambuf_iterator<char>(file), {}};
    if (reply.size() < kFrameHead) fail("{}: no reply to send", replyFile);
    const platform::UniqueFd listener = listenAt(socketPath);
    if (kind == "many") {
        serveMany(listener.get(), reply);
    } else {
        serveOneByOne(listener.get(), reply);
    }
    return 0;
}

}  // namespace bench
