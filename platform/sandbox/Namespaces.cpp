#include "platform/sandbox/Namespaces.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <array>
#include <optional>

#include "platform/system/UniqueFd.h"

namespace platform {

namespace {

struct NamespaceId {
    dev_t device;
    ino_t inode;
    bool operator==(const NamespaceId&) const = default;
};

constexpr std::array<NamespaceKind, 4> kKinds{NamespaceKind::User, NamespaceKind::Mount,
                                              NamespaceKind::Pid, NamespaceKind::Network};

const char* linkName(NamespaceKind kind) {
    switch (kind) {
        case NamespaceKind::User:
            return "ns/user";
        case NamespaceKind::Mount:
            return "ns/mnt";
        case NamespaceKind::Network:
            return "ns/net";
        case NamespaceKind::Pid:
            break;
    }
    return "ns/pid";
}

std::optional<NamespaceId> readId(int procDirectory, NamespaceKind kind) {
    struct stat status;
    if (::fstatat(procDirectory, linkName(kind), &status, 0) != 0) return std::nullopt;
    return NamespaceId{status.st_dev, status.st_ino};
}

/// This process's namespaces, which it never leaves.
const std::array<std::optional<NamespaceId>, kKinds.size()>& ownIds() {
    static const auto ids = [] {
        std::array<std::optional<NamespaceId>, kKinds.size()> result;
        const UniqueFd self(::open("/proc/self", O_PATH | O_DIRECTORY | O_CLOEXEC));
        for (NamespaceKind kind : kKinds)
            result[static_cast<std::size_t>(kind)] = readId(self.get(), kind);
        return result;
    }();
    return ids;
}

}  // namespace

bool sharesNamespace(const AuditToken& token, NamespaceKind kind) {
    const std::optional<NamespaceId> id = readId(token.procDirectory(), kind);
    return id && id == ownIds()[static_cast<std::size_t>(kind)];
}

}  // namespace platform
