#include "tests/system/SystemTest.h"

#include <sys/stat.h>

#include <algorithm>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <future>

#include "platform/plist/PropertyList.h"

namespace test {

SystemTest::SystemTest() {
    // Rights count only where nobody else may write: not so everywhere that a tree is cloned to.
    ::umask(022);
    for (const char* suffix : {"", ".entitlements"}) {
        std::filesystem::create_directories(home_.path("bin"));
        std::filesystem::copy_file(std::string(ZRCTL_PROGRAM) + suffix, zrctlProgram_ + suffix);
    }
    const std::pair<const char*, std::string> environment[] = {
        {"XDG_RUNTIME_DIR", home_.makeDirectory("run")},
        {"XDG_DATA_HOME", home_.path("data")},
        {"XDG_DATA_DIRS", home_.path("system")},
        {"XDG_CONFIG_HOME", home_.path("config")},
        {"XDG_STATE_HOME", home_.path("state")},
        {"HOME", home_.path()},
        {"LC_ALL", "C.UTF-8"},
    };
    for (const auto& [name, value] : environment) ::setenv(name, value.c_str(), 1);
}

void SystemTest::TearDown() {
    client_.reset();
    if (zrd_) stop(SIGTERM);
}

std::unique_ptr<Process> SystemTest::spawn(const char* program,
                                           std::vector<std::string> arguments) {
    const std::string output = home_.path("output-" + std::to_string(++processes_));
    return std::make_unique<Process>(program, std::move(arguments), output);
}

void SystemTest::start(std::vector<std::string> arguments) {
    zrd_ = spawn(ZRD_PROGRAM, std::move(arguments));
    ASSERT_TRUE(waitUntil([&] { return !zrd_->isRunning() || RawClient(socket_).isConnected(); }));
    ASSERT_TRUE(zrd_->isRunning()) << zrd_->err();
    client_ = ZRDaemonClient::initWithServiceName(nullptr);
}

void SystemTest::stop(int signal) {
    EXPECT_TRUE(zrd_->isRunning()) << zrd_->err();
    zrd_->signal(signal);
    EXPECT_EQ(zrd_->wait(), signal == SIGKILL ? -signal : 0);
    for (const char* fault : {"Sanitizer", "runtime error", "programming error", "inconsistency"})
        EXPECT_EQ(zrd_->errLines(fault), 0u) << zrd_->err();
    zrd_.reset();
}

std::unique_ptr<Process> SystemTest::zrctl(std::vector<std::string> arguments) {
    auto process = spawn(zrctlProgram_.c_str(), std::move(arguments));
    process->wait();
    return process;
}

Dictionary SystemTest::info(const std::string& identifier, const std::string& version,
                            Dictionary plugIn) {
    const Value* attributes = plugIn.find("VXExtensionAttributes");
    if (!attributes) plugIn.set("VXExtensionAttributes", Dictionary());
    plugIn.set("VXExtensionPointIdentifier", "com.test.point");
    return {{"QFBundleIdentifier", identifier},
            {"QFBundleShortVersionString", version},
            {"VXExtension", std::move(plugIn)}};
}

std::string SystemTest::writePlist(const std::string& relative, const Value& value) const {
    return home_.write(relative, *platform::writeXmlPropertyList(value));
}

std::string SystemTest::writePlugIn(const std::string& bundle, const Dictionary& infoPlist,
                                    const Dictionary& entitlements) const {
    writePlist(bundle + "/Info.plist", infoPlist);
    if (!entitlements.empty()) writePlist(bundle + "/Entitlements.plist", entitlements);
    return home_.path(bundle);
}

ZRDaemonClient::Reply SystemTest::ask(const Question& question) {
    auto answer = std::make_shared<std::promise<ZRDaemonClient::Reply>>();
    question(*client_, [answer](const ZRDaemonClient::Reply& reply) { answer->set_value(reply); });
    return answer->get_future().get();
}

std::string SystemTest::errorOf(const ZRDaemonClient::Reply& reply) {
    const auto error = ZRDaemonClient::errorInReply(reply);
    return error ? std::to_string(error->code) + ' ' + error->description.value_or("") : "";
}

std::string SystemTest::add(const std::vector<std::string>& paths) {
    return errorOf(ask([&](auto& client, auto& reply) { client.addPlugIns(paths, reply); }));
}

std::string SystemTest::remove(const std::vector<std::string>& paths) {
    return errorOf(ask([&](auto& client, auto& reply) { client.removePlugIns(paths, reply); }));
}

std::vector<Dictionary> SystemTest::forms(const Dictionary& rules, std::uint64_t flags) {
    const auto reply =
        ask([&](auto& client, auto& callback) { client.matchPlugIns(rules, flags, callback); });
    EXPECT_EQ(errorOf(reply), "");
    const auto* message = std::get_if<platform::Message>(&reply);
    const Value* packed = message ? message->find(zorvan::message::kMatches) : nullptr;
    const auto matches = packed ? client_->convertFromLum(*packed) : std::nullopt;
    EXPECT_TRUE(matches && matches->array());
    std::vector<Dictionary> found;
    if (matches)
        for (const Value& form : *matches->array()) found.push_back(*form.dictionary());
    return found;
}

std::vector<std::string> SystemTest::match(const Dictionary& rules, std::uint64_t flags) {
    std::vector<std::string> found;
    for (const Dictionary& form : forms(rules, flags))
        found.push_back(form.find("identifier")->string()->string() + ' ' +
                        describe(*form.find("version")));
    std::ranges::sort(found);
    return found;
}

}  // namespace test
