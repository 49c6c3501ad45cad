#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "Zorvan/ZRError.h"
#include "platform/values/Uuid.h"
#include "platform/values/Value.h"

namespace platform {
class SdkDictionaries;
}

namespace zorvan {

/// One installed plug-in bundle, as daemon and hosts share it: a UUID, the dictionaries that
/// describe the bundle, its identity, facts filled in by whoever built the record, and properties
/// derived from the dictionaries. The daemon's `ZRDPlugIn` derives from it; hosts build it from a
/// form.
///
/// A record that a factory returned has a UUID, an identifier and a path. It is not synchronised:
/// share it between threads only once it is not changed any more (the daemon's subclass says what
/// it adds). Pointers and references that lookups answer are good until the record is changed.
class ZRPlugInCore {
  public:
    virtual ~ZRPlugInCore() = default;

    /// A record from an `Info.plist`, whose "VXExtension" becomes the plug-in dictionary, or,
    /// without one, from a plug-in dictionary (`info`). Null, with a log line, when the path or the
    /// identifier is missing or the `Info.plist` has no plug-in dictionary. Without a UUID it gets
    /// a random one.
    static std::unique_ptr<ZRPlugInCore> initWithName(std::optional<std::string> name,
                                                      std::optional<std::string> path,
                                                      std::optional<platform::Value> bundleInfo,
                                                      std::optional<platform::Dictionary> info,
                                                      std::optional<platform::Uuid> uuid);

    /// A record from a form (see `exportForm`). Null when the form has no path or no identifier, or
    /// its "bundleInfo" has no plug-in dictionary. Facts of wrong types count as absent.
    static std::unique_ptr<ZRPlugInCore> initWithForm(const platform::Dictionary& form);

    // Identity and facts.
    const std::string& identifier() const { return identifier_; }
    const std::optional<std::string>& originalIdentifier() const { return originalIdentifier_; }
    void setOriginalIdentifier(std::optional<std::string> value) {
        originalIdentifier_ = std::move(value);
    }
    const platform::Uuid& uuid() const;
    /// The bundle directory.
    const std::string& path() const { return path_; }
    /// The application bundle that contains the plug-in.
    const std::optional<std::string>& containingPath() const { return containingPath_; }
    void setContainingPath(std::optional<std::string> value) { containingPath_ = std::move(value); }
    bool onSystemVolume() const { return onSystemVolume_; }
    void setOnSystemVolume(bool value) { onSystemVolume_ = value; }
    /// The plug-in dictionary that this record stores; the daemon's lookups read the registry's
    /// instead.
    const std::optional<platform::Dictionary>& plugInDictionary() const {
        return plugInDictionary_;
    }
    const std::optional<platform::Dictionary>& entitlements() const { return entitlements_; }
    void setEntitlements(std::optional<platform::Dictionary> value) {
        entitlements_ = std::move(value);
    }
    std::uint32_t hubProtocolVersion() const { return hubProtocolVersion_; }
    void setHubProtocolVersion(std::uint32_t value) { hubProtocolVersion_ = value; }
    virtual std::optional<std::string> localizedName() const { return localizedName_; }
    virtual void setLocalizedName(std::optional<std::string> value) {
        localizedName_ = std::move(value);
    }
    virtual std::optional<std::string> localizedShortName() const { return localizedShortName_; }
    virtual void setLocalizedShortName(std::optional<std::string> value) {
        localizedShortName_ = std::move(value);
    }
    virtual std::optional<std::string> localizedContainingName() const {
        return localizedContainingName_;
    }
    virtual void setLocalizedContainingName(std::optional<std::string> value) {
        localizedContainingName_ = std::move(value);
    }
    /// The user's choices for this plug-in.
    const std::optional<platform::Dictionary>& annotations() const { return annotations_; }
    void setAnnotations(std::optional<platform::Dictionary> value) {
        annotations_ = std::move(value);
    }
    /// Seconds since 1970-01-01 00:00 UTC.
    std::int32_t lastModified() const { return lastModified_; }
    void setLastModified(std::int32_t value) { lastModified_ = value; }
    /// Code-directory hash and requirement text of the executable, when the record's builder knew
    /// them.
    const std::optional<platform::Data>& cdhash() const { return cdhash_; }
    void setCdhash(std::optional<platform::Data> value) { cdhash_ = std::move(value); }
    const std::optional<std::string>& requirement() const { return requirement_; }
    void setRequirement(std::optional<std::string> value) { requirement_ = std::move(value); }

    // Lookups, the only ways in which the derived properties read the dictionaries. Null: absent.
    virtual const platform::Dictionary* bundleInfoDictionary() const;
    virtual const platform::Value* infoKey(std::string_view key) const;
    virtual const platform::Value* pluginKey(std::string_view key) const;
    virtual const platform::Value* attribute(std::string_view key) const;

    // Derived properties, computed at every call. Values are as the dictionaries have them, of any
    // type.
    const platform::Value* attributes() const;
    const platform::Value* version() const;
    std::optional<platform::Value> protocolSpec() const;
    std::optional<platform::Value> principalSpec() const;
    const platform::Value* sdkSpec() const;
    std::optional<std::string> embeddedCodePath() const { return std::nullopt; }
    std::optional<platform::Value> embeddedProtocolSpec() const;
    /// The path ends in ".appex".
    virtual bool isAppExtension() const;
    bool isMultiplexed() const { return false; }
    bool isHybrid() const;
    /// Available only inside the application that contains it: "Dedicated" is a number other than
    /// 0, or a text that says yes.
    virtual bool isDedicated() const;
    /// Without code: nothing is ever started.
    bool isData() const;
    platform::Date timestamp() const { return {static_cast<double>(lastModified_)}; }
    /// Whether the bundle has only the old "Zorvan" dictionary. A record with neither is an
    /// internal inconsistency.
    bool oldStyle() const;

    /// The first defect that keeps the plug-in from being used (code 12), or none.
    virtual std::optional<ZRError> diagnose() const;

    // Form: the record as a property list, which travels in "match" replies.
    /// The form, or the error that says which required fact the record lacks.
    std::optional<platform::Dictionary> exportForm(std::optional<ZRError>& error) const;
    /// Takes the form's "annotations" and nothing else.
    void updateFromForm(const platform::Dictionary& form);
    /// Changes one annotation; none removes it. Absent annotations count as empty.
    void setAnnotation(const std::string& key, std::optional<platform::Value> value);

    // SDK: completion of a record that was built from an Info.plist.
    /// The SDK dictionary registered under a name, or none, which is logged.
    static std::optional<platform::Dictionary> readSDKDictionary(platform::SdkDictionaries& sdks,
                                                                 const std::string& name);
    /// A plug-in's Info.plist with an SDK dictionary merged under it.
    static platform::Dictionary mergeDictionary(const platform::Dictionary& sdk,
                                                const platform::Dictionary& into);
    /// Whether the SDK's value replaces the plug-in's.
    static bool sdkOverridesKey(std::string_view key);
    /// The union of two lists of resource names: each name once, and nothing that is not text.
    static platform::Array mergeSharedResources(const platform::Array& sdk,
                                                const platform::Array& into);
    /// Merges the SDK dictionary of the record's extension point under its Info.plist, which it
    /// must have, then canonicalizes.
    void resolveSDK(platform::SdkDictionaries& sdks);
    /// Gives the plug-in dictionary attributes, and the attributes a version.
    void canonicalize();

    /// Equal when the UUIDs are.
    bool operator==(const ZRPlugInCore& other) const { return uuid() == other.uuid(); }
    std::size_t hash() const;

  protected:
    ZRPlugInCore() = default;
    ZRPlugInCore(const ZRPlugInCore&) = delete;

    /// What `initWithName` does on a record that a subclass made. False: discard the record.
    bool initialize(std::optional<std::string> name, std::optional<std::string> path,
                    std::optional<platform::Value> bundleInfo,
                    std::optional<platform::Dictionary> info, std::optional<platform::Uuid> uuid);
    bool setup(std::optional<std::string> name, std::optional<std::string> path,
               std::optional<platform::Value> bundleInfo, std::optional<platform::Uuid> uuid);
    bool setupWithForm(const platform::Dictionary& form);
    bool setDictionaries(const platform::Value& infoPlist);
    static bool isAppExtensionPath(std::string_view path) { return path.ends_with(".appex"); }
    /// A hook for builders that adjust an Info.plist first.
    virtual platform::Value normalizeInfoDictionary(platform::Value infoPlist) const {
        return infoPlist;
    }

  private:
    std::optional<platform::Value> objectSpec(std::string_view key) const;

    std::string identifier_;
    std::optional<std::string> originalIdentifier_;
    std::string path_;
    std::optional<std::string> containingPath_;
    bool onSystemVolume_ = false;
    std::optional<platform::Dictionary> bundleInfoDictionary_;
    std::optional<platform::Dictionary> plugInDictionary_;
    std::optional<platform::Dictionary> entitlements_;
    std::uint32_t hubProtocolVersion_ = 1;
    std::optional<std::string> localizedName_;
    std::optional<std::string> localizedShortName_;
    std::optional<std::string> localizedContainingName_;
    std::optional<platform::Dictionary> annotations_;
    std::int32_t lastModified_ = 0;
    std::optional<platform::Uuid> uuid_;
    std::optional<platform::Data> cdhash_;
    std::optional<std::string> requirement_;
};

}  // namespace zorvan
