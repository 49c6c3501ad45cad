// Descriptors that travel with replies.

#include <fcntl.h>
#include <linux/capability.h>
#include <sys/resource.h>
#include <sys/syscall.h>

#include "platform/lum/ClientConnection.h"
#include "platform/system/Parcel.h"
#include "tests/platform/lum/LumFixture.h"

namespace platform::lum {
namespace {

/// A service that answers "file" with a descriptor of a file that holds the serial, and everything
/// else with a reply of a megabyte.
class DescriptorTest : public LumTest {
  protected:
    DescriptorTest() : listener(std::move(*Listener::make(directories, "test", queue))) {
        listener->setEventHandler([this](std::shared_ptr<Connection> connection) {
            connection->setEventHandler(
                [this, weak = std::weak_ptr(connection)](const ConnectionEvent& event) {
                    const auto* message = std::get_if<Message>(&event);
                    if (message) weak.lock()->send(answer(*message));
                });
            connection->resume();
        });
        listener->resume();
    }
    Message answer(const Message& request) {
        Message reply = Message::replyTo(request);
        if (!request.find("file")) {
            reply.set("text", std::string(1u << 20, 'x'));
            return reply;
        }
        served += 1;
        const std::string name = directories.runtime + "/file";
        UniqueFd file(::open(name.c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
        ::unlink(name.c_str());
        const std::string text = std::to_string(request.serial());
        EXPECT_EQ(::write(file.get(), text.data(), text.size()), static_cast<ssize_t>(text.size()));
        reply.setDescriptor(std::move(file));
        return reply;
    }

    std::unique_ptr<Listener> listener;
    int served = 0;
};

TEST_F(DescriptorTest, EachComesWithItsReply) {
    ClientConnection client(directories, "test", queue);
    client.resume();
    std::string read;
    for (const char* kind : {"file", "text", "text", "file", "file", "text", "file"})
        client.sendWithReply(Message({{kind, true}}), [&](const ClientConnection::Reply& reply) {
            const UniqueFd file = std::get<Message>(reply).takeDescriptor();
            char text[8] = {'-'};
            EXPECT_EQ(::pread(file.get(), text, sizeof text, 0), file ? 1 : -1);
            read += text;
            EXPECT_FALSE(std::get<Message>(reply).takeDescriptor());
        });
    EXPECT_TRUE(stepUntil([&] { return read.size() == 7; }));
    EXPECT_EQ(read, "1--45-7");
}

TEST_F(DescriptorTest, WhoTakesNoneGetsNoMore) {
    RawPeer peer(path());
    for (int i = 0; i < 5000; ++i) {
        peer.write(requestFrame(1, {{"file", true}}));
        loop.poll();
    }
    EXPECT_LT(served, 4000);
    ClientConnection other(directories, "test", queue);
    other.resume();
    bool answered = false;
    other.sendWithReply(Message({{"file", true}}), [&](const auto&) { answered = true; });
    EXPECT_TRUE(stepUntil([&] { return answered; }));
}

/// While it lives, the user has more descriptors on their way than this thread may add to, and none
/// of the rights with which one may all the same.
class ManyOnTheirWay {
  public:
    ManyOnTheirWay() {
        ::syscall(SYS_capget, &header_, usual_);
        const __user_cap_data_struct none[2] = {{0, usual_[0].permitted, 0},
                                                {0, usual_[1].permitted, 0}};
        ::syscall(SYS_capset, &header_, none);
        EXPECT_EQ(::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends_), 0);
        const std::vector<int> many(Parcel::kMostDescriptors, STDIN_FILENO);
        // Whatever others of this user have on their way meanwhile, these are too many.
        for (int i = 0; i < 7; ++i) EXPECT_FALSE(Parcel::send(ends_[0], "x", many));
        ::getrlimit(RLIMIT_NOFILE, &limit_);
        const rlimit narrow{200, limit_.rlim_max};
        ::setrlimit(RLIMIT_NOFILE, &narrow);
    }
    ~ManyOnTheirWay() {
        for (const int end : ends_) ::close(end);
        ::setrlimit(RLIMIT_NOFILE, &limit_);
        ::syscall(SYS_capset, &header_, usual_);
    }

  private:
    __user_cap_header_struct header_{_LINUX_CAPABILITY_VERSION_3, 0};
    __user_cap_data_struct usual_[2] = {};
    rlimit limit_{};
    int ends_[2] = {-1, -1};
};

TEST_F(DescriptorTest, WhatMayNotGoNowGoesLater) {
    ClientConnection client(directories, "test", queue);
    client.resume();
    UniqueFd file;
    bool isAnswered = false;
    {
        const ManyOnTheirWay others;
        client.sendWithReply(Message({{"file", true}}), [&](const ClientConnection::Reply& reply) {
            isAnswered = true;
            if (const auto* message = std::get_if<Message>(&reply))
                file = message->takeDescriptor();
        });
        EXPECT_TRUE(stepUntil([&] { return served == 1; }));
        for (int i = 0; i < 20; ++i) loop.runOnce(std::chrono::milliseconds(10));
        EXPECT_FALSE(isAnswered);
    }
    EXPECT_TRUE(stepUntil([&] { return isAnswered; }));
    EXPECT_TRUE(file);
}

}  // namespace
}  // namespace platform::lum
