#include "platform/Sandbox.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Files.h"
#include "platform/Namespaces.h"
#include "platform/UniqueFd.h"

namespace platform {

namespace {

/// Far above a status file with the most supplementary groups that a process can have.
constexpr std::size_t kMaxStatusFile = 2u << 20;

/// Whether system calls of the process are filtered; none when that cannot be read. A kernel that
/// says nothing about filters has none.
std::optional<bool> hasSeccompFilter(int procDirectory) {
    constexpr std::string_view kField = "\nSeccomp:\t";
    const Result<std::string> status = readFileAt(procDirectory, "status", kMaxStatusFile);
    if (!status) return std::nullopt;
    const std::size_t field = status->find(kField);
    if (field == std::string::npos) return false;
    return status->compare(field + kField.size(), 2, "0\n") != 0;
}

bool haveSeccompFilter() {
    static const bool have = [] {
        const UniqueFd self(::open("/proc/self", O_PATH | O_DIRECTORY | O_CLOEXEC));
        return hasSeccompFilter(self.get()).value_or(false);
    }();
    return have;
}

/// Also true when the root of the process cannot be looked into.
bool mayHaveFlatpakInfo(int procDirectory) {
    struct stat status;
    if (::fstatat(procDirectory, "root/.flatpak-info", &status, AT_SYMLINK_NOFOLLOW) == 0)
        return true;
    return errno != ENOENT && errno != ENOTDIR;
}

class KernelSandbox : public Sandbox {
  public:
    bool isSandboxed(const AuditToken& token) override {
        // The namespaces come first: a process that shares ours did not build the root that the
        // last test looks into. Those of a process that is gone cannot be read.
        for (NamespaceKind kind : {NamespaceKind::User, NamespaceKind::Mount, NamespaceKind::Pid})
            if (!sharesNamespace(token, kind)) return true;
        if (hasSeccompFilter(token.procDirectory()).value_or(true) && !haveSeccompFilter())
            return true;
        return mayHaveFlatpakInfo(token.procDirectory());
    }
    Result<std::string> issueReadExtension(const std::string& path) override {
        return Error::posix(ENOTSUP, path);
    }
};

}  // namespace

std::unique_ptr<Sandbox> makeKernelSandbox() {
    return std::make_unique<KernelSandbox>();
}

}  // namespace platform
