#include "platform/Sandbox.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Files.h"
#include "platform/Namespaces.h"
#include "platform/OpsLog.h"
#include "platform/SandboxBroker.h"
#include "platform/SandboxTokens.h"
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

Result<std::unique_ptr<SandboxBroker>> makeBroker(const Directories& directories,
                                                  const std::string& serviceName,
                                                  const Result<SandboxTokens>& tokens,
                                                  RunLoop& loop) {
    if (!tokens) return tokens.error();
    return SandboxBroker::make(directories, serviceName, *tokens, loop);
}

class KernelSandbox : public Sandbox {
  public:
    KernelSandbox(const Directories& directories, const std::string& serviceName, RunLoop& loop)
        : tokens_(SandboxTokens::make(serviceName)),
          broker_(makeBroker(directories, serviceName, tokens_, loop)) {
        if (!broker_)
            EVLOG_ERROR(ops(), "cannot issue sandbox extensions: {}", pub(broker_.error()));
    }

    bool isSandboxed(const AuditToken& token) override { return platform::isSandboxed(token); }

    Result<std::string> issueReadExtension(const std::string& path) override {
        if (!broker_) return broker_.error();
        return tokens_->issue(path);
    }

  private:
    const Result<SandboxTokens> tokens_;
    const Result<std::unique_ptr<SandboxBroker>> broker_;
};

}  // namespace

bool isSandboxed(const AuditToken& token) {
    // The namespaces come first: a process that shares ours did not build the root that the last
    // test looks into. Those of a process that is gone cannot be read.
    for (NamespaceKind kind : {NamespaceKind::User, NamespaceKind::Mount, NamespaceKind::Pid})
        if (!sharesNamespace(token, kind)) return true;
    if (hasSeccompFilter(token.procDirectory()).value_or(true) && !haveSeccompFilter()) return true;
    return mayHaveFlatpakInfo(token.procDirectory());
}

std::unique_ptr<Sandbox> makeKernelSandbox(const Directories& directories,
                                           const std::string& serviceName, RunLoop& loop) {
    return std::make_unique<KernelSandbox>(directories, serviceName, loop);
}

}  // namespace platform
