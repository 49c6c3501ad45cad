#include "platform/sandbox/Namespaces.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <optional>
#include <string>

namespace platform {

namespace {

struct NamespaceId {
    dev_t device;
    ino_t inode;
    bool operator==(const NamespaceId&) const = default;
};

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

std::optional<NamespaceId> readId(int procDirectory, const std::string& link) {
    struct stat status;
    if (::fstatat(procDirectory, link.c_str(), &status, 0) != 0) return std::nullopt;
    return NamespaceId{status.st_dev, status.st_ino};
}

}  // namespace

bool sharesNamespace(const AuditToken& token, NamespaceKind kind) {
    const std::string link = linkName(kind);
    const std::optional<NamespaceId> id = readId(token.procDirectory(), link);
    // Ours is looked at each time: a look that fails once, for want of memory, must not count for
    // as long as this process lives. It takes no descriptor, of which others may leave none.
    return id && id == readId(AT_FDCWD, "/proc/self/" + link);
}

}  // namespace platform
