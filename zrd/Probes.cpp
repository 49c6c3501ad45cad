#include "zrd/Probes.h"

#if __has_include(<sys/sdt.h>)

// With semaphores, every probe of a source file needs one: tracers raise it while they listen.
#define _SDT_HAS_SEMAPHORES 1  // NOLINT(bugprone-reserved-identifier)
#include <sys/sdt.h>

#define ZRD_PROBE_SEMAPHORE(name) \
    [[gnu::section(".probes"),    \
      gnu::visibility("hidden")]] volatile unsigned short zrd_##name##_semaphore = 0
#define ZRD_PROBE1(name, a) DTRACE_PROBE1(zrd, name, a)
#define ZRD_PROBE2(name, a, b) DTRACE_PROBE2(zrd, name, a, b)
#define ZRD_PROBE_ENABLED(name) (zrd_##name##_semaphore != 0)

extern "C" {
ZRD_PROBE_SEMAPHORE(client__new);
ZRD_PROBE_SEMAPHORE(client__done);
ZRD_PROBE_SEMAPHORE(request__input);
ZRD_PROBE_SEMAPHORE(request);
ZRD_PROBE_SEMAPHORE(request__output);
ZRD_PROBE_SEMAPHORE(plugin__add);
ZRD_PROBE_SEMAPHORE(plugin__remove);
ZRD_PROBE_SEMAPHORE(plugin__ready);
ZRD_PROBE_SEMAPHORE(discover__raw);
ZRD_PROBE_SEMAPHORE(db__load);
}

#else

#define ZRD_PROBE1(name, a) static_cast<void>(a)
#define ZRD_PROBE2(name, a, b) (static_cast<void>(a), static_cast<void>(b))
#define ZRD_PROBE_ENABLED(name) false

#endif

namespace zorvan::probes {

void clientNew(int pid) {
    ZRD_PROBE1(client__new, pid);
}
void clientDone(int pid) {
    ZRD_PROBE1(client__done, pid);
}
bool requestInputEnabled() {
    return ZRD_PROBE_ENABLED(request__input);
}
void requestInput(int pid, const char* message) {
    ZRD_PROBE2(request__input, pid, message);
}
bool requestOutputEnabled() {
    return ZRD_PROBE_ENABLED(request__output);
}
void requestOutput(int pid, const char* reply) {
    ZRD_PROBE2(request__output, pid, reply);
}
void request(int pid, const char* type) {
    ZRD_PROBE2(request, pid, type);
}
void pluginAdd(const char* path) {
    ZRD_PROBE1(plugin__add, path);
}
void pluginRemove(const char* path, bool resolved) {
    ZRD_PROBE2(plugin__remove, path, resolved);
}
void pluginReady(const char* uuid) {
    ZRD_PROBE1(plugin__ready, uuid);
}
void discoverRaw(unsigned int plugIns) {
    ZRD_PROBE1(discover__raw, plugIns);
}
void dbLoad(const char* errorDomain, std::uint64_t errorCode) {
    ZRD_PROBE2(db__load, errorDomain, errorCode);
}

}  // namespace zorvan::probes
