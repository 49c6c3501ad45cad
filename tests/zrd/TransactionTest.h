#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <future>
#include <memory>
#include <string>
#include <vector>

#include "tests/Zorvan/LogLines.h"
#include "tests/support/TemporaryDirectory.h"
#include "tests/zrd/Fakes.h"
#include "zrd/ZRDLumClient.h"
#include "zrd/ZRDServer.h"

namespace zorvan {

/// A server over a registry in memory, with one client whose connection is the test's.
class TransactionTest : public testing::Test {
  protected:
    void SetUp() override {
        services_.directories.runtime = directory_.path("run");
        services_.directories.stateHome = directory_.path("state");
        services_.directories.configHome = directory_.path("config");
        services_.mainLoop = std::make_shared<platform::RunLoop>();
        services_.looks = services_.pathLooks =
            std::make_shared<platform::PeerLooks>(*services_.mainLoop);
        services_.bundleLooks = std::make_shared<platform::PlaceLooks>(*services_.mainLoop);
        services_.workspace = workspace_;
        services_.codeSigning = codeSigning_;
        services_.sandbox = sandbox_;
        services_.launcher = launcher_;
        services_.assertions = assertions_;
        services_.notifications = notifications_;
        services_.consent = std::make_shared<FakeConsent>();
        services_.types = std::make_shared<FakeTypes>();
        server_ = ZRDServer::initForService("zrd", std::nullopt, services_);
        ASSERT_TRUE(server_);
        server_->setCacheLimit(100);
        connect(connection_);
        ASSERT_TRUE(connection_->resumed && workspace_->active);
    }
    void TearDown() override {
        deliver(platform::ConnectionError{platform::ConnectionError::Kind::Invalid, "closed"});
        drain();
    }

    std::shared_ptr<ZRDLumClient> connect(const std::shared_ptr<FakeConnection>& connection) {
        return ZRDLumClient::initWithConnection(
            connection, server_, HostExecutable::of(connection->token, *codeSigning_));
    }
    void deliver(const platform::ConnectionEvent& event) { connection_->deliver(event); }
    /// Waits for everything that has been submitted.
    void drain() {
        std::promise<void> reached;
        server_->submitWork([&] { reached.set_value(); });
        reached.get_future().wait();
    }
    Dictionary ask(Dictionary contents) {
        if (!contents.contains("version")) contents.set("version", 3);
        deliver(platform::Message(std::move(contents)));
        return answer(*connection_);
    }
    /// The one reply to what was delivered.
    Dictionary answer(FakeConnection& connection) {
        for (drain(); !connection.isAnswered; drain())
            services_.mainLoop->runOnce(std::chrono::milliseconds(1));
        connection.isAnswered = false;
        const auto sent = std::exchange(connection.sent, {});
        EXPECT_EQ(sent.size(), 1u);
        return sent.back().contents();
    }
    static Dictionary error(int code, const std::string& text) {
        return {{"errorcode", code}, {"error", text}};
    }
    ZRDLumClient& client() { return *static_cast<ZRDLumClient*>(connection_->context.get()); }
    /// The names in the reply to "match".
    std::vector<std::string> match(Dictionary contents) {
        contents.set("request", "match");
        std::vector<std::string> found;
        const Dictionary reply = ask(std::move(contents));
        const Value* matches = reply.find("matches");
        if (!matches || !matches->packed()) return {"no matches"};
        for (const Value& form : *matches->packed()->value()->array())
            found.push_back(form.dictionary()->find("identifier")->string()->string());
        return found;
    }

    ::test::TemporaryDirectory directory_;
    std::shared_ptr<FakeWorkspace> workspace_ = std::make_shared<FakeWorkspace>();
    std::shared_ptr<FakeCodeSigning> codeSigning_ = std::make_shared<FakeCodeSigning>();
    std::shared_ptr<FakeSandbox> sandbox_ = std::make_shared<FakeSandbox>();
    std::shared_ptr<FakeAssertions> assertions_ = std::make_shared<FakeAssertions>();
    std::shared_ptr<FakeLauncher> launcher_ = std::make_shared<FakeLauncher>();
    std::shared_ptr<FakeNotifications> notifications_ = std::make_shared<FakeNotifications>();
    std::shared_ptr<FakeConnection> connection_ = std::make_shared<FakeConnection>();
    platform::Services services_;
    std::shared_ptr<ZRDServer> server_;
};

}  // namespace zorvan
