#pragma once

#include "platform/lum/AuditToken.h"

namespace platform {

/// The kinds of namespaces that tell where a process stands.
enum class NamespaceKind { User, Mount, Pid, Network };

/// Whether a process is in the same namespace as this one. False when its namespace cannot be read:
/// the process is gone, or guards itself against being looked at. From any thread.
bool sharesNamespace(const AuditToken& token, NamespaceKind kind);

}  // namespace platform
