#include "Zorvan/ZRBundle.h"

#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "platform/system/Files.h"

namespace zorvan {

using platform::LumBundle;

std::shared_ptr<ZRBundle> ZRBundle::initWithLumBundle(std::shared_ptr<LumBundle> bundle) {
    if (!bundle) return nullptr;
    return std::shared_ptr<ZRBundle>(new ZRBundle(std::move(bundle)));
}

std::shared_ptr<ZRBundle> ZRBundle::initForMainBundle() {
    return initWithLumBundle(LumBundle::mainBundle());
}

std::shared_ptr<ZRBundle> ZRBundle::initWithPath(const std::string& bundlePath) {
    return initWithLumBundle(LumBundle::make(bundlePath, LumBundle::BundleDirectory));
}

std::shared_ptr<ZRBundle> ZRBundle::initWithExecutablePath(const std::string& executablePath) {
    auto bundle = LumBundle::make(executablePath, LumBundle::Executable);
    if (bundle && !bundle->property(LumBundle::BundlePath)) {
        bundle = LumBundle::make(executablePath, LumBundle::BundleDirectory);
    }
    return initWithLumBundle(std::move(bundle));
}

std::optional<std::string> ZRBundle::stringProperty(int number) const {
    return bundle_->property(number);
}

std::optional<std::string> ZRBundle::path() const {
    return stringProperty(LumBundle::BundlePath);
}

std::optional<std::string> ZRBundle::executablePath() const {
    auto executable = stringProperty(LumBundle::ExecutablePath);
    return executable ? executable : path();
}

std::optional<std::string> ZRBundle::supportPath() const {
    std::lock_guard lock(mutex_);
    if (!supportPath_) supportPath_ = stringProperty(LumBundle::SupportPath);
    return supportPath_;
}

std::optional<std::string> ZRBundle::bundleDirectory(const std::string& name) const {
    auto support = supportPath();
    if (!support) return std::nullopt;
    return platform::joinPath(*support, name);
}

std::optional<std::string> ZRBundle::plugInsPath() const {
    return bundleDirectory("PlugIns");
}

std::optional<platform::Dictionary> ZRBundle::infoDictionary() const {
    bundle_->discardCache();
    auto dictionary = bundle_->infoDictionary();
    if (!dictionary) {
        EVLOG_INFO(ops(), "failed to retrieve Info.plist for {} through {}", *this, *bundle_);
        EVLOG_INFO(ops(), "failed to convert Info.plist to dictionary: {} source={}", *this,
                   "(null)");
    }
    return dictionary;
}

std::optional<std::string> ZRBundle::bundleIdentifier() const {
    auto dictionary = bundle_->infoDictionary();
    const auto* identifier = dictionary ? dictionary->find(key::kBundleIdentifier) : nullptr;
    if (!identifier || !identifier->string()) return std::nullopt;
    return identifier->string()->string();
}

std::string describe(const ZRBundle& bundle) {
    return bundle.path().value_or("(null)");
}

}  // namespace zorvan
