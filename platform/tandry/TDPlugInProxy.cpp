#include "platform/tandry/TDPlugInProxy.h"

#include <fmt/format.h>

namespace platform {

namespace {

constexpr std::string_view kExtension = "VXExtension";

const Dictionary* dictionaryAt(const Dictionary& dictionary, std::string_view key) {
    const Value* value = dictionary.find(key);
    return value ? value->dictionary() : nullptr;
}

}  // namespace

const Dictionary* TDPlugInProxy::plugInDictionary() const {
    return dictionaryAt(infoPlist.get(), kExtension);
}

const Dictionary* TDPlugInProxy::attributesIn(const Dictionary& infoPlist) {
    const Dictionary* plugIn = dictionaryAt(infoPlist, kExtension);
    return plugIn ? dictionaryAt(*plugIn, "VXExtensionAttributes") : nullptr;
}

const Dictionary* TDPlugInProxy::attributes() const {
    return attributesIn(infoPlist.get());
}

std::string describe(const TDPlugInProxy& proxy) {
    return fmt::format("{} {} at {}", proxy.plugInUuid.string(),
                       proxy.plugInIdentifier.value_or("(no identifier)"),
                       proxy.bundlePath.value_or("(no path)"));
}

}  // namespace platform
