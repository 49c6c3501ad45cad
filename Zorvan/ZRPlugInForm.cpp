#include <algorithm>
#include <limits>
#include <vector>

#include "Zorvan/Helpers.h"
#include "Zorvan/Keys.h"
#include "Zorvan/ZRPlugInCore.h"

namespace zorvan {

using platform::Dictionary;
using platform::Uuid;
using platform::Value;

namespace {

/// Collects the entries of a form.
class FormBuilder {
  public:
    FormBuilder() { entries_.reserve(20); }

    template <class T>
    void add(const char* key, T&& value) {
        entries_.emplace_back(key, std::forward<T>(value));
    }
    template <class T>
    void addIfPresent(const char* key, const std::optional<T>& value) {
        if (value) add(key, *value);
    }
    std::optional<Dictionary> take() { return Dictionary::fromEntries(std::move(entries_)); }

  private:
    std::vector<Dictionary::Entry> entries_;
};

const platform::Text* text(const Dictionary& form, std::string_view key) {
    const Value* value = form.find(key);
    return value ? value->string() : nullptr;
}

std::optional<std::string> textFact(const Dictionary& form, std::string_view key) {
    const auto* found = text(form, key);
    return found ? std::optional(found->string()) : std::nullopt;
}

std::optional<Dictionary> dictionaryFact(const Dictionary& form, std::string_view key) {
    const Value* value = form.find(key);
    if (!value || !value->dictionary()) return std::nullopt;
    return *value->dictionary();
}

/// A number as an integer of type T; what does not fit becomes the nearest end of T's range.
template <class T>
T integerFact(const Dictionary& form, std::string_view key, T absent) {
    const Value* value = form.find(key);
    auto integer = value ? value->numberAsInteger() : std::nullopt;
    if (!integer) return absent;
    return static_cast<T>(std::clamp<std::int64_t>(*integer, std::numeric_limits<T>::min(),
                                                   std::numeric_limits<T>::max()));
}

}  // namespace

std::optional<Dictionary> ZRPlugInCore::exportForm(std::optional<ZRError>& error) const {
    const Dictionary* infoPlist = bundleInfoDictionary();
    const Value* versionValue = version();
    const char* missing = !originalIdentifier_ ? "original identifier"
                          : !versionValue      ? "version attribute"
                          : !infoPlist         ? "Info.plist"
                          : !plugInDictionary_ ? "plug-in dictionary"
                                               : nullptr;
    if (missing) {
        error = ZRErrorWithFormat(kZRErrorPlugIn, "plug-in {} has no {}", identifier_, missing);
        return std::nullopt;
    }
    Dictionary bundleInfo = *infoPlist;
    bundleInfo.remove(key::kInfoPlistUrl);

    // In the order of the keys, so that the dictionary takes the entries without sorting them.
    FormBuilder builder;
    builder.add(form::kAnnotations, annotations_.value_or(Dictionary()));
    builder.add(form::kBundleInfo, std::move(bundleInfo));
    builder.addIfPresent(form::kContainingPath, containingPath_);
    builder.addIfPresent(form::kEntitlements, entitlements_);
    builder.add(form::kHubProtocolVersion, hubProtocolVersion_);
    builder.add(form::kIdentifier, identifier_);
    builder.add(form::kInfo, *plugInDictionary_);
    builder.add(form::kLastModified, lastModified_);
    builder.addIfPresent(form::kLocalizedContainingName, localizedContainingName());
    builder.addIfPresent(form::kLocalizedName, localizedName());
    builder.addIfPresent(form::kLocalizedShortName, localizedShortName());
    builder.add(form::kOriginalIdentifier, *originalIdentifier_);
    builder.add(form::kPath, path_);
    builder.add(form::kSystemResident, onSystemVolume_);
    builder.add(form::kUuid, uuid().string());
    builder.add(form::kVersion, *versionValue);
    return builder.take();
}

std::unique_ptr<ZRPlugInCore> ZRPlugInCore::initWithForm(const Dictionary& form) {
    std::unique_ptr<ZRPlugInCore> record(new ZRPlugInCore);
    if (!record->setupWithForm(form)) return nullptr;
    return record;
}

bool ZRPlugInCore::setupWithForm(const Dictionary& form) {
    const Value* bundleInfo = form.find(form::kBundleInfo);
    const auto* uuidText = text(form, form::kUuid);
    if (!setup(textFact(form, form::kIdentifier), textFact(form, form::kPath),
               bundleInfo ? std::optional(*bundleInfo) : std::nullopt,
               uuidText ? Uuid::parse(*uuidText) : std::nullopt)) {
        return false;
    }
    hubProtocolVersion_ = integerFact<std::uint32_t>(form, form::kHubProtocolVersion, 1);
    originalIdentifier_ = textFact(form, form::kOriginalIdentifier);
    if (const Value* hash = form.find(form::kHash); hash && hash->data()) cdhash_ = *hash->data();
    requirement_ = textFact(form, form::kRequirement);
    lastModified_ = integerFact<std::int32_t>(form, form::kLastModified, 0);
    entitlements_ = dictionaryFact(form, form::kEntitlements);
    containingPath_ = textFact(form, form::kContainingPath);
    const Value* systemResident = form.find(form::kSystemResident);
    onSystemVolume_ = systemResident && systemResident->isNumber() && !equalsFalse(*systemResident);
    annotations_ = dictionaryFact(form, form::kAnnotations);
    setLocalizedName(textFact(form, form::kLocalizedName));
    setLocalizedShortName(textFact(form, form::kLocalizedShortName));
    setLocalizedContainingName(textFact(form, form::kLocalizedContainingName));
    return true;
}

void ZRPlugInCore::updateFromForm(const Dictionary& form) {
    annotations_ = dictionaryFact(form, form::kAnnotations);
}

void ZRPlugInCore::setAnnotation(const std::string& key, std::optional<Value> value) {
    annotations_ = dictionaryChanging(annotations_.value_or(Dictionary()), key, std::move(value));
}

}  // namespace zorvan
