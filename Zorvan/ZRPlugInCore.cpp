#include "Zorvan/ZRPlugInCore.h"

#include <algorithm>
#include <string_view>

#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"

namespace zorvan {

using platform::Dictionary;
using platform::Uuid;
using platform::Value;

std::unique_ptr<ZRPlugInCore> ZRPlugInCore::initWithName(std::optional<std::string> name,
                                                         std::optional<std::string> path,
                                                         std::optional<Value> bundleInfo,
                                                         std::optional<Dictionary> info,
                                                         std::optional<Uuid> uuid) {
    std::unique_ptr<ZRPlugInCore> record(new ZRPlugInCore);
    if (!record->initialize(std::move(name), std::move(path), std::move(bundleInfo),
                            std::move(info), uuid)) {
        return nullptr;
    }
    return record;
}

bool ZRPlugInCore::initialize(std::optional<std::string> name, std::optional<std::string> path,
                              std::optional<Value> bundleInfo, std::optional<Dictionary> info,
                              std::optional<Uuid> uuid) {
    if (!setup(std::move(name), std::move(path), std::move(bundleInfo), uuid)) return false;
    if (!plugInDictionary_) plugInDictionary_ = std::move(info);
    return true;
}

bool ZRPlugInCore::setup(std::optional<std::string> name, std::optional<std::string> path,
                         std::optional<Value> bundleInfo, std::optional<Uuid> uuid) {
    if (!path) return false;
    if (!name) {
        EVLOG_ERROR(ops(), "missing identifier in plug-in at {}", *path);
        return false;
    }
    if (bundleInfo) {
        Value infoPlist = normalizeInfoDictionary(*std::move(bundleInfo));
        if (!setDictionaries(infoPlist)) {
            EVLOG_DEFAULT(ops(), "malformed plug-in dictionary in plug-in {} at {}: {}", *name,
                          *path, infoPlist);
            return false;
        }
    }
    identifier_ = *std::move(name);
    path_ = *std::move(path);
    uuid_ = uuid ? *uuid : Uuid::random();
    return true;
}

bool ZRPlugInCore::setDictionaries(const Value& infoPlist) {
    const Dictionary* whole = infoPlist.dictionary();
    if (!whole) return false;
    bundleInfoDictionary_ = *whole;
    const Value* extension = whole->find(key::kExtension);
    if (!extension || !extension->dictionary()) return false;
    plugInDictionary_ = *extension->dictionary();
    if (plugInDictionary_->contains(key::kMultiple)) {
        EVLOG_DEFAULT(ops(), "multiplexed plug-ins ({} key) obsolete and ignored",
                      pub(key::kMultiple));
    }
    return true;
}

const Uuid& ZRPlugInCore::uuid() const {
    if (!uuid_) ZR_INTERNAL_INCONSISTENCY("self.uuid");
    return *uuid_;
}

std::size_t ZRPlugInCore::hash() const {
    return std::hash<Uuid>()(uuid());
}

namespace {

const Value* find(const Dictionary* dictionary, std::string_view key) {
    return dictionary ? dictionary->find(key) : nullptr;
}

ZRError missingKey(const char* key) {
    return ZRErrorWithFormat(kZRErrorPlugIn, "missing \"{}\" key in Info.plist or SDK", key);
}

bool isText(const std::optional<Value>& value, std::string_view text) {
    return value && value->string() && *value->string() == text;
}

}  // namespace

const Dictionary* ZRPlugInCore::bundleInfoDictionary() const {
    return bundleInfoDictionary_ ? &*bundleInfoDictionary_ : nullptr;
}

const Value* ZRPlugInCore::infoKey(std::string_view key) const {
    return find(bundleInfoDictionary(), key);
}

const Value* ZRPlugInCore::pluginKey(std::string_view key) const {
    return find(plugInDictionary_ ? &*plugInDictionary_ : nullptr, key);
}

const Value* ZRPlugInCore::attribute(std::string_view key) const {
    const Value* all = attributes();
    return find(all ? all->dictionary() : nullptr, key);
}

const Value* ZRPlugInCore::attributes() const {
    return pluginKey(key::kAttributes);
}

const Value* ZRPlugInCore::version() const {
    return attribute(key::kExtensionVersion);
}

std::optional<Value> ZRPlugInCore::objectSpec(std::string_view key) const {
    if (const Value* named = pluginKey(key)) return *named;
    if (isAppExtension()) return Value(key::kDefaultObject);
    return std::nullopt;
}

std::optional<Value> ZRPlugInCore::protocolSpec() const {
    return objectSpec(key::kProtocol);
}

std::optional<Value> ZRPlugInCore::principalSpec() const {
    return objectSpec(key::kPrincipalClass);
}

const Value* ZRPlugInCore::sdkSpec() const {
    return pluginKey(key::kExtensionPoint);
}

std::optional<Value> ZRPlugInCore::embeddedProtocolSpec() const {
    if (const Value* embedded = pluginKey(key::kEmbeddedProtocol)) return *embedded;
    return protocolSpec();
}

bool ZRPlugInCore::isAppExtension() const {
    return isAppExtensionPath(path_);
}

bool ZRPlugInCore::isHybrid() const {
    return pluginKey(key::kEmbeddedCode) != nullptr;
}

namespace {

/// Whether a text says yes, as authors write it where a boolean belongs.
bool isAffirmative(std::string_view text) {
    const auto sameLetter = [](char a, char lower) {
        return (a >= 'A' && a <= 'Z' ? a - 'A' + 'a' : a) == lower;
    };
    for (const std::string_view word : {"yes", "true", "1"})
        if (std::ranges::equal(text, word, sameLetter)) return true;
    return false;
}

}  // namespace

bool ZRPlugInCore::isDedicated() const {
    const Value* dedicated = pluginKey(key::kDedicated);
    if (!dedicated) return false;
    if (const auto* text = dedicated->string()) return isAffirmative(*text);
    return dedicated->isNumber() && !equalsFalse(*dedicated);
}

bool ZRPlugInCore::isData() const {
    return isText(protocolSpec(), key::kDataProtocol);
}

bool ZRPlugInCore::oldStyle() const {
    if (infoKey(key::kExtension)) return false;
    if (infoKey(key::kOldStylePlugIn)) return true;
    ZR_INTERNAL_INCONSISTENCY("unknown plug-in configuration style");
}

std::optional<ZRError> ZRPlugInCore::diagnose() const {
    if (identifier_.empty()) {
        return ZRErrorWithFormat(
            kZRErrorPlugIn,
            "missing identifier (no VXExtensionIdentifier, nor even QFBundleIdentifier)");
    }
    if (!protocolSpec()) return missingKey(key::kProtocol);
    if (!attributes()) return missingKey(key::kAttributes);
    if (isAppExtension() && !isText(principalSpec(), key::kDefaultObject)) {
        return ZRErrorWithFormat(kZRErrorPlugIn,
                                 "Application Extensions may not use the \"{}\" key",
                                 key::kPrincipalClass);
    }
    if (pluginKey(key::kPassProxy)) {
        return ZRErrorWithFormat(kZRErrorPlugIn, "the \"{}\" key is not supported on this platform",
                                 key::kPassProxy);
    }
    if (isHybrid()) {
        return ZRErrorWithCode(kZRErrorPlugIn,
                               "hybrid plug-ins are not supported on this platform");
    }
    return std::nullopt;
}

}  // namespace zorvan
