#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "Zorvan/ZRBundle.h"
#include "platform/lum/Connection.h"
#include "platform/lum/PeerLooks.h"
#include "platform/services/CodeSigning.h"

namespace zorvan {

/// What a host's executable tells about the host. A value.
struct HostExecutable {
    std::string path;                                 // empty when it cannot be told
    std::shared_ptr<ZRBundle> bundle;                 // null likewise
    std::shared_ptr<platform::CodeSigningTask> task;  // never null

    /// Looks at the executable of a process; may hang with its file system.
    static HostExecutable of(const platform::AuditToken& token, platform::CodeSigning& signing);
    /// The same without waiting for anybody. None when that does not do.
    static std::optional<HostExecutable> atOnce(const platform::AuditToken& token,
                                                platform::CodeSigning& signing);
    /// Calls `use` with what is found at once, or else has one of `looks` made, then calls `use`
    /// on their loop. Of an executable that could not be looked at in time nothing is known, and
    /// its entitlements count as unreadable.
    static void find(const platform::Connection& host,
                     std::shared_ptr<platform::CodeSigning> signing, platform::PeerLooks& looks,
                     std::function<void(HostExecutable)> use);
};

}  // namespace zorvan
