#include "platform/tandry/BundleReader.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <openssl/evp.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <memory>

#include "platform/log/OpsLog.h"
#include "platform/plist/PropertyList.h"
#include "platform/system/FileStamp.h"
#include "platform/system/Files.h"
#include "platform/system/OpenBeneath.h"
#include "platform/tandry/LocalizedNames.h"
#include "platform/values/Cbor.h"

namespace platform::tandry {

namespace {

/// Levels of containers that stand around a bundle's dictionary in a reply, generously.
constexpr int kReplyLevels = 8;

constexpr std::size_t kMaxShownName = 80;

constexpr const char* kInfoPlist = "Info.plist";
constexpr const char* kEntitlements = "Entitlements.plist";
constexpr const char* kLocalized = "Localized.plist";
constexpr const char* kPlaceholder = ".placeholder";
constexpr const char* kBundleIdentifier = "QFBundleIdentifier";
constexpr const char* kExtension = "VXExtension";
constexpr const char* kAttributes = "VXExtensionAttributes";
constexpr const char* kPointIdentifier = "VXExtensionPointIdentifier";
constexpr const char* kShortVersion = "QFBundleShortVersionString";
constexpr const char* kExecutable = "QFBundleExecutable";
constexpr const char* kIdentifier = "VXExtensionIdentifier";
constexpr const char* kOriginalIdentifier = "VXOriginalIdentifier";

/// Whether a reply can carry the value: hosts refuse a whole reply for one value that is no
/// property list.
bool fitsReplies(Value value) {
    for (int level = 0; level < kReplyLevels; ++level) value = Array{std::move(value)};
    return isPropertyList(value);
}

Error malformed(const std::string& file, std::string_view reason) {
    return {"PropertyList", 0, fmt::format("{}: {}", file, reason)};
}

/// Why a dictionary of a bundle's file cannot be kept: hosts pay for each of its values.
std::optional<Error> excess(const std::string& file, const Dictionary& dictionary) {
    if (countValues(dictionary, kMaxBundleValues) > kMaxBundleValues)
        return malformed(file, "too many values");
    if (!fitsReplies(dictionary))
        return malformed(file, "nested too deeply, or control characters");
    return std::nullopt;
}

/// The directory of a bundle, which is no symbolic link.
Result<UniqueFd> openDirectory(const BundleFolder& place) {
    Result<UniqueFd> directory =
        openWithoutLinks(place.dirfd, place.name, O_PATH | O_DIRECTORY | O_NOFOLLOW);
    if (!directory) return Error::posix(directory.error().code, place.path);
    return directory;
}

/// The dictionary in a file of a bundle that is reached by its own directory. Error ENOENT when
/// there is none.
Result<Dictionary> readDictionary(const BundleFolder& folder, const char* name) {
    std::string file = joinPath(folder.path, name);
    Result<std::string> bytes = readFileBeneath(folder.dirfd, name, kMaxBundleFile);
    if (!bytes && leadsOutside(bytes.error()))
        return malformed(file, "a symbolic link or a mount that leads out of the bundle");
    if (!bytes) return Error::posix(bytes.error().code, file);
    Result<Value> value = parsePropertyList(*bytes);
    if (!value) return malformed(file, value.error().text);
    const Dictionary* dictionary = value->dictionary();
    if (!dictionary) return malformed(file, "not a dictionary");
    if (auto error = excess(file, *dictionary)) return *error;
    return *dictionary;
}

/// A digest of what a file holds; empty when it cannot be read, or is too large for that. `places`
/// hears of each step: a slow server may take a while.
std::string digestOf(const BundleFolder& folder, const std::string& file, ForeignPlaces& places) {
    constexpr std::size_t kStep = 1u << 20;
    const auto fd = openBeneath(folder.dirfd, file, O_RDONLY | O_NONBLOCK | O_NOCTTY);
    struct stat status {};
    if (!fd || ::fstat(fd->get(), &status) != 0 || !S_ISREG(status.st_mode)) return {};
    const std::unique_ptr<EVP_MD_CTX, decltype(&EVP_MD_CTX_free)> context(EVP_MD_CTX_new(),
                                                                          &EVP_MD_CTX_free);
    EVP_DigestInit_ex(context.get(), EVP_sha256(), nullptr);
    std::vector<char> bytes(kStep);
    std::size_t total = 0;
    for (ssize_t count = 1; count > 0; total += static_cast<std::size_t>(count)) {
        places.step();
        do count = ::read(fd->get(), bytes.data(), bytes.size());
        while (count < 0 && errno == EINTR);
        if (count < 0 || total + static_cast<std::size_t>(count) > kMaxDigested) return {};
        EVP_DigestUpdate(context.get(), bytes.data(), static_cast<std::size_t>(count));
    }
    std::string digest(EVP_MAX_MD_SIZE, '\0');
    unsigned size = 0;
    EVP_DigestFinal_ex(context.get(), reinterpret_cast<unsigned char*>(digest.data()), &size);
    digest.resize(size);
    return digest;
}

bool isMissing(const Error& error) {
    return error.domain == "POSIX" && (error.code == ENOENT || error.code == ENOTDIR);
}

const Dictionary* dictionaryAt(const Dictionary& dictionary, std::string_view key) {
    const Value* value = dictionary.find(key);
    return value ? value->dictionary() : nullptr;
}

const platform::Text* stringAt(const Dictionary& dictionary, std::string_view key) {
    const Value* value = dictionary.find(key);
    return value ? value->string() : nullptr;
}

/// The first string under one of the keys: of the plug-in dictionary, then of the top level.
const platform::Text* identifierAt(const Dictionary& plugIn, const Dictionary& info,
                                   std::string_view key) {
    const auto* text = stringAt(plugIn, key);
    return text ? text : stringAt(info, key);
}

std::optional<Error> wrongType(const std::string& file, const Dictionary& dictionary,
                               std::initializer_list<const char*> keysOfStrings) {
    for (const char* key : keysOfStrings)
        if (dictionary.contains(key) && !stringAt(dictionary, key))
            return malformed(file, fmt::format("{} is not a string", key));
    return std::nullopt;
}

/// Whether the keys that hosts rely on have values of their types. Readers would refuse each form
/// made of such a plug-in; its author learns it once, here.
std::optional<Error> wrongType(const std::string& file, const Dictionary& info,
                               const Dictionary& plugIn) {
    if (plugIn.contains(kAttributes) && !dictionaryAt(plugIn, kAttributes))
        return malformed(file, fmt::format("{} is not a dictionary", kAttributes));
    if (auto error = wrongType(file, plugIn, {kIdentifier, kOriginalIdentifier})) return error;
    return wrongType(file, info,
                     {kIdentifier, kOriginalIdentifier, kBundleIdentifier, kExecutable});
}

/// Names from files become parts of paths.
std::optional<Error> unsafeName(const std::string& file, std::string_view key,
                                const platform::Text* name) {
    if (!name || isSafeName(*name)) return std::nullopt;
    return malformed(file, fmt::format("{} \"{}\" cannot be a file name", key,
                                       name->view().substr(0, kMaxShownName)));
}

void appendPoint(const Value& value, std::string& points) {
    if (const auto* text = value.string()) points.append(*text).push_back('\0');
}

/// The texts that the matcher would compare with a rule on the extension point.
std::string pointsOf(const Dictionary& info, const Dictionary* attributes) {
    const Value* value = attributes ? attributes->find(kPointIdentifier) : nullptr;
    if (!value) value = info.find(kPointIdentifier);
    std::string points;
    if (!value) return points;
    appendPoint(*value, points);
    if (const Array* array = value->array())
        for (const Value& element : *array) appendPoint(element, points);
    return points;
}

void reportDamage(std::string_view reason) {
    EVLOG_ERROR(ops(), "unreadable encoded dictionary: {}", reason);
}

}  // namespace

void PlugInEntry::attachDictionaries() {
    std::string_view all = *dictionaries;
    record->infoPlist = LazyDictionary({dictionaries, all.substr(0, infoPlistSize)}, reportDamage);
    record->entitlements = LazyDictionary({dictionaries, all.substr(infoPlistSize)}, reportDamage);
}

BundleFolder::BundleFolder(std::string canonical)
    : dirfd(AT_FDCWD), name(canonical), path(std::move(canonical)) {}

BundleFolder::BundleFolder(int directory, const std::string& parent, std::string entry)
    : dirfd(directory), name(std::move(entry)), path(joinPath(parent, name)) {}

BundleFolder BundleFolder::reachedBy(int directory) const {
    BundleFolder folder(*this);
    folder.dirfd = directory;
    folder.name.assign(1, '.');
    return folder;
}

FileIdentity BundleFolder::identity() const {
    return FileIdentity::at(dirfd, name.c_str());
}

bool BundleFolder::isEntry() const {
    return dirfd != AT_FDCWD;
}

BundleReader::BundleReader(SdkDictionaries& sdks, SdkMerge merge,
                           std::vector<std::string> languages, ForeignPlaces& places)
    : sdks_(sdks), places_(places), merge_(std::move(merge)), languages_(std::move(languages)) {
    for (const std::string& language : languages_) languageText_.append(language).push_back('\0');
}

void BundleReader::beginPass() {
    sdkStamps_.clear();
}

bool BundleReader::appendStamp(const BundleFolder& folder, const std::string& file,
                               std::string& stamps) {
    const FileStamp stamp = FileStamp::beneath(folder.dirfd, folder.name, file);
    note(stamp);
    stamp.appendTo(stamps);
    return stamp.exists();
}

/// Names from the file depend on the user's languages as well.
void BundleReader::appendLocalizedStamp(const BundleFolder& folder, std::string& stamps) {
    if (appendStamp(folder, kLocalized, stamps)) stamps += languageText_;
}

/// Compares stamps, of which the last of the first `stampsToLocalized` is Localized.plist's.
bool BundleReader::areLike(std::string_view a, std::string_view b, int stampsToLocalized) const {
    if (a.size() != b.size()) return false;
    for (int number = 1; !a.empty(); ++number) {
        const FileStamp stamp = FileStamp::from(a);
        if (a.size() < FileStamp::kStoredSize || !stamp.isLike(FileStamp::from(b))) return false;
        a.remove_prefix(FileStamp::kStoredSize);
        b.remove_prefix(FileStamp::kStoredSize);
        if (number != stampsToLocalized || !stamp.exists()) continue;
        if (!a.starts_with(languageText_) || !b.starts_with(languageText_)) return false;
        a.remove_prefix(languageText_.size());
        b.remove_prefix(languageText_.size());
    }
    return true;
}

bool BundleReader::isLike(const Fingerprint& a, const Fingerprint& b) const {
    constexpr int kStampsToLocalized = 3;
    const auto filesOf = [](const std::string& stamps) {
        return std::string_view(stamps).substr(std::min(stamps.size(), FileIdentity::kStoredSize));
    };
    const std::string stampsOfA = a.stamps.unpacked(), stampsOfB = b.stamps.unpacked();
    return a.executable == b.executable && a.sdk == b.sdk &&
           a.directory().inode == b.directory().inode &&
           areLike(filesOf(stampsOfA), filesOf(stampsOfB), kStampsToLocalized);
}

bool BundleReader::areApplicationStampsLike(std::string_view a, std::string_view b) const {
    constexpr int kStampsToLocalized = 2;
    return areLike(a, b, kStampsToLocalized);
}

void BundleReader::appendFixedStamps(const BundleFolder& folder, const FileIdentity& directory,
                                     std::string& stamps) {
    isUnsure_ = isUnsure_ || directory == FileIdentity();
    directory.appendTo(stamps);
    appendStamp(folder, kInfoPlist, stamps);
    appendStamp(folder, kEntitlements, stamps);
    appendLocalizedStamp(folder, stamps);
}

const std::string& BundleReader::sdkStamps(const std::string& sdk) {
    auto [entry, isNew] = sdkStamps_.try_emplace(sdk);
    if (isNew)
        for (const std::string& file : sdks_.candidateFiles(sdk)) {
            // What cannot be looked at is said where it is read.
            FileStamp stamp;
            stamp.error = ETIMEDOUT;
            if (places_.answers(file)) stamp = FileStamp::of(file);
            note(stamp);
            stamp.appendTo(entry->second);
        }
    return entry->second;
}

void BundleReader::appendNamedStamps(const BundleFolder& folder, const Fingerprint& print,
                                     std::string& stamps) {
    if (!print.executable.empty()) appendStamp(folder, print.executable, stamps);
    if (!print.sdk.empty()) stamps += sdkStamps(print.sdk);
}

bool BundleReader::isUnchanged(const BundleFolder& folder, const FileIdentity& directory,
                               const Fingerprint& print) {
    std::string stamps;
    appendFixedStamps(folder, directory, stamps);
    appendNamedStamps(folder, print, stamps);
    return print.stamps == stamps;
}

Fingerprint BundleReader::refreshed(const BundleFolder& folder, Fingerprint print) {
    std::string stamps;
    appendFixedStamps(folder, folder.identity(), stamps);
    appendNamedStamps(folder, print, stamps);
    print.stamps = PackedBytes(stamps);
    return print;
}

Fingerprint BundleReader::toRemember(const BundleFolder& folder, const Fingerprint& print) {
    isUnsure_ = false;
    sdkStamps_.erase(print.sdk);
    Fingerprint fresh = refreshed(folder, print);
    return isUnsure_ ? print : fresh;
}

void BundleReader::note(const FileStamp& stamp) {
    isUnsure_ = isUnsure_ || !(stamp.exists() || stamp.isMissing());
}

BundleReader::Reading BundleReader::readPlugIn(const BundleFolder& place, bool withDigest) {
    Reading reading;
    reading.entry.record = std::make_shared<TDPlugInProxy>();
    const Result<UniqueFd> directory = openDirectory(place);
    if (!directory) {
        reading.refusal = directory.error();
        return reading;
    }
    const BundleFolder folder = place.reachedBy(directory->get());
    // Stamps are older than what is read, so a change in between is seen by the next walk.
    std::string stamps;
    appendFixedStamps(folder, folder.identity(), stamps);
    reading.refusal = fill(folder, reading.entry, stamps, withDigest);
    reading.entry.print.stamps = PackedBytes(stamps);
    reading.entry.record->bundleIdentity = reading.entry.print.directory();
    return reading;
}

std::optional<Error> BundleReader::complete(Dictionary& info, const std::string& sdk) {
    if (!sdk.empty()) {
        for (const std::string& file : sdks_.candidateFiles(sdk))
            if (!places_.answers(file)) return Error::posix(ETIMEDOUT, file);
        const Result<std::optional<Dictionary>> defaults = sdks_.copyExtensionSdkEntry(sdk);
        if (!defaults) return defaults.error();
        if (*defaults) info = merge_(**defaults, info);
    }
    const Dictionary* foundPlugIn = dictionaryAt(info, kExtension);
    const Dictionary* foundAttributes =
        foundPlugIn ? dictionaryAt(*foundPlugIn, kAttributes) : nullptr;
    if (!foundAttributes) return std::nullopt;

    Dictionary plugIn = *foundPlugIn;
    Dictionary attributes = *foundAttributes;
    if (!attributes.contains("VXExtensionVersion")) {
        const Value* version = info.find(kShortVersion);
        attributes.set("VXExtensionVersion", version ? *version : Value("1"));
    }
    const Value* point = plugIn.find(kPointIdentifier);
    if (point && !attributes.contains(kPointIdentifier)) attributes.set(kPointIdentifier, *point);
    plugIn.set(kAttributes, std::move(attributes));
    info.set(kExtension, std::move(plugIn));
    return std::nullopt;
}

/// Names that cannot be used are left out. Error: the file cannot be read just now.
Result<Dictionary> BundleReader::localizations(const BundleFolder& folder) {
    if (languages_.empty()) return Dictionary();
    Result<Dictionary> dictionary = readDictionary(folder, kLocalized);
    if (dictionary || isTransient(dictionary.error())) return dictionary;
    if (!isMissing(dictionary.error()))
        EVLOG_ERROR(ops(), "ignoring names of a bundle: {}", pub(dictionary.error().text));
    return Dictionary();
}

std::optional<Error> BundleReader::fill(const BundleFolder& folder, PlugInEntry& entry,
                                        std::string& stamps, bool withDigest) {
    const std::string file = joinPath(folder.path, kInfoPlist);
    Result<Dictionary> read = readDictionary(folder, kInfoPlist);
    if (!read) return read.error();
    Dictionary info = *read;
    const Dictionary* extension = dictionaryAt(info, kExtension);
    if (!extension) return malformed(file, "no \"VXExtension\" dictionary, so not a plug-in");

    const auto* executable = stringAt(info, kExecutable);
    if (auto error = unsafeName(file, kExecutable, executable)) return error;
    if (executable) entry.print.executable = *executable;
    const auto* sdk = stringAt(*extension, kPointIdentifier);
    if (sdk && isSafeName(*sdk)) entry.print.sdk = *sdk;
    const std::size_t fixedSize = stamps.size();
    appendNamedStamps(folder, entry.print, stamps);
    if (executable && (withDigest || !FileStamp::from(stamps.substr(fixedSize)).settled))
        entry.print.executableDigest = digestOf(folder, executable->string(), places_);

    if (std::optional<Error> error = complete(info, entry.print.sdk))
        return Error{error->domain, error->code, fmt::format("{}: {}", file, error->text)};
    if (auto error = excess(file, info)) return error;
    if (auto error = encode(folder, info, entry)) return error;
    return describePlugIn(folder, info, entry);
}

std::optional<Error> BundleReader::encode(const BundleFolder& folder, const Dictionary& info,
                                          PlugInEntry& entry) {
    Result<Dictionary> entitlements = readDictionary(folder, kEntitlements);
    if (!entitlements && !isMissing(entitlements.error())) return entitlements.error();
    auto dictionaries = std::make_shared<std::string>();
    auto append = [&](const char* name, const Dictionary& dictionary) -> std::optional<Error> {
        encodeCbor(dictionary, *dictionaries);
        // A small binary list may have expanded to something large.
        if (dictionaries->size() <= kMaxRecordSize) return std::nullopt;
        return malformed(joinPath(folder.path, name), "too large when expanded");
    };
    if (auto error = append(kInfoPlist, info)) return error;
    entry.infoPlistSize = dictionaries->size();
    if (auto error = append(kEntitlements, entitlements ? *entitlements : Dictionary()))
        return error;
    dictionaries->shrink_to_fit();
    entry.dictionaries = std::move(dictionaries);
    entry.attachDictionaries();
    return std::nullopt;
}

std::optional<Error> BundleReader::describePlugIn(const BundleFolder& folder,
                                                  const Dictionary& info, PlugInEntry& entry) {
    const std::string file = joinPath(folder.path, kInfoPlist);
    const Dictionary* extension = dictionaryAt(info, kExtension);
    if (!extension) return malformed(file, "the merge lost the \"VXExtension\" dictionary");
    const Dictionary& plugIn = *extension;
    if (auto error = wrongType(file, info, plugIn)) return error;
    const auto* bundle = stringAt(info, kBundleIdentifier);
    const auto* identifier = identifierAt(plugIn, info, kIdentifier);
    if (!identifier) identifier = bundle;
    if (!identifier)
        return malformed(file, fmt::format("neither {} nor {}", kIdentifier, kBundleIdentifier));
    const auto* original = identifierAt(plugIn, info, kOriginalIdentifier);
    if (!original) original = identifier;
    if (auto error = unsafeName(file, kBundleIdentifier, bundle)) return error;
    if (auto error = unsafeName(file, kIdentifier, identifier)) return error;

    TDPlugInProxy& record = *entry.record;
    record.bundlePath = folder.path;
    // Never empty: it tells the launcher whose instances a removal ends.
    record.bundleIdentifier = bundle ? *bundle : *identifier;
    record.plugInIdentifier = *identifier;
    record.originalIdentifier = *original;
    const auto* version = stringAt(info, "QFBundleVersion");
    if (!version) version = stringAt(info, kShortVersion);
    if (version) record.bundleVersion = *version;
    record.onSystemPartition = isOnSystemPartition(folder.path);
    const Result<Dictionary> localized = localizations(folder);
    if (!localized) return localized.error();
    LocalizedNames names = localizedNames(info, *localized, languages_);
    record.localizedName = std::move(names.display);
    record.localizedShortName = std::move(names.brief);

    entry.points = pointsOf(info, dictionaryAt(plugIn, kAttributes));
    const Value* protocol = plugIn.find("VXExtensionProtocol");
    bool isData = protocol && *protocol == Value("#Data");
    entry.needsContainer = !isData;
    return std::nullopt;
}

std::string BundleReader::applicationStamps(const BundleFolder& folder) {
    std::string stamps;
    appendStamp(folder, kInfoPlist, stamps);
    appendLocalizedStamp(folder, stamps);
    appendStamp(folder, kPlaceholder, stamps);
    return stamps;
}

BundleReader::ApplicationReading BundleReader::readApplication(const BundleFolder& place) {
    ApplicationReading reading;
    const Result<UniqueFd> directory = openDirectory(place);
    const BundleFolder folder = directory ? place.reachedBy(directory->get()) : place;
    reading.stamps = applicationStamps(folder);
    auto record = std::make_shared<TDApplicationProxy>();
    record->bundlePath = folder.path;
    std::string ignored;
    record->isPlaceholder = appendStamp(folder, kPlaceholder, ignored);

    const std::string file = joinPath(folder.path, kInfoPlist);
    const Result<Dictionary> info =
        directory ? readDictionary(folder, kInfoPlist) : Result<Dictionary>(directory.error());
    const Result<Dictionary> localized = info ? localizations(folder) : Dictionary();
    if (info) {
        const auto* identifier = stringAt(*info, kBundleIdentifier);
        if (auto error = unsafeName(file, kBundleIdentifier, identifier))
            EVLOG_ERROR(ops(), "application without identifier: {}", pub(error->text));
        else if (identifier)
            record->bundleIdentifier = *identifier;
    }
    if (info && localized)
        record->localizedName = localizedNames(*info, *localized, languages_).display.value_or("");
    if (!info || !localized) reading.failure = info ? localized.error() : info.error();
    if (reading.failure && isTransient(*reading.failure)) reading.stamps.clear();
    reading.record = std::move(record);
    return reading;
}

}  // namespace platform::tandry
