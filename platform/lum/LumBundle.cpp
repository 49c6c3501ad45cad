#include "platform/lum/LumBundle.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <mutex>

#include "platform/plist/PropertyList.h"
#include "platform/system/Files.h"
#include "platform/system/UniqueFd.h"

namespace platform {

namespace {

constexpr const char* kInfoPlist = "Info.plist";

UniqueFd openDirectory(const std::string& path) {
    return UniqueFd(::open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
}

std::optional<Dictionary> readInfoDictionary(const std::string& path) {
    const UniqueFd directory = openDirectory(path);
    if (!directory) return std::nullopt;
    const Result<Value> value = readPropertyListBeneath(directory.get(), kInfoPlist);
    const Dictionary* dictionary = value ? value->dictionary() : nullptr;
    return dictionary ? std::optional(*dictionary) : std::nullopt;
}

}  // namespace

struct LumBundle::State {
    std::string path;                       // as it was given
    std::optional<std::string> bundlePath;  // none: the path lies in no bundle
    std::mutex mutex;                       // guards what follows
    bool infoWasRead = false;
    std::optional<Dictionary> info;
};

LumBundle::LumBundle(std::unique_ptr<State> state) : state_(std::move(state)) {}

LumBundle::~LumBundle() = default;

std::shared_ptr<LumBundle> LumBundle::make(const std::string& path, Mode mode) {
    if (path.empty() || path.front() != '/' || path.find('\0') != std::string::npos) return nullptr;
    auto state = std::make_unique<State>();
    state->path = path;
    if (mode == BundleDirectory) {
        while (state->path.size() > 1 && state->path.back() == '/') state->path.pop_back();
        state->bundlePath = state->path;
    } else {
        std::string directory(parentPath(path));
        if (isAt(openDirectory(directory).get())) state->bundlePath = std::move(directory);
    }
    return std::shared_ptr<LumBundle>(new LumBundle(std::move(state)));
}

bool LumBundle::isAt(int directory) {
    // Whoever mounts a file there is not asked.
    struct statx status {};
    return ::statx(directory, kInfoPlist, AT_SYMLINK_NOFOLLOW | AT_STATX_DONT_SYNC, STATX_TYPE,
                   &status) == 0 &&
           (S_ISREG(status.stx_mode) || S_ISLNK(status.stx_mode));
}

std::shared_ptr<LumBundle> LumBundle::mainBundle() {
    const std::optional<std::string> executable = canonicalPath("/proc/self/exe");
    return executable ? make(*executable, Executable) : nullptr;
}

std::optional<std::string> LumBundle::property(int number) const {
    switch (number) {
        case BundlePath:
        case SupportPath:
            return state_->bundlePath;
        case ExecutablePath: {
            const std::optional<Dictionary> info = infoDictionary();
            const Value* value = info ? info->find("QFBundleExecutable") : nullptr;
            const auto* name = value ? value->string() : nullptr;
            if (!name || !isSafeName(*name)) return std::nullopt;
            return joinPath(*state_->bundlePath, *name);
        }
        default:
            return std::nullopt;
    }
}

std::optional<Dictionary> LumBundle::infoDictionary() const {
    if (!state_->bundlePath) return std::nullopt;
    const std::lock_guard lock(state_->mutex);
    if (!state_->infoWasRead) {
        state_->info = readInfoDictionary(*state_->bundlePath);
        state_->infoWasRead = true;
    }
    return state_->info;
}

void LumBundle::discardCache() {
    const std::lock_guard lock(state_->mutex);
    state_->info.reset();
    state_->infoWasRead = false;
}

std::string LumBundle::description() const {
    return "<LumBundle " + state_->path + ">";
}

std::string describe(const LumBundle& bundle) {
    return bundle.description();
}

}  // namespace platform
