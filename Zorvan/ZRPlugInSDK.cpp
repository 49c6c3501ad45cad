#include <unordered_set>
#include <vector>

#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "Zorvan/ZRPlugInCore.h"
#include "platform/services/SdkDictionaries.h"

namespace zorvan {

using platform::Array;
using platform::Dictionary;
using platform::Value;

std::optional<Dictionary> ZRPlugInCore::readSDKDictionary(platform::SdkDictionaries& sdks,
                                                          const std::string& name) {
    const auto entry = sdks.copyExtensionSdkEntry(name);
    // Why a file could not be read just now has been logged.
    std::optional<Dictionary> sdk = entry ? *entry : std::nullopt;
    if (!sdk) EVLOG_DEFAULT(ops(), "plug-in sdk \"{}\" not registered", pub(name));
    return sdk;
}

bool ZRPlugInCore::sdkOverridesKey(std::string_view key) {
    return key == key::kCleanTimeout;
}

namespace {

/// What becomes of a key that both have: the SDK's value merged with the plug-in's. None where the
/// plug-in's value stays, which is so wherever the two kinds of value do not merge.
std::optional<Value> mergedValue(std::string_view key, const Value& sdk, const Value& plugIn) {
    if (ZRPlugInCore::sdkOverridesKey(key)) return sdk;
    if (key == key::kShared) {
        if (!sdk.array() || !plugIn.array()) return std::nullopt;
        return ZRPlugInCore::mergeSharedResources(*sdk.array(), *plugIn.array());
    }
    if (!sdk.dictionary() || !plugIn.dictionary()) return std::nullopt;
    return ZRPlugInCore::mergeDictionary(*sdk.dictionary(), *plugIn.dictionary());
}

}  // namespace

Dictionary ZRPlugInCore::mergeDictionary(const Dictionary& sdk, const Dictionary& into) {
    Dictionary result = into;
    // Added all at once: each addition would move the entries behind it.
    std::vector<Dictionary::Entry> added;
    for (const auto& [key, value] : sdk) {
        const Value* own = into.find(key);
        if (!own) {
            added.emplace_back(key, value);
        } else if (std::optional<Value> merged = mergedValue(key, value, *own)) {
            result.set(key, *std::move(merged));
        }
    }
    if (added.empty()) return result;
    added.insert(added.end(), result.begin(), result.end());
    return *Dictionary::fromEntries(std::move(added));
}

Array ZRPlugInCore::mergeSharedResources(const Array& sdk, const Array& into) {
    std::vector<Value> names;
    std::unordered_set<std::string_view> known;
    for (const Array* list : {&into, &sdk}) {
        for (const Value& name : *list) {
            if (name.string() && known.insert(name.string()->view()).second) names.push_back(name);
        }
    }
    return Array(std::move(names));
}

void ZRPlugInCore::resolveSDK(platform::SdkDictionaries& sdks) {
    const Dictionary* infoPlist = bundleInfoDictionary();
    if (!infoPlist) ZR_INTERNAL_INCONSISTENCY("cannot resolve SDK without materialized Info.plist");
    if (const Value* name = sdkSpec()) {
        if (!name->string()) {
            EVLOG_ERROR(ops(), "invalid SDK key:{}", pub(*name));
            return;
        }
        // Where the merge leaves no plug-in dictionary the record keeps the one that it has.
        if (auto sdk = readSDKDictionary(sdks, name->string()->string())) {
            setDictionaries(mergeDictionary(*sdk, *infoPlist));
        }
    }
    canonicalize();
}

void ZRPlugInCore::canonicalize() {
    const Value* own = attributes();
    Dictionary attributes = own && own->dictionary() ? *own->dictionary() : Dictionary();
    if (!attributes.contains(key::kExtensionVersion)) {
        const Value* shortVersion = infoKey(key::kShortVersion);
        attributes.set(key::kExtensionVersion, shortVersion ? *shortVersion : Value("1"));
    }
    Dictionary plugIn = plugInDictionary_.value_or(Dictionary());
    plugIn.set(key::kAttributes, std::move(attributes));
    plugInDictionary_ = std::move(plugIn);
}

}  // namespace zorvan
