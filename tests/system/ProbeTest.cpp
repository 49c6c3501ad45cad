// What a debugger that listens to the probes is told by the real daemon.

#include <unistd.h>

#include <filesystem>

#include "tests/system/SystemTest.h"

namespace test {

namespace {

TEST_F(SystemTest, TracersAreToldOfEveryProbe) {
    const char* const debugger = "/usr/bin/gdb";
    if (!std::filesystem::exists(debugger)) GTEST_SKIP();
    const std::string path = writePlugIn(plugInPath("A", "one"), info("one"));
    const std::string pid = " " + std::to_string(::getpid());
    struct Probe {
        std::string name, arguments, told;  // "d" or "s" for each argument
    };
    const Probe probes[] = {{"db__load", "sd", " POSIX 2\n"},
                            {"client__new", "d", pid + "\n"},
                            {"request__input", "ds", pid + " {flags: 0, "},
                            {"request", "ds", pid + " match\n"},
                            {"discover__raw", "d", " 1\n"},
                            {"request__output", "ds", pid + " {matches: [{"},
                            {"plugin__add", "s", " " + path + "\n"},
                            {"plugin__remove", "sd", " " + path + " 1\n"},
                            {"plugin__ready", "s", " "},
                            {"client__done", "d", pid + "\n"}};
    std::string script = "set pagination off\n";
    for (const auto& [name, arguments, told] : probes) {
        script += "break -probe-stap zrd:" + name + "\ncommands\nsilent\nprintf \"" + name;
        for (const char kind : arguments) script += std::string(" %") + kind;
        script += "\\n\"";
        for (std::size_t i = 0; i < arguments.size(); ++i)
            script += (arguments[i] == 's' ? ", (char*)$_probe_arg" : ", $_probe_arg") +
                      std::to_string(i);
        script += "\ncontinue\nend\n";
    }
    const std::string file = home_.write("script", script + "run\n");
    const auto tracer = spawn(debugger, {"-q", "-nx", "-batch", "-x", file, ZRD_PROGRAM});
    ASSERT_TRUE(waitUntil([&] { return RawClient(socket_).isConnected(); }));
    client_ = ZRDaemonClient::initWithServiceName(nullptr);
    const std::string uuid = forms().at(0).find("uuid")->string()->string();
    EXPECT_EQ(add({path}), "");
    EXPECT_NE(remove({path}), "");
    ask([&](auto& client, auto& reply) {
        client.readyPlugIns({*platform::Uuid::parse(uuid)}, 0, reply);
    });
    client_.reset();
    const auto isTold = [&](const std::string& line) {
        return waitUntil([&] { return tracer->out().find("\n" + line) != std::string::npos; });
    };
    for (const auto& [name, arguments, told] : probes) EXPECT_TRUE(isTold(name + told)) << name;
    EXPECT_TRUE(isTold("plugin__ready " + uuid + "\n"));
}

}  // namespace

}  // namespace test
