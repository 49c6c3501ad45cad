#include "Zorvan/ZRDaemonClient.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdlib>
#include <future>

#include "Zorvan/Keys.h"
#include "platform/lum/Limits.h"
#include "platform/lum/Listener.h"
#include "platform/system/Directories.h"
#include "tests/Zorvan/LogLines.h"
#include "tests/support/TemporaryDirectory.h"

namespace zorvan {
namespace {

using platform::Array;
using platform::ConnectionError;
using platform::Dictionary;
using platform::Message;
using platform::Uuid;
using platform::Value;
using Reply = ZRDaemonClient::Reply;

TEST(ErrorInReply, ReadsCodeAndText) {
    auto error = [](const Dictionary& contents) {
        return ZRDaemonClient::errorInReply(Message(contents));
    };
    EXPECT_EQ(error({}), std::nullopt);
    EXPECT_EQ(error({{"errorcode", 0}}), std::nullopt);
    EXPECT_EQ(error({{"errorcode", "9"}, {"error", 1}}), std::nullopt);
    EXPECT_EQ(error({{"errorcode", 9}, {"error", "no plugin"}}),
              (ZRError{"Zorvan", 9, "no plugin"}));
    EXPECT_EQ(error({{"errorcode", 9}}),
              (ZRError{"Zorvan", 9, "unknown error returned by Zorvan subsystem"}));
    EXPECT_EQ(error({{"errorcode", UINT64_MAX}})->code, INT_MAX);
    EXPECT_THROW(error({{"error", "lost"}}), ZRInternalInconsistency);

    ConnectionError broken{ConnectionError::Kind::Interrupted, "gone"};
    EXPECT_EQ(ZRDaemonClient::errorInReply(broken), (ZRError{"Zorvan", 4, describe(broken)}));
}

/// A client, and a service that answers every request with the request itself, under "sent".
class ClientTest : public testing::Test {
  protected:
    ClientTest() {
        ::setenv("XDG_RUNTIME_DIR", runtime_.path().c_str(), 1);
        auto listener = platform::Listener::make(platform::Directories::fromEnvironment(),
                                                 kDefaultServiceName, queue_);
        listener_ = std::move(*listener);
        listener_->setEventHandler([](std::shared_ptr<platform::Connection> connection) {
            std::weak_ptr<platform::Connection> weak = connection;
            connection->setEventHandler([weak](const platform::ConnectionEvent& event) {
                const auto* request = std::get_if<Message>(&event);
                auto peer = weak.lock();
                if (!request || !peer) return;
                Message reply = Message::replyTo(*request);
                reply.set("sent", request->contents());
                peer->send(reply);
            });
            connection->resume();
        });
        listener_->resume();
        client_ = ZRDaemonClient::initWithServiceName(nullptr);
    }

    ~ClientTest() override {
        // The listener belongs to its queue's thread.
        queue_.async([this] { listener_.reset(); });
    }

    /// What an operation's callback gets; `operation` takes the callback.
    template <class Operation>
    Reply replyOf(Operation&& operation) {
        auto got = std::make_shared<std::promise<Reply>>();
        auto future = got->get_future();
        operation([got, this](const Reply& reply) {
            client_->replyQueue().assertCurrent();
            got->set_value(reply);
        });
        return future.get();
    }

    /// The request that the service saw, without the keys that all requests have.
    template <class Operation, class... Arguments>
    Dictionary sent(const char* type, Operation operation, const Arguments&... arguments) {
        Reply reply = replyOf(
            [&](auto done) { std::invoke(operation, *client_, arguments..., std::move(done)); });
        const auto* message = std::get_if<Message>(&reply);
        if (!message) return {{"lost", describe(std::get<ConnectionError>(reply))}};
        Dictionary request = *message->find("sent")->dictionary();
        EXPECT_EQ(*request.find("request"), Value(type));
        EXPECT_EQ(*request.find("version"), Value(client_->protocolVersion()));
        request.remove("request");
        request.remove("version");
        return request;
    }

    LogLines log_{LogLines::Private::Hidden};
    test::TemporaryDirectory runtime_;
    std::unique_ptr<platform::Listener> listener_;
    platform::SerialQueue queue_{"lum"};
    std::shared_ptr<ZRDaemonClient> client_;
};

TEST_F(ClientTest, BuildsEachRequest) {
    using Client = ZRDaemonClient;
    const Uuid a = Uuid::random(), b = Uuid::random();
    const Dictionary options{{"key", Array{1, "text", true}}};
    const std::vector<std::string> places{"/a", "/b"};
    const std::vector<Uuid> both{b, a}, none;
    const Value paths = Array{"/a", "/b"}, uuids = Array{b, a};
    EXPECT_EQ(sent("add", &Client::addPlugIns, places), (Dictionary{{"paths", paths}}));
    EXPECT_EQ(sent("remove", &Client::removePlugIns, places), (Dictionary{{"paths", paths}}));
    EXPECT_EQ(sent("bulk", &Client::bulkPlugins, UINT64_MAX), (Dictionary{{"flags", UINT64_MAX}}));
    EXPECT_EQ(sent("ready", &Client::readyPlugIns, both, 1),
              (Dictionary{{"flags", 1}, {"uuids", uuids}}));
    EXPECT_EQ(sent("access", &Client::accessPlugIns, none, 0),
              (Dictionary{{"flags", 0}, {"uuids", Array{}}}));
    EXPECT_EQ(sent("match", &Client::matchPlugIns, options, 5),
              (Dictionary{{"flags", 5}, {"rules", options}}));
    EXPECT_EQ(sent("annotate", &Client::setPluginAnnotations, both, options),
              (Dictionary{{"annotations", options}, {"uuids", uuids}}));
    EXPECT_EQ(sent("bulk-annotate", &Client::bulkSetPluginAnnotations, options),
              (Dictionary{{"annotations", options}}));
    EXPECT_EQ(sent("lock", &Client::holdPlugins, places, 2),
              (Dictionary{{"flags", 2}, {"paths", paths}}));
    client_->setProtocolVersion(2);
    EXPECT_EQ(sent("lock", &Client::releaseHold, a), (Dictionary{{"uuids", Array{a}}}));
}

TEST_F(ClientTest, UnpacksPropertyListsInTheCurrentVersionOnly) {
    const Value list = Array{Dictionary{{"path", "/a"}}};
    EXPECT_FALSE(ZRDaemonClient::convertToLum(list, 2));
    Message message = client_->request("match");
    message.set("matches", *ZRDaemonClient::convertToLum(list, 3));
    Reply reply = replyOf([&](auto done) { client_->send(message, done); });
    const Value received = *std::get<Message>(reply).find("sent")->dictionary()->find("matches");
    EXPECT_EQ(client_->convertFromLum(received), list);
    EXPECT_EQ(client_->convertFromLum(list), std::nullopt);
    client_->setProtocolVersion(2);
    EXPECT_EQ(client_->convertFromLum(received), std::nullopt);
}

TEST_F(ClientTest, WhatTheDaemonMustRefuseCostsThatRequestAndNothingElse) {
    Value deep = Dictionary();
    for (int i = 0; i < 200; ++i) deep = Array{deep};
    const Value cases[] = {"\xff",
                           Dictionary{{"\xff", 1}},
                           std::string("a\0b", 3),
                           deep,
                           Array(std::vector<Value>(300'000, 1)),
                           platform::Data(std::string(16 << 20, 'x'))};
    for (const Value& value : cases) {
        Reply reply = replyOf([&](auto done) { client_->matchPlugIns({{"k", value}}, 0, done); });
        const auto error = ZRDaemonClient::errorInReply(reply);
        ASSERT_TRUE(error);
        EXPECT_EQ(error->code, kZRErrorInvalidRequest);
        EXPECT_THAT(*error->description, testing::StartsWith("request not sent: "));
    }
    const std::vector<std::string> paths(platform::lum::kMaxListed + 1, "/");
    Reply reply = replyOf([&](auto done) { client_->addPlugIns(paths, done); });
    EXPECT_EQ(ZRDaemonClient::errorInReply(reply)->description,
              "request not sent: it has too long a list");
    EXPECT_EQ(sent("bulk", &ZRDaemonClient::bulkPlugins, 0), (Dictionary{{"flags", 0}}));
}

TEST_F(ClientTest, MayBeReleasedInACallback) {
    std::promise<void> sent, released;
    client_->bulkPlugins(0, [&](const Reply&) {
        sent.get_future().wait();
        client_.reset();  // the last reference, on the client's own queue
        released.set_value();
    });
    sent.set_value();
    released.get_future().wait();
}

TEST_F(ClientTest, HearsOfItsServicesEndAlsoAfterIt) {
    for (bool isOver : {false, true}) {
        std::promise<void> heard;
        client_->setEndHandler([&] { heard.set_value(); });
        if (!isOver) queue_.async([this] { listener_.reset(); });
        heard.get_future().wait();
    }
}

TEST_F(ClientTest, AnswersEveryRequestWithAnErrorWithoutAService) {
    client_ = ZRDaemonClient::initWithServiceName("com.example.unknown");
    for (int i = 0; i < 2; ++i) {
        Reply reply = replyOf([&](auto done) { client_->bulkPlugins(0, done); });
        EXPECT_EQ(ZRDaemonClient::errorInReply(reply)->code, kZRErrorInvalidRequest);
    }
    auto lines = log_.take();
    for (const char* line : {"traffic D: request: <private>", "traffic D: reply: <private>",
                             "ops E: Communications error: connection invalid"})
        EXPECT_THAT(lines, testing::Contains(testing::StartsWith(line)));
}

}  // namespace
}  // namespace zorvan
