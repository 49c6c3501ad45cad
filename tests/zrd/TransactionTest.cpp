#include "tests/zrd/TransactionTest.h"

#include <filesystem>

#include "Zorvan/Keys.h"

namespace zorvan {

namespace {

using platform::ConnectionError;
using platform::Message;
using testing::Contains;
using namespace std::chrono_literals;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

TEST_F(TransactionTest, VersionAndTypeAreJudgedInThisOrder) {
    const Value none = Dictionary();
    auto version = [](const char* text) { return error(7, text); };
    EXPECT_EQ(ask({{"version", none}}), version("unsupported protocol version 0 (current 3)"));
    EXPECT_EQ(ask({{"version", 4}, {"request", "x"}}),
              version("unsupported protocol version 4 (current 3)"));
    EXPECT_EQ(ask({{"version", -3}}), version("unsupported protocol version 0 (current 3)"));
    EXPECT_EQ(ask({{"version", 0x1FFFFFFFFu}}),
              version("unsupported protocol version -1 (current 3)"));
    for (Dictionary untyped : {Dictionary(), Dictionary{{"request", 1}}})
        EXPECT_EQ(ask(untyped), error(4, "invalid request format (missing type)"));
    EXPECT_EQ(ask({{"request", "Add"}}), error(4, "unrecognized request"));
    LogLines log;
    EXPECT_EQ(ask({{"request", "bulk"}, {"version", 2}, {"flags", 0x1000000FFu}}), Dictionary());
    EXPECT_THAT(log.take(), Contains("ops I: bulk options 0xff not supported"));
}

TEST_F(TransactionTest, PathsAreWalkedUpToTheFirstFailure) {
    const std::string real = directory_.makeDirectory("real"), link = directory_.path("link");
    std::filesystem::create_directory_symlink(real, link);
    const std::string gone = directory_.path("gone"), refused = directory_.makeDirectory("refused");
    const std::string odd = directory_.path("odd");  // leads to a name that no reply can carry
    std::filesystem::create_directory_symlink(directory_.makeDirectory("\xff"), odd);
    workspace_->refused = {refused, gone};
    const std::string longest = directory_.pathOfLength(1023), beyond = longest + "x";
    for (const auto& path : {longest, beyond}) std::filesystem::create_directory(path);
    struct Case {
        const char* type;
        Value paths;
        Dictionary reply;
        std::vector<std::string> changes;
    };
    const Dictionary format = error(4, "invalid request format");
    const Dictionary relative = error(9, "absolute path required: a/b");
    const Case cases[] = {
        {"add", "/x", format, {}},
        {"add", Array{}, {}, {}},
        {"add", Array{link + "/./", real}, {}, {"add " + real, "add " + real}},
        {"add", Array{link, 7, real}, format, {"add " + real}},
        {"add", Array{link, "a/b", real}, relative, {"add " + real}},
        {"add", Array{""}, error(9, "absolute path required: "), {}},
        {"add", Array{real, gone}, error(9, "invalid plugin path: " + gone), {"add " + real}},
        {"add", Array{odd}, error(9, "invalid plugin path: " + odd), {}},
        {"add",
         Array{longest, beyond},
         error(9, "invalid plugin path: " + beyond),
         {"add " + longest}},
        {"add",
         Array{real, refused, link},
         error(2, "unable to register plug-in at " + refused),
         {"add " + real, "add " + refused}},
        {"remove",
         Array{link, gone, real},
         error(9, "no plugin at " + gone),
         {"remove " + real, "remove " + gone}},
        {"remove", Array{}, {}, {}},
    };
    codeSigning_->entitlements = {{entitlement::kManager, true}};
    for (const auto& [type, paths, reply, changes] : cases) {
        EXPECT_EQ(ask({{"request", type}, {"paths", paths}}), reply) << describe(paths);
        EXPECT_EQ(std::exchange(workspace_->changes, {}), changes) << describe(paths);
    }
    EXPECT_EQ(ask({{"request", "add"}}), format);
}

TEST_F(TransactionTest, TheRegistryLearnsThatAConfinedHostAsks) {
    const std::string path = directory_.makeDirectory("plug-in");
    const Dictionary add{{"request", "add"}, {"paths", Array{path}}};
    const Dictionary remove{{"request", "remove"}, {"paths", Array{path}}};
    sandbox_->sandboxed = true;
    codeSigning_->entitlements = {{entitlement::kManager, 0}};
    LogLines log;
    EXPECT_EQ(ask(add), error(2, "unable to register plug-in at " + path));
    EXPECT_THAT(log.take(), Contains("ops -: failed to register plug-in at " + path));
    EXPECT_EQ(ask(remove), error(11, "caller lacks entitlement for this operation"));
    codeSigning_->entitlements = {{entitlement::kManager, true}};
    EXPECT_EQ(ask(remove), error(9, "no plugin at " + path));
    sandbox_->sandboxed = false;
    EXPECT_EQ(ask(add), Dictionary());
    EXPECT_EQ(ask(remove), Dictionary());
}

TEST_F(TransactionTest, MatchAnswersForms) {
    workspace_->installed = {makeProxy("com.a", {{"Color", "red"}}), makeProxy("com.b"),
                             makeProxy("com.b", {{"VXExtensionVersion", "0.9"}})};
    auto versionless = makeProxy("com.c");
    versionless->infoPlist =
        Dictionary{{"VXExtension", Dictionary{{"VXExtensionAttributes", Dictionary()}}}};
    workspace_->installed.push_back(versionless);
    EXPECT_THAT(match({}), ElementsAre("com.a", "com.b"));
    EXPECT_EQ(sandbox_->issued, 2) << "who loses gets no tokens";
    EXPECT_THAT(match({{"rules", Dictionary{{"Color", "red"}}}}), ElementsAre("com.a"));
    EXPECT_THAT(match({{"rules", Dictionary{{"Color", "blue"}}}}), IsEmpty());
    EXPECT_EQ(ask({{"request", "match"}, {"version", 2}}), Dictionary());

    server_->setAnnotation(Dictionary{{"election", 2}}, *server_->plugInForProxy(versionless));
    server_->setAnnotation(Dictionary{{"election", 1}},
                           *server_->plugInForProxy(workspace_->installed[0]));
    const Value matches = *ask({{"request", "match"}}).find("matches");
    const Array& forms = *matches.packed()->value()->array();
    EXPECT_EQ(*forms[0].dictionary()->find("annotations"), Value(Dictionary{{"election", 1}}));
    EXPECT_EQ(*forms[1].dictionary()->find("annotations"), Value(Dictionary()));
    workspace_->queryFails = true;
    EXPECT_THAT(match({{"rules", Dictionary{{"Color", "red"}}}}), IsEmpty());
}

TEST_F(TransactionTest, BadRulesAndForbiddenFlagsAreRefusedBeforeAnyQuery) {
    const auto refusal4 = error(4, "invalid request format (bad rules dictionary)");
    for (Value rules :
         {Value(Array{}), Value("text"), Value(Dictionary{{"k", platform::Uuid::random()}})})
        EXPECT_EQ(ask({{"request", "match"}, {"rules", rules}}), refusal4);
    // What would cost others too much time: rules, values in them, and bytes.
    const auto isRefused = [&](std::size_t keys, std::size_t values, std::size_t bytes) {
        Dictionary rules{{"k", Array(std::vector<Value>(values - 1 - keys, 1))},
                         {"l", std::string(bytes - 2 - (keys - 2) * 2, 'x')}};
        for (std::size_t i = 2; i < keys; ++i) rules.set(std::to_string(i + 8), true);
        return ask({{"request", "match"}, {"rules", rules}}) == refusal4;
    };
    EXPECT_FALSE(isRefused(64, 4096, 262144));
    EXPECT_TRUE(isRefused(65, 4096, 262144));
    EXPECT_TRUE(isRefused(64, 4097, 262144));
    EXPECT_TRUE(isRefused(64, 4096, 262145));
    workspace_->queries = 0;
    const Dictionary all{{"request", "match"}, {"flags", 0x200}, {"rules", Dictionary{{"k", "v"}}}};
    const Dictionary refusal = error(11, "unauthorized discovery flag (ZRDiscoverAll)");
    EXPECT_EQ(ask(all), refusal);
    EXPECT_EQ(workspace_->queries, 0);
    codeSigning_->entitlements = {{entitlement::kManager, true}};
    EXPECT_TRUE(ask(all).contains("matches"));
    sandbox_->sandboxed = true;
    EXPECT_EQ(ask(all), refusal);
    EXPECT_EQ(workspace_->queries, 1);
}

TEST_F(TransactionTest, WhatWaitsForTheRegistryHoldsUpItsSenderAlone) {
    const std::string path = directory_.makeDirectory("plug-in");
    std::promise<void> go;
    workspace_->onChange = [blocked = go.get_future().share()] { blocked.wait(); };
    deliver(Message({{"request", "add"}, {"version", 3}, {"paths", Array{path, path}}}));
    auto other = std::make_shared<FakeConnection>();
    connect(other);
    for (const Value& paths : {Value(Array{}), Value(Array{"/none"})}) {
        other->deliver(Message({{"request", "lock"}, {"version", 3}, {"paths", paths}}));
        EXPECT_EQ(answer(*other).contains("errorcode"), !paths.array()->empty());
    }
    EXPECT_FALSE(connection_->isAnswered);
    go.set_value();
    EXPECT_EQ(answer(*connection_), Dictionary());
    EXPECT_EQ(workspace_->changes.size(), 2u);
    // The walk goes on to its end when its sender is gone.
    std::promise<void> changed, idle;
    workspace_->onChange = [&, left = 2]() mutable {
        client().setAcceptWork(false);
        if (--left == 0) changed.set_value();
    };
    deliver(Message({{"request", "add"}, {"version", 3}, {"paths", Array{path, path}}}));
    for (auto last = changed.get_future(); last.wait_for(0s) != std::future_status::ready;)
        services_.mainLoop->runOnce(1ms);
    server_->submitRegistration([&] { idle.set_value(); });
    idle.get_future().wait();
    drain();
    other->deliver(ConnectionError{ConnectionError::Kind::Invalid, ""});
    EXPECT_EQ(workspace_->changes.size(), 4u);
}

TEST_F(TransactionTest, NobodyMatchesForASenderThatIsGone) {
    workspace_->installed = {makeProxy("com.a"), makeProxy("com.b"), makeProxy("com.c")};
    sandbox_->onIssue = [this] { client().setAcceptWork(false); };
    deliver(Message({{"request", "match"}, {"version", 3}}));
    drain();
    EXPECT_EQ(sandbox_->issued, 1);
    EXPECT_THAT(connection_->sent, IsEmpty());
}

TEST_F(TransactionTest, QueuedRequestsOfADeadClientAreDropped) {
    std::promise<void> go;
    server_->submitWork([blocked = go.get_future().share()] { blocked.wait(); });
    deliver(Message({{"request", "bulk"}, {"version", 3}}));
    deliver(ConnectionError{ConnectionError::Kind::TerminationImminent, ""});
    EXPECT_TRUE(client().acceptWork());
    deliver(ConnectionError{ConnectionError::Kind::Invalid, ""});
    go.set_value();
    drain();
    EXPECT_THAT(connection_->sent, IsEmpty());
}

TEST_F(TransactionTest, ClientsCountTheirRequestsAndDescribeThemselves) {
    EXPECT_EQ(client().pid(), getpid());
    client().setRequestCount(998);
    LogLines log;
    for (int i = 0; i < 3; ++i) ask({{"request", "bulk"}});
    auto lines = log.take();
    EXPECT_EQ(std::ranges::count(lines, "ops D: client " + std::to_string(getpid()) +
                                            " used 1000 requests so far"),
              1);
    EXPECT_THAT(client().description(), HasSubstr(" con=fake pid="));
    auto survivor = std::static_pointer_cast<ZRDLumClient>(connection_->context);
    deliver(ConnectionError{ConnectionError::Kind::Invalid, ""});
    connection_ = std::make_shared<FakeConnection>();
    EXPECT_THAT(survivor->description(), HasSubstr(" NO CONNECTION>"));
    EXPECT_EQ(survivor->pid(), 0);
    EXPECT_TRUE(survivor->isSandboxed());
}

}  // namespace

}  // namespace zorvan
