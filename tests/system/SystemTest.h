#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

#include "Zorvan/Keys.h"
#include "Zorvan/ZRDaemonClient.h"
#include "tests/support/TemporaryDirectory.h"
#include "tests/system/Process.h"
#include "tests/system/RawClient.h"

namespace test {

using platform::Array;
using platform::Dictionary;
using platform::Value;
using zorvan::ZRDaemonClient;

/// The real daemon on a real socket, with a home of its own.
class SystemTest : public testing::Test {
  protected:
    SystemTest();
    /// The daemon must still run, and nothing may have been wrong with it on the way.
    void TearDown() override;

    /// Starts the daemon and waits for its socket.
    void start(std::vector<std::string> arguments = {});
    /// Ends the daemon, and expects that it ran until then.
    void stop(int signal);
    std::unique_ptr<Process> spawn(const char* program, std::vector<std::string> arguments);
    /// Runs `zrctl` to its end.
    std::unique_ptr<Process> zrctl(std::vector<std::string> arguments);

    /// The Info.plist of a good plug-in of the extension point "com.test.point".
    static Dictionary info(const std::string& identifier, const std::string& version = "1",
                           Dictionary plugIn = {});
    /// Writes a property list under the home directory; answers its path.
    std::string writePlist(const std::string& relative, const Value& value) const;
    /// Writes a plug-in bundle (its files, not its application's); answers its path.
    std::string writePlugIn(const std::string& bundle, const Dictionary& infoPlist,
                            const Dictionary& entitlements = {}) const;
    /// Where applications are found, and one of them, under the home directory.
    static constexpr const char* kApps = "data/zorvan/Applications/";
    std::string plugInPath(const std::string& application, const std::string& name) const {
        return kApps + application + ".app/PlugIns/" + name + ".appex";
    }

    /// A request by this process, and its reply: contents, or {"errorcode", "error"}.
    using Question =
        std::function<void(ZRDaemonClient&, const ZRDaemonClient::ReplyCallback& reply)>;
    ZRDaemonClient::Reply ask(const Question& question);
    /// "<code> <text>" of a reply's error; empty for success.
    static std::string errorOf(const ZRDaemonClient::Reply& reply);
    std::string add(const std::vector<std::string>& paths);
    std::string remove(const std::vector<std::string>& paths);
    std::vector<Dictionary> forms(const Dictionary& rules = {}, std::uint64_t flags = 0);
    /// "<identifier> <version>" of each match, sorted.
    std::vector<std::string> match(const Dictionary& rules = {}, std::uint64_t flags = 0);

    TemporaryDirectory home_;
    const std::string zrctlProgram_ = home_.path("bin/zrctl");  // with its rights
    const std::string socket_ = home_.path("run/zorvan/services/com.orbel.zorvan.zrd");
    std::unique_ptr<Process> zrd_;
    std::shared_ptr<ZRDaemonClient> client_;
    int processes_ = 0;
};

}  // namespace test
