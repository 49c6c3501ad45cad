#pragma once

#include <fcntl.h>
#include <sys/wait.h>

#include <algorithm>
#include <csignal>
#include <string>
#include <vector>

#include "platform/lum/ClientConnection.h"
#include "platform/plist/PropertyList.h"
#include "platform/spawnerd/ProcessLauncher.h"
#include "platform/spawnerd/Protocol.h"
#include "platform/system/Files.h"
#include "tests/platform/lum/LumFixture.h"
#include "tests/support/KnownDirectory.h"
#include "tests/support/TemporaryDirectory.h"

namespace platform::spawnerd {

/// A launcher with real sandboxes on a loop that the test steps; the test's own process is a host.
class LauncherTest : public lum::LumTest {
  protected:
    LauncherTest() {
        directories.dataHome = home.makeDirectory("data");
        useLauncher({});
    }
    void useLauncher(const Programs& programs) {
        launcher.reset();
        launcher.emplace(
            directories, "test", std::shared_ptr<RunLoop>(&loop, [](RunLoop*) {}),
            [this](const auto& key) { return Value(*settings.find(key)); }, nullptr, programs);
        loop.poll();
        connection.emplace(directories, "test.spawnerd", queue);
        connection->resume();
    }

    /// A bundle whose executable is a shell script that speaks to its host over its standard input
    /// and output; answers the executable's path.
    std::string plugIn(const std::string& name, const std::string& script,
                       const std::string& version = "1") {
        writeInfo(name, {{"QFBundleIdentifier", name}, {"QFBundleVersion", version}});
        const std::string path =
            home.write(name + ".appex/run", "#!/bin/sh\nexec <&3 >&3\n" + script + "\n");
        std::filesystem::permissions(path, std::filesystem::perms::owner_all);
        return path;
    }
    void writeInfo(const std::string& name, const Dictionary& info) {
        home.write(name + ".appex/Info.plist", *writeXmlPropertyList(info));
    }
    std::string container(const std::string& name) {
        return home.makeDirectory("data/zorvan/Containers/" + name);
    }
    static Dictionary overlay(Value environment = Dictionary(), Value profile = "plugin") {
        const Dictionary service{{"EnvironmentVariables", environment},
                                 {"_SandboxProfile", profile}};
        return {{"LUMService", service}, {"QFBundlePackageType", "LUM!"}};
    }
    int grant(const std::string& executable, const Dictionary& settings = overlay()) {
        return launcher->addExternalService(*AuditToken::ofSelf(), service(executable), settings);
    }
    /// The executable with its bundle, and the container of the bundle's name.
    ExternalService service(const std::string& executable) const {
        const std::filesystem::path bundle(parentPath(executable));
        return {executable, test::known(bundle),
                home.path("data/zorvan/Containers/" + bundle.stem().string())};
    }

    /// A request, and its reply; empty when there was none.
    Message ask(Dictionary request) {
        std::optional<ClientConnection::Reply> reply;
        connection->sendWithReply(Message(std::move(request)), [&](const auto& r) { reply = r; });
        EXPECT_TRUE(stepUntil([&] { return reply.has_value(); }));
        const auto* message = std::get_if<Message>(&*reply);
        return message ? *message : Message();
    }
    Message start(const std::string& executable, Value arguments = Array()) {
        return ask({{"request", "start"}, {"executable", executable}, {"arguments", arguments}});
    }
    /// The number under a key of a reply; -1 when it has none.
    static std::int64_t number(const Message& reply, const char* key) {
        const Value* value = reply.find(key);
        return value ? value->signedInteger().value_or(-1) : -1;
    }
    Message askAbout(const char* request, const Message& started) {
        return ask({{"request", request}, {"instance", number(started, kInstance)}});
    }

    /// Sends a text, and nothing more, and answers all that comes back until the plug-in's end.
    std::string talk(const UniqueFd& plugIn, const std::string& text = "") {
        std::string answer;
        ::send(plugIn.get(), text.data(), text.size(), MSG_NOSIGNAL);
        ::shutdown(plugIn.get(), SHUT_WR);
        EXPECT_TRUE(stepUntil([&] {
            char buffer[4096];
            const ssize_t count = ::recv(plugIn.get(), buffer, sizeof buffer, MSG_DONTWAIT);
            if (count > 0) answer.append(buffer, static_cast<std::size_t>(count));
            return count == 0;
        }));
        return answer;
    }

    /// The processes with a text in their command lines.
    static std::vector<std::string> processesWith(const std::string& text) {
        std::vector<std::string> found;
        std::error_code gone;
        for (const auto& entry : std::filesystem::directory_iterator("/proc")) {
            const auto line = readFile(entry.path() / "cmdline", 1u << 20);
            if (line && line->find(text) != std::string::npos) found.push_back(entry.path());
        }
        return found;
    }

    test::TemporaryDirectory home;
    Dictionary settings{{"extension-points", Dictionary()}, {"plug-ins", Dictionary()}};
    std::optional<ProcessLauncher> launcher;
    std::optional<ClientConnection> connection;
};

}  // namespace platform::spawnerd
