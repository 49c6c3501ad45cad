#include "platform/spawnerd/Grant.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <optional>
#include <string_view>

#include "platform/plist/PropertyList.h"
#include "platform/spawnerd/Launcher.h"
#include "platform/spawnerd/Protocol.h"
#include "platform/spawnerd/SandboxProfile.h"
#include "platform/system/Directories.h"
#include "platform/system/Files.h"
#include "platform/system/OpenBeneath.h"
#include "platform/system/OwnMounts.h"

namespace platform::spawnerd {

namespace {

constexpr const char* kInfoPlist = "Info.plist";
constexpr const char* kEntitlements = "Entitlements.plist";
constexpr const char* kExtension = "VXExtension";
constexpr const char* kExtensionPoint = "VXExtensionPointIdentifier";

/// What lies behind a directory in the path of something in it; empty when that lies elsewhere.
std::string pathWithin(const std::string& directory, const std::string& path) {
    if (directory.empty() || !path.starts_with(directory + '/')) return {};
    return path.substr(directory.size() + 1);
}

std::optional<Error> checkExecutable(int bundle, const std::string& name, const std::string& path) {
    const Result<UniqueFd> file = openBeneath(bundle, name, O_PATH);
    if (!file) return Error::posix(file.error().code, path);
    struct stat status {};
    if (::fstat(file->get(), &status) != 0) return Error::posix(errno, path);
    if (!S_ISREG(status.st_mode)) return Error::posix(EACCES, path);
    const std::string opened = "/proc/self/fd/" + std::to_string(file->get());
    if (::access(opened.c_str(), X_OK) != 0) return Error::posix(errno, path);
    return std::nullopt;
}

/// A property list of an open bundle; none when it has none that can be used.
std::optional<Dictionary> readList(int bundle, const char* name) {
    const Result<Value> value = readPropertyListBeneath(bundle, name);
    const Dictionary* dictionary = value ? value->dictionary() : nullptr;
    return dictionary ? std::optional(*dictionary) : std::nullopt;
}

/// The text of the first of the keys that is there.
std::string textAt(const Dictionary& info, std::initializer_list<const char*> keys) {
    for (const char* key : keys) {
        const Value* value = info.find(key);
        if (value && value->string()) return value->string()->string();
    }
    return {};
}

const Dictionary* dictionaryAt(const Dictionary* dictionary, const char* key) {
    const Value* value = dictionary ? dictionary->find(key) : nullptr;
    return value ? value->dictionary() : nullptr;
}

/// The profile and the limits go by the plug-in dictionary's extension point, hosts also find a
/// plug-in by its attributes and the top level: whoever is found as a keyboard is confined as one.
bool statesOneExtensionPoint(const Dictionary& info) {
    const Dictionary* plugIn = dictionaryAt(&info, kExtension);
    const Value* own = plugIn ? plugIn->find(kExtensionPoint) : nullptr;
    if (own && !own->string()) return false;
    for (const Dictionary* place : {dictionaryAt(plugIn, "VXExtensionAttributes"), &info}) {
        const Value* other = place ? place->find(kExtensionPoint) : nullptr;
        if (other && (!own || *other != *own)) return false;
    }
    return true;
}

void readIdentifiers(const Dictionary& info, Grant& grant) {
    constexpr const char* kIdentifier = "VXExtensionIdentifier";
    if (const Dictionary* plugIn = dictionaryAt(&info, kExtension)) {
        grant.plugInIdentifier = textAt(*plugIn, {kIdentifier});
        grant.extensionPoint = textAt(*plugIn, {kExtensionPoint});
    }
    if (grant.plugInIdentifier.empty()) grant.plugInIdentifier = textAt(info, {kIdentifier});
    grant.bundleIdentifier = textAt(info, {"QFBundleIdentifier"});
    if (grant.plugInIdentifier.empty()) grant.plugInIdentifier = grant.bundleIdentifier;
    if (grant.bundleIdentifier.empty()) grant.bundleIdentifier = grant.plugInIdentifier;
    grant.bundleVersion = textAt(info, {"QFBundleVersion", "QFBundleShortVersionString"});
}

bool asksForNetwork(int bundle) {
    const auto entitlements = readList(bundle, kEntitlements);
    const Value* value = entitlements ? entitlements->find(kNetworkEntitlement) : nullptr;
    return value && value->boolean().value_or(false);
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
        const auto* text = content.string();
        if (!text || !isVariableName(name) || text->view().find('\0') != std::string_view::npos)
            return Error::posix(EINVAL, "environment variable \"" + name.string() + "\"");
        bytes += name.size() + text->size();
        if (bytes > kMaxStringBytes || grant.environment.size() == kMaxStrings)
            return Error::posix(E2BIG, "environment");
        grant.environment.emplace_back(name.string(), text->string());
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

/// Whether a data container that was good is there in whole still, as far as that can be told
/// without waiting.
bool isWhole(const std::string& container) {
    const auto directory =
        openWithoutLinks(AT_FDCWD, container, O_PATH | O_DIRECTORY | O_NOFOLLOW, Wait::Never);
    struct stat status {};
    return directory && isOnOwnMount(directory->get()) && ::fstat(directory->get(), &status) == 0 &&
           status.st_uid == ::geteuid() &&
           openBeneath(directory->get(), "tmp", O_PATH | O_NOFOLLOW);
}

}  // namespace

GrantStamps GrantStamps::of(int bundle, const std::string& executable) {
    const auto stampOf = [bundle](const std::string& name) {
        return FileStamp::ofOpened(openBeneath(bundle, name, O_PATH));
    };
    return {stampOf(kInfoPlist), stampOf(kEntitlements), stampOf(executable)};
}

Result<UniqueFd> openContainer(const Directories& directories, const std::string& path) {
    const std::string root = joinPath(directories.zorvanData(), "Containers");
    const std::string name = pathWithin(root, path);
    if (name.empty()) return Error::posix(EINVAL, path);
    const UniqueFd containers(::open(root.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!containers) return Error::posix(errno, root);
    auto container = openWithoutLinks(containers.get(), name, O_PATH | O_DIRECTORY | O_NOFOLLOW);
    if (!container) return Error::posix(container.error().code, path);
    struct stat status {};
    if (::fstat(container->get(), &status) != 0) return Error::posix(errno, path);
    if (status.st_uid != ::geteuid()) return Error::posix(EPERM, path);
    return container;
}

Result<GrantedPlaces> GrantedPlaces::open(const Grant& grant, const Directories& directories) {
    GrantedPlaces places;
    if (!grant.container.empty()) {
        auto container = openContainer(directories, grant.container);
        if (!container) return container.error();
        places.container = std::move(*container);
    }
    auto bundle = grant.bundle.open();
    if (!bundle) return bundle.error();
    places.bundle = std::move(*bundle);
    return places;
}

Result<Grant> Grant::make(const Directories& directories, const ExternalService& service,
                          const Dictionary& overlay) {
    const Result<UniqueFd> bundle = service.bundle.open();
    if (!bundle) return bundle.error();
    const std::string name = pathWithin(service.bundle.path, service.executable);
    if (name.empty()) return Error::posix(EINVAL, service.executable + " is not in its bundle");
    if (auto error = checkExecutable(bundle->get(), name, service.executable)) return *error;
    const auto stamps = GrantStamps::of(bundle->get(), name);
    const auto info = readList(bundle->get(), kInfoPlist);
    if (!info) return Error::posix(EINVAL, "the Info.plist of " + service.bundle.path);

    if (!statesOneExtensionPoint(*info))
        return Error::posix(EINVAL, "more than one extension point, " + service.bundle.path);

    Grant grant;
    grant.executable = service.executable;
    grant.bundle = service.bundle;
    grant.wantsNetwork = asksForNetwork(bundle->get());
    readIdentifiers(*info, grant);
    if (!isSafeName(grant.bundleIdentifier))
        return Error::posix(EINVAL, "the bundle's identifier, " + grant.bundle.path);
    if (!service.container.empty()) {
        const Result<UniqueFd> container = openContainer(directories, service.container);
        if (container)
            grant.container = service.container;
        else if (!isMissingFile(container.error()))
            return container.error();
    }
    if (auto error = readOverlay(overlay, grant)) return *error;
    // Who asks has read the executable's name at another time, and the container may come.
    const bool isAllKnown = stamps.areSettled() && textAt(*info, {"QFBundleExecutable"}) == name &&
                            grant.container == service.container;
    if (isAllKnown) grant.stamps = std::make_shared<const GrantStamps>(stamps);
    return grant;
}

std::optional<Grant> Grant::renewed(const Dictionary& overlay) const {
    if (!stamps) return std::nullopt;
    const Result<UniqueFd> place = bundle.open(Wait::Never);
    if (!place || !isOnOwnMount(place->get()) ||
        GrantStamps::of(place->get(), pathWithin(bundle.path, executable)) != *stamps)
        return std::nullopt;
    if (!container.empty() && !isWhole(container)) return std::nullopt;
    Grant grant = *this;
    grant.environment.clear();
    if (readOverlay(overlay, grant)) return std::nullopt;
    return grant;
}

}  // namespace platform::spawnerd
