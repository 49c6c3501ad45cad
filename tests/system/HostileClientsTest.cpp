// Clients that break the protocol, are idle, do not read, or are somebody else.

#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <list>

#include "tests/system/SystemTest.h"

namespace test {

namespace {

using testing::ElementsAre;
using namespace std::string_literals;

class HostileClients : public SystemTest {
  protected:
    void SetUp() override {
        Dictionary large = info("steady");
        large.set("Padding", std::string(300'000, 'x'));
        writePlugIn(plugInPath("A", "steady"), large);
        start();
    }
    void expectService() { EXPECT_THAT(match(), ElementsAre("steady 1")); }

    /// Resident memory of the daemon.
    std::size_t residentMiB() const {
        std::ifstream statm("/proc/" + std::to_string(zrd_->pid()) + "/statm");
        std::size_t size = 0, resident = 0;
        statm >> size >> resident;
        return resident * static_cast<std::size_t>(::getpagesize()) >> 20;
    }

    static std::string nested(int depth) {
        return "\x83\x00\x01\xa1\x61k"s + std::string(depth, '\x81') + '\x01';
    }

    const std::string bulk_ = RawClient::request({{"request", "bulk"}, {"version", 3}});
};

TEST_F(HostileClients, ABrokenFrameEndsItsConnectionAlone) {
    struct Case {
        const char* fault;
        std::string bytes;
    };
    auto body = [](std::string item) {
        return RawClient::frame("\x83\x00\x01\xa1\x61k"s + std::move(item));
    };
    const Case cases[] = {
        {"frame too large", "\x01\x00\x00\x01"s},
        {"enormous frame", "\xff\xff\xff\xff"s},
        {"empty payload", RawClient::frame("")},
        {"no CBOR", RawClient::frame("garbage")},
        {"item cut short", RawClient::frame("\x83\x00"s)},
        {"something behind the item", RawClient::frame("\x83\x00\x01\xa0\x00"s)},
        {"too deep", RawClient::frame(nested(200))},
        {"null", body("\xf6"s)},
        {"unknown tag", body("\xc2\x41\x01"s)},
        {"tag 37 on 3 bytes", body("\xd8\x25\x43zzz"s)},
        {"duplicate keys", RawClient::frame("\x83\x00\x01\xa2\x61k\x01\x61k\x02"s)},
        {"key that is no text", RawClient::frame("\x83\x00\x01\xa1\x01\x01"s)},
        {"invalid UTF-8", body("\x61\xff"s)},
        {"NUL in a text", body("\x62z\x00"s)},
        {"indefinite length", body("\x9f\xff"s)},
        {"huge announced text", body("\x7b\x7f\xff\xff\xff\xff\xff\xff\xff"s)},
        {"huge announced array", body("\x9b\xff\xff\xff\xff\xff\xff\xff\xff"s)},
    };
    std::size_t lines = 0;
    for (const auto& [fault, bytes] : cases) {
        RawClient raw(socket_);
        raw.send(bulk_);
        EXPECT_FALSE(raw.receive().empty()) << fault;
        raw.send(bytes);
        EXPECT_TRUE(raw.isClosed()) << fault;
        EXPECT_EQ(zrd_->errLines("client " + std::to_string(getpid()) + " is cut off: "), ++lines)
            << fault << zrd_->err();
        expectService();
    }
    RawClient raw(socket_);
    raw.send(bulk_.substr(0, bulk_.size() - 1));
    raw.sendNothingMore();
    EXPECT_TRUE(raw.isClosed());
    EXPECT_EQ(zrd_->errLines("is cut off: the stream ended in the middle"), 1u);
}

TEST_F(HostileClients, WhatIsNoMessageIsLoggedAndIgnored) {
    RawClient raw(socket_);
    for (const std::string& item :
         {"\x07"s, "\x82\x00\x01"s, "\x83\x02\x01\xa0"s, "\x83\x01\x01\xa0"s, "\x83\x00\x20\xa0"s,
          "\x83\x00\x01\x80"s, "\xa0"s})
        raw.send(RawClient::frame(item));
    raw.send(bulk_);
    raw.sendNothingMore();
    EXPECT_EQ(raw.receive(), "\x83\x01\x01\xa0"s);
    EXPECT_EQ(zrd_->errLines("unexpected message: "), 7u) << zrd_->err();
}

TEST_F(HostileClients, IdleAndUnreadingOnesStopNobody) {
    std::list<RawClient> silent;
    for (int i = 0; i < 200; ++i) ASSERT_TRUE(silent.emplace_back(socket_).isConnected());
    const std::string request = RawClient::request({{"request", "match"}, {"version", 3}});
    std::string requests;
    for (int i = 0; i < 4000; ++i) requests += request;
    RawClient unreading(socket_);
    unreading.send(requests);  // for 1.2 GB of replies, if they were all made
    for (int i = 0; i < 20; ++i) expectService();
    EXPECT_LT(residentMiB(), 400u);
    silent.clear();
    expectService();
    // Whoever reads again gets every reply that it asked for, and the daemon reads on.
    for (int i = 0; i < 100; ++i) ASSERT_GT(unreading.receive().size(), 300'000u);
}

TEST_F(HostileClients, AnotherUserIsNotLetIn) {
    if (::geteuid() != 0) GTEST_SKIP() << "only root can be somebody else";
    auto connectsAsNobody = [&] {
        const pid_t child = ::fork();
        if (child == 0) {
            constexpr uid_t nobody = 65534;
            if (::setresuid(nobody, nobody, nobody) != 0) ::_exit(2);
            RawClient raw(socket_);
            if (!raw.isConnected()) ::_exit(0);
            raw.send(bulk_);
            ::_exit(raw.isClosed() ? 1 : 3);
        }
        int status = 0;
        ::waitpid(child, &status, 0);
        return WEXITSTATUS(status);
    };
    // Until then it makes sockets, and closes their directories.
    expectService();
    EXPECT_EQ(connectsAsNobody(), 0);  // the directories keep it out
    for (std::string path = socket_; path.size() >= home_.path().size();
         path = std::filesystem::path(path).parent_path())
        ::chmod(path.c_str(), 0777);
    EXPECT_EQ(connectsAsNobody(), 1);  // and without them the daemon
    EXPECT_EQ(zrd_->errLines("of user 65534 is not let in"), 1u);
    expectService();
}

TEST_F(HostileClients, IdleConnectionsOfSomeKeepNobodyElseOut) {
    stop(SIGTERM);
    zrd_ = spawn("/bin/sh", {"-c", "ulimit -n 400; exec '" ZRD_PROGRAM "'"});
    ASSERT_TRUE(waitUntil([&] { return RawClient(socket_).isConnected(); }));
    client_ = ZRDaemonClient::initWithServiceName(nullptr);
    expectService();
    // A quarter of (400 - 64) / 3, less the one above and any that has not gone yet.
    std::list<RawClient> idle;
    for (int i = 0; i < 120; ++i) idle.emplace_back(socket_).send(bulk_);
    const auto served = std::count_if(idle.begin(), idle.end(),
                                      [](const RawClient& client) { return !client.isClosed(); });
    EXPECT_THAT(served, testing::AllOf(testing::Ge(20), testing::Le(27)));
    EXPECT_EQ(zrd_->errLines("have too many, 28 are the most"), 1u);
    const RawClient launcher(socket_ + ".spawnerd");
    launcher.send(bulk_);
    EXPECT_TRUE(launcher.isClosed()) << "what is full is full at every door";
    expectService();
    const auto other = spawn("/usr/bin/setsid", {"--wait", zrctlProgram_, "match"});
    EXPECT_EQ(other->wait(), 0) << other->err();
    idle.clear();
    EXPECT_TRUE(waitUntil([&] {
        RawClient again(socket_);
        again.send(bulk_);
        return !again.isClosed();
    }));
}

}  // namespace

}  // namespace test
