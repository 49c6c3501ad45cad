#include "platform/lum/ClientConnection.h"

#include <fcntl.h>
#include <gmock/gmock.h>

#include "tests/platform/lum/LumFixture.h"

namespace platform::lum {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;

/// A client against a server that the test plays by hand.
class ClientConnectionTest : public LumTest {
  protected:
    void serve() {
        std::filesystem::create_directories(directories.zorvanRuntime() + "/services");
        listening = unixSocket(path(), ::bind);
        ASSERT_EQ(listen(listening.get(), 5), 0);
    }
    void connect() {
        client = std::make_unique<ClientConnection>(directories, "test", queue);
        client->setEventHandler([this](const ConnectionError& error) {
            outcomes.push_back("event " + describe(error));
        });
        client->resume();
        if (listening) server.emplace(UniqueFd(accept(listening.get(), nullptr, nullptr)));
    }
    void send(const std::string& name, Dictionary body = {}) {
        client->sendWithReply(Message(std::move(body)),
                              [this, name](const ClientConnection::Reply& reply) {
                                  auto* error = std::get_if<ConnectionError>(&reply);
                                  outcomes.push_back(name + (error ? ": " + error->text : ""));
                                  if (auto* message = std::get_if<Message>(&reply)) last = *message;
                              });
    }
    Message request() {
        std::optional<Message> message;
        stepUntil([&] { return message || (message = server->read(FrameKind::Request)); });
        return *message;
    }
    void reply(const Message& request, Dictionary body = {}) {
        Message message(std::move(body));
        message.setSerial(request.serial());
        unwritten += encodeFrame(FrameKind::Reply, message, kMaxReplyPayload)->string();
        write();
    }
    void write() { written += server->write(std::string_view(unwritten).substr(written)); }

    UniqueFd listening;
    std::optional<RawPeer> server;
    std::unique_ptr<ClientConnection> client;
    std::vector<std::string> outcomes;
    Message last;
    std::string unwritten;
    std::size_t written = 0;
};

TEST_F(ClientConnectionTest, MatchesRepliesToRequests) {
    serve();
    connect();
    send("a");
    send("b");
    Message a = request();
    Message b = request();
    Message nobodys;
    nobodys.setSerial(1000);
    reply(nobodys);
    reply(b, {{"data", Data(std::string(20 << 20, 'x'))}});
    reply(a);
    reply(a);
    EXPECT_TRUE(stepUntil([&] {
        write();
        return outcomes.size() == 2 && errorLines() == 2;
    }));
    EXPECT_THAT(outcomes, ElementsAre("b", "a"));
    EXPECT_EQ(errorLines("no request of ours"), 2u);
}

TEST_F(ClientConnectionTest, WritesALongRequestAsTheServiceReads) {
    serve();
    connect();
    send("long", {{"data", Data(std::string(10 << 20, 'x'))}});
    EXPECT_EQ(request().find("data")->data()->bytes().size(), 10u << 20);
    send("over the limit", {{"data", Data(std::string(16 << 20, 'x'))}});
    EXPECT_TRUE(stepUntil([&] { return !outcomes.empty(); }));
    EXPECT_THAT(outcomes, ElementsAre(HasSubstr("over the limit of 16777216")));
}

TEST_F(ClientConnectionTest, DoesNotWaitForAServiceThatLetsNobodyIn) {
    serve();
    const auto connectAtOnce = [](int fd, const sockaddr* address, socklen_t size) {
        ::fcntl(fd, F_SETFL, O_NONBLOCK);
        return ::connect(fd, address, size);
    };
    std::vector<UniqueFd> others;
    while (UniqueFd other = unixSocket(path(), connectAtOnce)) others.push_back(std::move(other));
    client = std::make_unique<ClientConnection>(directories, "test", queue);
    client->resume();
    send("a");
    send("b");
    ::fcntl(listening.get(), F_SETFL, O_NONBLOCK);
    // It comes behind the others.
    std::size_t letIn = 0;
    ASSERT_TRUE(stepUntil([&] {
        server.emplace(UniqueFd(accept(listening.get(), nullptr, nullptr)));
        letIn += server->fd() >= 0 ? 1 : 0;
        return letIn > others.size();
    }));
    const Message a = request(), b = request();
    reply(a);
    reply(b);
    EXPECT_TRUE(stepUntil([&] { return outcomes.size() == 2; }));
    EXPECT_THAT(outcomes, ElementsAre("a", "b"));
}

TEST_F(ClientConnectionTest, WithoutAServiceEverythingFailsAtOnce) {
    connect();
    send("a");
    EXPECT_TRUE(stepUntil([&] { return outcomes.size() == 2; }));
    const std::string reason = "no service at " + path() + ": No such file or directory";
    EXPECT_THAT(outcomes, ElementsAre("event connection invalid: " + reason, "a: " + reason));
}

TEST_F(ClientConnectionTest, EveryUnansweredRequestHearsOfTheEndOnce) {
    serve();
    connect();
    for (auto name : {"a", "b", "c"}) send(name);
    reply(request());
    EXPECT_TRUE(stepUntil([&] { return outcomes.size() == 1; }));
    server.reset();
    EXPECT_TRUE(stepUntil([&] { return outcomes.size() == 4; }));
    send("later");
    EXPECT_TRUE(stepUntil([&] { return outcomes.size() == 5; }));
    loop.poll();
    EXPECT_THAT(outcomes, ElementsAre("a", HasSubstr("event connection interrupted"),
                                      HasSubstr("b: "), HasSubstr("c: "), HasSubstr("later: ")));
}

TEST_F(ClientConnectionTest, AMalformedReplyInterrupts) {
    serve();
    connect();
    send("a");
    server->write(std::string_view("\0\0\0\1\xf6", 5));
    EXPECT_TRUE(stepUntil([&] { return outcomes.size() == 2; }));
    EXPECT_THAT(outcomes, ElementsAre(HasSubstr("event connection interrupted"), HasSubstr("a: ")));
    EXPECT_EQ(errorLines(), 1u);
}

TEST_F(ClientConnectionTest, GoesAwayQuietly) {
    serve();
    connect();
    send("a");
    Message a = request();
    client.reset();
    reply(a);
    EXPECT_TRUE(stepUntil([&] { return server->hasEnded(); }));

    // Also from inside a callback.
    connect();
    client->sendWithReply(Message(), [this](const ClientConnection::Reply&) { client.reset(); });
    send("b");
    reply(request());
    EXPECT_TRUE(stepUntil([&] { return !client && server->hasEnded(); }));
    EXPECT_THAT(outcomes, ElementsAre());
}

}  // namespace
}  // namespace platform::lum
