#pragma once

#include <atomic>

namespace zorvan {

/// While it lives somebody traces: every probe is a line of the log's category "probe", in its
/// place among the daemon's; the two guarded ones only if they are enabled.
struct ProbeTrace {
    ProbeTrace() { isOn = true; }
    ~ProbeTrace() { isOn = enablesGuarded = false; }

    static inline std::atomic<bool> isOn = false, enablesGuarded = false;
};

}  // namespace zorvan
