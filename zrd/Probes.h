#pragma once

#include <cstdint>

/// The trace probes of the provider `zrd`, as user-level statically defined tracing (USDT):
/// `readelf -n` lists them, and debuggers and tracers attach to them by name ("-" of a probe's name
/// is written "__"). A build without <sys/sdt.h> leaves them out behind these same functions.
namespace zorvan::probes {

void clientNew(int pid);
void clientDone(int pid);

/// The two guarded probes: compute their text only when somebody listens.
bool requestInputEnabled();
void requestInput(int pid, const char* message);
bool requestOutputEnabled();
void requestOutput(int pid, const char* reply);

/// `type` may be null.
void request(int pid, const char* type);
void pluginAdd(const char* path);
void pluginRemove(const char* path, bool resolved);
void pluginReady(const char* uuid);
void discoverRaw(unsigned int plugIns);
void dbLoad(const char* errorDomain, std::uint64_t errorCode);

}  // namespace zorvan::probes
