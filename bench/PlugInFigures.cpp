#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>

#include "Zorvan/ZRPlugInProcess.h"
#include "bench/EchoServer.h"
#include "bench/Failure.h"
#include "bench/Figures.h"
#include "bench/Frames.h"
#include "bench/Measure.h"
#include "bench/Questions.h"

namespace bench {

namespace {

constexpr const char* kBubblewrap = "/usr/bin/bwrap";

void readOneByte(int source, const char* whose) {
    char byte;
    if (::read(source, &byte, 1) != 1) fail("{} has said nothing", whose);
}

/// From the request to the first byte from the plug-in.
double startOnce(const std::string& executable) {
    const double start = now();
    std::optional<zorvan::ZRError> error;
    const auto plugIn = zorvan::ZRPlugInProcess::start(nullptr, executable, {}, error);
    if (!plugIn) fail("the plug-in cannot be started: {}", describe(*error));
    readOneByte(plugIn->connection(), "the plug-in");
    return now() - start;
}

/// The same executable in a bare sandbox, with the same namespaces.
double startBarely(const std::string& executable, const std::string& fifo, int output) {
    const std::vector<std::string> arguments{
        "--unshare-all", "--share-net", "--cap-drop", "ALL",   "--new-session", "--die-with-parent",
        "--ro-bind",     "/",           "/",          "--dev", "/dev",          "--proc",
        "/proc",         "--",          executable};
    const double start = now();
    const Child sandbox(kBubblewrap, arguments, {"PATH=/usr/bin:/bin"}, fifo);
    readOneByte(output, "a bare bubblewrap");
    return now() - start;
}

void measureReady(const Run& run, FrameClient& client, const std::string& request) {
    // Once at least: only what was made ready may be started.
    const std::string reply(client.exchange(request));
    expectSuccess(reply);
    if (!run.report.wants({"ready/p50"})) return;
    const EchoServer server(run.scratch, "ready", reply, EchoKind::Blocking);
    FrameClient echo(server.socketPath());
    const Plan plan{3000, 20, run.quick ? 0.3 : 2.5};
    const auto p50 = medianOfEach(
        plan, {timed([&] { client.exchange(request); }), timed([&] { echo.exchange(request); })});
    run.report.add({.key = "ready/p50",
                    .title = "ready of one plug-in, p50",
                    .value = p50[0],
                    .besideSource = "echo",
                    .beside = p50[1]});
}

void measureStart(const Run& run, const std::string& executable) {
    if (!run.report.wants({"start-plug-in/p50"})) return;
    const std::string fifo = run.scratch + "/first-byte";
    if (::mkfifo(fifo.c_str(), 0600) < 0 && errno != EEXIST) failErrno(fifo);
    const platform::UniqueFd output(::open(fifo.c_str(), O_RDWR | O_CLOEXEC));
    if (!output) failErrno(fifo);
    const Plan plan{100, 5, run.quick ? 0.3 : 2.5};
    const auto p50 =
        medianOfEach(plan, {[&] { return startOnce(executable); },
                            [&] { return startBarely(executable, fifo, output.get()); }});
    run.report.add({.key = "start-plug-in/p50",
                    .title = "start of a plug-in, to its first byte, p50",
                    .value = p50[0],
                    .besideSource = "baseline",
                    .beside = p50[1]});
}

}  // namespace

void measurePlugIns(const Run& run) {
    if (!run.report.wants({"ready/p50", "start-plug-in/p50"})) return;
    const World& world = run.largest();
    const Child daemon = world.startDaemon();
    FrameClient client(waitForSocket(world.socketPath(), daemon));
    const std::string forms(client.exchange(Question::byPoint(10).frame));
    daemon.waitUntilIdle();
    measureReady(run, client, readyRequest(uuidsIn(forms).at(0)));
    if (::access(kBubblewrap, X_OK) != 0) {
        fmt::print(stderr, "zrd_bench: no figure start-plug-in/p50: there is no bubblewrap\n");
        return;
    }
    ::setenv("XDG_RUNTIME_DIR", world.runtimeDirectory().c_str(), 1);
    const std::string bundle = pathsIn(forms).at(0);
    const std::string name = bundle.substr(bundle.rfind('/') + 1);
    measureStart(run, bundle + "/" + name.substr(0, name.rfind('.')));
}

}  // namespace bench
