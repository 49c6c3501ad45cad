// The probes as tests see them: these definitions take the place of the daemon's own.

#include "tests/zrd/ProbeTrace.h"

#include "platform/log/Log.h"
#include "zrd/Probes.h"

namespace zorvan::probes {

namespace {

template <class... Arguments>
void note(fmt::format_string<const Arguments&...> format, const Arguments&... arguments) {
    const std::string line = fmt::format(format, arguments...);
    if (ProbeTrace::isOn)
        EVLOG_DEBUG(platform::Log::make("test", "probe"), "{}", platform::pub(line));
}

}  // namespace

bool requestInputEnabled() {
    return ProbeTrace::enablesGuarded;
}
bool requestOutputEnabled() {
    return ProbeTrace::enablesGuarded;
}
void clientNew(int pid) {
    note("client-new {}", pid);
}
void clientDone(int pid) {
    note("client-done {}", pid);
}
void requestInput(int pid, const char* message) {
    note("request-input {} {}", pid, message);
}
void requestOutput(int pid, const char* reply) {
    note("request-output {} {}", pid, reply);
}
void request(int pid, const char* type) {
    note("request {} {}", pid, type ? type : "(null)");
}
void pluginAdd(const char* path) {
    note("plugin-add {}", path);
}
void pluginRemove(const char* path, bool resolved) {
    note("plugin-remove {} {}", path, resolved);
}
void pluginReady(const char* uuid) {
    note("plugin-ready {}", uuid);
}
void discoverRaw(unsigned int plugIns) {
    note("discover-raw {}", plugIns);
}
void dbLoad(const char* errorDomain, std::uint64_t errorCode) {
    note("db-load {} {}", errorDomain, errorCode);
}

}  // namespace zorvan::probes
