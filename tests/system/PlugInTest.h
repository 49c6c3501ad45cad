#pragma once

#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <filesystem>
#include <optional>
#include <string>
#include <vector>

#include "Zorvan/ZRPlugInProcess.h"
#include "tests/system/SystemTest.h"

namespace test {

/// Whether, within a limit of time, nothing that a plug-in has started holds its connection.
inline bool hasClosed(const zorvan::ZRPlugInProcess& process) {
    pollfd state{process.connection(), POLLIN, 0};
    char byte = 0;
    return ::poll(&state, 1, 10000) == 1 &&
           ::recv(process.connection(), &byte, 1, MSG_DONTWAIT) <= 0;
}

/// A daemon that knows "com.test.upper", a plug-in of an application that turns what it is sent
/// into upper case and is busy from then on.
class PlugInTest : public SystemTest {
  protected:
    void SetUp() override {
        writePlugIn(bundle_, upperInfo());
        std::filesystem::copy_file(TEST_PLUGIN, home_.path(bundle_ + "/run"));
        start({"-v"});
        uuid_ = uuidOf("com.test.upper");
    }
    static Dictionary upperInfo() {
        Dictionary upper = info("com.test.upper");
        upper.set("QFBundleExecutable", "run");
        return upper;
    }
    platform::Uuid uuidOf(const std::string& identifier) {
        const auto found = forms({{"VXExtensionIdentifier", identifier}});
        return platform::Uuid::parse(*found.at(0).find("uuid")->string()).value();
    }

    std::string ready(const platform::Uuid& plugIn) {
        return errorOf(
            ask([&](auto& client, auto& reply) { client.readyPlugIns({plugIn}, 0, reply); }));
    }
    ZRDaemonClient::Reply hold(std::uint64_t flags, const std::string& path) {
        return ask([&](auto& client, auto& reply) { client.holdPlugins({path}, flags, reply); });
    }
    /// Null, with the errno in `failure_`, when it is not started.
    std::unique_ptr<zorvan::ZRPlugInProcess> startPlugIn() {
        std::optional<zorvan::ZRError> error;
        auto process =
            zorvan::ZRPlugInProcess::start(nullptr, home_.path(bundle_ + "/run"), {}, error);
        failure_ = error ? error->code : 0;
        return process;
    }
    static std::string talk(const zorvan::ZRPlugInProcess& process, const std::string& text) {
        std::string answer(text.size(), ' ');
        EXPECT_EQ(::send(process.connection(), text.data(), text.size(), MSG_NOSIGNAL),
                  static_cast<ssize_t>(text.size()));
        ::recv(process.connection(), answer.data(), answer.size(), MSG_WAITALL);
        return answer;
    }

    const std::string application_ = kApps + std::string("A.app");
    const std::string bundle_ = plugInPath("A", "upper");
    platform::Uuid uuid_;
    int failure_ = 0;
};

/// For tests that start plug-ins.
#define NEEDS_BUBBLEWRAP() \
    if (::access("/usr/bin/bwrap", X_OK) != 0) GTEST_SKIP() << "there is no bubblewrap"

}  // namespace test
