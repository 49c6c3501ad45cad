#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "platform/services/SdkDictionaries.h"
#include "platform/system/FileStamp.h"
#include "platform/tandry/DiskWorkspace.h"
#include "platform/tandry/ForeignPlaces.h"
#include "platform/tandry/RegistryState.h"

namespace platform::tandry {

/// Largest property list that is read from a bundle. Real ones have a few KiB; each of them travels
/// in replies.
inline constexpr std::size_t kMaxBundleFile = 1u << 20;
/// Most values in one property list of a bundle, also with its SDK dictionary merged.
inline constexpr std::size_t kMaxBundleValues = 16384;
/// Most bytes of a plug-in's encoded dictionaries: Info.plist and entitlements.
inline constexpr std::size_t kMaxRecordSize = 512u << 10;
/// Largest executable that is read where its stamp says too little.
inline constexpr std::size_t kMaxDigested = 64u << 20;

/// Where a bundle lies: its canonical path, and how its files are reached with few look-ups.
struct BundleFolder {
    explicit BundleFolder(std::string canonical);
    /// The folder `entry` of the open directory `directory` (borrowed) at `parent`.
    BundleFolder(int directory, const std::string& parent, std::string entry);
    /// The same bundle, reached by its own open directory (borrowed).
    BundleFolder reachedBy(int directory) const;
    /// Whether it was found as an entry of an open directory.
    bool isEntry() const;
    /// Which directory lies there now.
    FileIdentity identity() const;

    int dirfd;
    std::string name;  // relative to `dirfd`
    std::string path;
};

/// Reads the bundles' files, and nothing that lies outside: a bundle's directory is opened once,
/// and its files beneath it. Belongs to the registry's thread.
class BundleReader {
  public:
    /// What reading a plug-in bundle gave.
    struct Reading {
        /// When not refused, complete but for UUID, registration date, application and container.
        PlugInEntry entry;
        /// Why the bundle is refused, naming the file; none when it is good. In the domain "POSIX"
        /// when a file could not be read; any other reason lasts as long as the fingerprint does.
        std::optional<Error> refusal;
    };

    BundleReader(SdkDictionaries& sdks, SdkMerge merge, std::vector<std::string> languages,
                 ForeignPlaces& places);

    /// To be called before each walk: the stamps of SDK dictionaries are taken once a walk.
    void beginPass();

    /// Whether the bundle's files still have the stamps of `print`, and its directory, which has
    /// just been looked at, is that one.
    bool isUnchanged(const BundleFolder& folder, const FileIdentity& directory,
                     const Fingerprint& print);
    /// Whether two fingerprints may be of one bundle with one content: see `FileStamp::isLike`.
    /// Reading it tells, but for the executable, of which at most a digest is known.
    bool isLike(const Fingerprint& a, const Fingerprint& b) const;
    /// `print` with the stamps that the bundle's files have now.
    Fingerprint refreshed(const BundleFolder& folder, Fingerprint print);
    /// The same, or `print` itself while something cannot be looked at: for all that is known then,
    /// it is as it was.
    Fingerprint toRemember(const BundleFolder& folder, const Fingerprint& print);

    /// Reads a plug-in bundle: an Info.plist with a "VXExtension" dictionary and an identifier.
    /// `withDigest` says that the executable is read in any case.
    Reading readPlugIn(const BundleFolder& place, bool withDigest = false);

    /// The stamps of the files that go into an application's record.
    std::string applicationStamps(const BundleFolder& folder);
    /// As `isLike`, for those of an application.
    bool areApplicationStampsLike(std::string_view a, std::string_view b) const;
    struct ApplicationReading {
        TDApplicationProxyRef record;
        std::string stamps;  // empty after a failure that may pass, so that it is read again
        std::optional<Error> failure;
    };
    /// Reads an application. One without a readable Info.plist has no identifier and no name, and
    /// one whose names in the user's languages cannot be read just now no name; the failure says
    /// why.
    ApplicationReading readApplication(const BundleFolder& place);

  private:
    /// Remembers when a look at a file has failed.
    void note(const FileStamp& stamp);
    bool appendStamp(const BundleFolder& folder, const std::string& file, std::string& stamps);
    void appendLocalizedStamp(const BundleFolder& folder, std::string& stamps);
    void appendFixedStamps(const BundleFolder& folder, const FileIdentity& directory,
                           std::string& stamps);
    void appendNamedStamps(const BundleFolder& folder, const Fingerprint& print,
                           std::string& stamps);
    bool areLike(std::string_view a, std::string_view b, int stampsToLocalized) const;
    const std::string& sdkStamps(const std::string& sdk);
    std::optional<Error> fill(const BundleFolder& folder, PlugInEntry& entry, std::string& stamps,
                              bool withDigest);
    std::optional<Error> encode(const BundleFolder& folder, const Dictionary& info,
                                PlugInEntry& entry);
    std::optional<Error> describePlugIn(const BundleFolder& folder, const Dictionary& info,
                                        PlugInEntry& entry);
    std::optional<Error> complete(Dictionary& info, const std::string& sdk);
    Result<Dictionary> localizations(const BundleFolder& folder);

    SdkDictionaries& sdks_;
    ForeignPlaces& places_;
    SdkMerge merge_;
    std::vector<std::string> languages_;
    std::string languageText_;  // each ended by a NUL
    std::map<std::string, std::string> sdkStamps_;
    bool isUnsure_ = false;  // something could not be looked at
};

}  // namespace platform::tandry
