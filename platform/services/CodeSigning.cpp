#include "platform/services/CodeSigning.h"

#include <fcntl.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <string_view>
#include <utility>

#include "platform/log/OpsLog.h"
#include "platform/lum/LumBundle.h"
#include "platform/plist/PropertyList.h"
#include "platform/sandbox/Sandbox.h"
#include "platform/system/Files.h"
#include "platform/system/OpenBeneath.h"
#include "platform/system/PinnedDirectory.h"

namespace platform {

namespace {

constexpr std::string_view kRestriction = "com.orbel.developer.zorvan.allowedplugins";
constexpr std::string_view kPrivatePrefix = "com.orbel.private.";
/// Stands for a restriction that could not be read: no dictionary, and so nothing that admits.
constexpr const char* kUnreadableRestriction = "unreadable";

/// Largest entitlement file that is read, on accepting a peer.
constexpr std::size_t kMaxEntitlements = 64u << 10;

/// What an entitlement file holds, and who may have written it.
struct Entitlements {
    Dictionary values;
    FileTrust trust = FileTrust::Others;
    std::string weakest;
};

/// Without a file there are no entitlements, and no error.
Result<Entitlements> orMissing(const Error& error) {
    if (error.code == ENOENT) return Entitlements{};
    return error;
}

/// Of an executable in an open directory.
std::string entitlementsName(int directory, const std::string& executable) {
    return LumBundle::isAt(directory)
               ? std::string("Entitlements.plist")
               : std::string(lastPathComponent(executable)) + ".entitlements";
}

Result<Entitlements> readEntitlements(const std::string& executable) {
    const auto directory = PinnedDirectory::open(std::string(parentPath(executable)), ::geteuid());
    if (!directory) return orMissing(directory.error());
    const std::string name = entitlementsName(directory->descriptor(), executable);
    const auto file = directory->file(name);
    if (!file) return orMissing(file.error());

    const std::string path = joinPath(parentPath(executable), name);
    const Result<std::string> bytes = file->read(kMaxEntitlements);
    if (!bytes) return Error::posix(bytes.error().code, path);
    const Result<Value> value = parsePropertyList(*bytes);
    if (!value)
        return Error{value.error().domain, value.error().code, path + ": " + value.error().text};
    const Dictionary* values = value->dictionary();
    if (!values) return Error{"PropertyList", 0, path + ": the entitlements are no dictionary"};
    return Entitlements{*values, file->trust, file->weakest};
}

class FileTask : public CodeSigningTask {
  public:
    /// Holds nothing.
    FileTask() = default;
    explicit FileTask(const AuditToken& token) { read(token); }
    explicit FileTask(Error error) : error_(std::move(error)) {}

    Answer entitlement(const std::string& name) override {
        if (error_) {
            // Every candidate of every discovery asks: the failure is told once.
            auto error = isTold_.exchange(true) ? std::nullopt : error_;
            if (name == kRestriction) return {Value(kUnreadableRestriction), error};
            return {std::nullopt, error};
        }
        const Value* value = holds(name) ? values_.find(name) : nullptr;
        return {value ? std::optional(*value) : std::nullopt, std::nullopt};
    }

  private:
    void read(const AuditToken& token) {
        const std::optional<std::string>& executable = token.executablePath();
        if (!executable) return;
        Result<Entitlements> entitlements = readEntitlements(*executable);
        if (!entitlements) {
            error_ = entitlements.error();
            EVLOG_ERROR(ops(), "cannot read entitlements of process {}: {}", token.pid(),
                        pub(*error_));
            return;
        }
        values_ = std::move(entitlements->values);
        if (values_.empty()) return;
        const bool sandboxed = isSandboxed(token);
        trusted_ = entitlements->trust >= (sandboxed ? FileTrust::Root : FileTrust::User);
        if (!trusted_)
            EVLOG_INFO(ops(), "entitlements of process {} do not count: others may write {}",
                       token.pid(), pub(entitlements->weakest));
        mayHoldPrivate_ = !isConfined(token);
    }

    bool holds(std::string_view name) const {
        if (name == kRestriction) return true;
        return trusted_ && (mayHoldPrivate_ || !name.starts_with(kPrivatePrefix));
    }

    std::atomic<bool> isTold_ = false;
    // What follows does not change any more once it is made.
    std::optional<Error> error_;
    Dictionary values_;
    bool trusted_ = false;
    bool mayHoldPrivate_ = false;
};

class FileCodeSigning : public CodeSigning {
  public:
    std::unique_ptr<CodeSigningTask> makeTask(const AuditToken& token) override {
        return std::make_unique<FileTask>(token);
    }
    std::unique_ptr<CodeSigningTask> makeTaskAtOnce(const AuditToken& token, int folder) override {
        const std::string name = entitlementsName(folder, token.executablePath().value_or(""));
        const auto file = openBeneath(folder, name, O_PATH | O_NOFOLLOW);
        const bool isMissing = !file && file.error().code == ENOENT;
        return isMissing ? std::make_unique<FileTask>() : nullptr;
    }
};

}  // namespace

std::unique_ptr<CodeSigning> makeFileCodeSigning() {
    return std::make_unique<FileCodeSigning>();
}

std::unique_ptr<CodeSigningTask> makeUnreadableTask() {
    return std::make_unique<FileTask>(Error::posix(ETIMEDOUT, "entitlements"));
}

}  // namespace platform
