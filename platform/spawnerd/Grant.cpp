#include "platform/spawnerd/Grant.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <optional>
#include <string_view>

#include "platform/Directories.h"
#include "platform/Files.h"
#include "platform/lum/LumBundle.h"
#include "platform/spawnerd/Protocol.h"
#include "platform/spawnerd/SandboxProfile.h"

namespace platform::spawnerd {

namespace {

std::optional<Error> checkExecutable(const std::string& path) {
    struct stat status;
    if (path.empty() || path.front() != '/' || path.find('\0') != std::string::npos)
        return Error::posix(EINVAL, path);
    if (::stat(path.c_str(), &status) != 0) return Error::posix(errno, path);
    if (!S_ISREG(status.st_mode)) return Error::posix(EACCES, path);
    if (::access(path.c_str(), X_OK) != 0) return Error::posix(errno, path);
    return std::nullopt;
}

/// The text of the first of the keys that is there.
std::string textAt(const Dictionary& info, std::initializer_list<const char*> keys) {
    for (const char* key : keys) {
        const Value* value = info.find(key);
        if (value && value->string()) return *value->string();
    }
    return {};
}

std::string plugInIdentifier(const Dictionary& info, const std::string& bundleIdentifier) {
    constexpr const char* kIdentifier = "VXExtensionIdentifier";
    const Value* extension = info.find("VXExtension");
    const Dictionary* plugIn = extension ? extension->dictionary() : nullptr;
    std::string identifier = plugIn ? textAt(*plugIn, {kIdentifier}) : std::string();
    if (identifier.empty()) identifier = textAt(info, {kIdentifier});
    return identifier.empty() ? bundleIdentifier : identifier;
}

bool isVariableName(std::string_view name) {
    return !name.empty() && name.find('=') == name.npos && name.find('\0') == name.npos;
}

std::optional<Error> readEnvironment(const Dictionary& service, Grant& grant) {
    const Value* value = service.find("EnvironmentVariables");
    if (!value) return std::nullopt;
    const Dictionary* variables = value->dictionary();
    if (!variables) return Error::posix(EINVAL, "\"EnvironmentVariables\" is no dictionary");
    std::size_t bytes = 0;
    for (const auto& [name, content] : *variables) {
        const std::string* text = content.string();
        if (!text || !isVariableName(name) || text->find('\0') != std::string::npos)
            return Error::posix(EINVAL, "environment variable \"" + name + "\"");
        bytes += name.size() + text->size();
        if (bytes > kMaxStringBytes || grant.environment.size() == kMaxStrings)
            return Error::posix(E2BIG, "environment");
        grant.environment.emplace_back(name, *text);
    }
    return std::nullopt;
}

std::optional<Error> readOverlay(const Dictionary& overlay, Grant& grant) {
    const Value* type = overlay.find("QFBundlePackageType");
    const Value* value = overlay.find("LUMService");
    const Dictionary* service = value ? value->dictionary() : nullptr;
    if (!service || !type || *type != Value("LUM!"))
        return Error::posix(EINVAL, "activation overlay");
    const Value* profile = service->find("_SandboxProfile");
    if (profile && profile->string()) grant.profile = findSandboxProfile(*profile->string());
    if (!grant.profile) return Error::posix(EINVAL, "\"_SandboxProfile\" names no profile");
    return readEnvironment(*service, grant);
}

}  // namespace

std::optional<Error> checkOwnDirectory(const std::string& path) {
    struct stat status;
    if (::lstat(path.c_str(), &status) != 0)
        return errno == ENOENT ? std::nullopt : std::optional(Error::posix(errno, path));
    if (!S_ISDIR(status.st_mode)) return Error::posix(ENOTDIR, path);
    if (status.st_uid != ::geteuid()) return Error::posix(EPERM, path);
    return std::nullopt;
}

Result<Grant> Grant::make(const Directories& directories, const std::string& executable,
                          const Dictionary& overlay) {
    if (auto error = checkExecutable(executable)) return *error;
    Grant grant;
    grant.executable = executable;
    const auto bundle = LumBundle::make(executable, LumBundle::Executable);
    const auto path = bundle->property(LumBundle::BundlePath);
    const auto info = bundle->infoDictionary();
    if (!path || !info) return Error::posix(EINVAL, "no bundle around " + executable);
    grant.bundle = *path;
    grant.bundleIdentifier = textAt(*info, {"QFBundleIdentifier"});
    grant.bundleVersion = textAt(*info, {"QFBundleVersion", "QFBundleShortVersionString"});
    const std::string identifier = plugInIdentifier(*info, grant.bundleIdentifier);
    if (grant.bundleIdentifier.empty()) grant.bundleIdentifier = identifier;
    if (!isSafeName(grant.bundleIdentifier) || !isSafeName(identifier))
        return Error::posix(EINVAL, "the bundle's identifier, " + grant.bundle);

    const std::string container = joinPath(directories.zorvanData() + "/Containers", identifier);
    if (auto error = checkOwnDirectory(container)) return *error;
    if (::access(container.c_str(), F_OK) == 0) grant.container = container;
    if (auto error = readOverlay(overlay, grant)) return *error;
    return grant;
}

}  // namespace platform::spawnerd
