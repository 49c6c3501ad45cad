#include "zrd/ZRDAnnotationStore.h"

#include <fmt/format.h>

#include <cerrno>

#include "Zorvan/Helpers.h"
#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "platform/plist/PropertyList.h"
#include "platform/plist/PropertyListCost.h"
#include "platform/system/Directories.h"
#include "platform/system/Files.h"
#include "zrd/Probes.h"
#include "zrd/ZRDPlugIn.h"

namespace zorvan {

using platform::Dictionary;
using platform::Value;

namespace {

ZRError zrError(const platform::Error& error) {
    return {error.domain, error.code, error.text};
}

bool isMissingFile(const ZRError& error) {
    return error.domain == "POSIX" && error.code == ENOENT;
}

/// The "data" of an annotation file's root, or what is wrong with it.
std::optional<ZRError> readRoot(const Value& root, Dictionary& data) {
    const Dictionary* dictionary = root.dictionary();
    const Value* version = dictionary ? dictionary->find(AnnotationText::kVersionKey) : nullptr;
    std::int64_t found = version ? version->numberAsInteger().value_or(0) : 0;
    if (found != AnnotationText::kVersion) {
        return ZRErrorWithFormat(kZRErrorVersion, "found database version {} needed version {}",
                                 found, AnnotationText::kVersion);
    }
    const Value* stored = dictionary->find(AnnotationText::kDataKey);
    if (!stored || !stored->dictionary()) {
        return ZRErrorWithCode(kZRErrorVersion, "found no data in database");
    }
    data = *stored->dictionary();
    return std::nullopt;
}

platform::PropertyListCost costOf(const std::string& key, const Value& annotation) {
    return platform::costOfPropertyList(Dictionary{{key, annotation}});
}

/// Takes out what a binary file can hold but our own file and replies cannot: one such entry would
/// keep every other from being saved.
void dropUnstorable(Dictionary& data, const std::string& file) {
    const Dictionary entries = data;
    for (const auto& [key, annotation] : entries) {
        if (platform::isPropertyList(annotation) && platform::isPropertyList(Value(key))) continue;
        EVLOG_ERROR(ops(), "leaving out an annotation that cannot be stored: {} in {}", key,
                    pub(file));
        data.remove(key);
    }
}

std::optional<ZRError> read(const std::string& file, Dictionary& annotations) {
    const auto root = platform::readPropertyListFile(file, AnnotationText::kMaxSize);
    if (!root) return zrError(root.error());
    auto error = readRoot(*root, annotations);
    if (!error) dropUnstorable(annotations, file);
    return error;
}

}  // namespace

std::unique_ptr<ZRDAnnotationStore> ZRDAnnotationStore::initWithDatabase(
    const std::optional<std::string>& path, const platform::Directories& directories) {
    std::unique_ptr<ZRDAnnotationStore> store(
        new ZRDAnnotationStore(path ? *path : defaultDatabaseURL(directories)));
    if (auto error = store->loadDb()) {
        if (!isMissingFile(*error)) {
            EVLOG_ERROR(ops(), "unable to load annotation database:{} error:{} (resetting)",
                        pub(store->annotationsURL_), pub(*error));
        }
        store->annotations_ = Dictionary();
    }
    return store;
}

std::string ZRDAnnotationStore::defaultDatabaseURL(const platform::Directories& directories) {
    char userDirectory[1024];
    std::size_t size = platform::userConfstr(directories, platform::kUserDirectory, userDirectory,
                                             sizeof userDirectory);
    if (size == 0 || size >= sizeof userDirectory) {
        ZR_INTERNAL_INCONSISTENCY(fmt::format("unable to locate user directory: errno {}", errno));
    }
    std::string directory = platform::joinPath(userDirectory, "com.orbel.zorvan") + "/";
    if (auto error = platform::makeDirectories(directory, 0700)) {
        ZR_INTERNAL_INCONSISTENCY(
            fmt::format("unable to create plugin annotations directory:{} error:{}", directory,
                        describe(*error)));
    }
    return directory + "Annotations";
}

std::optional<ZRError> ZRDAnnotationStore::loadDb() {
    text_.allChanged();
    platform::removeLeftovers(annotationsURL_);
    const auto lastSynced = platform::lastSyncedFile(annotationsURL_);
    auto error = read(annotationsURL_, annotations_);
    if (error && lastSynced && !read(*lastSynced, annotations_)) {
        EVLOG_ERROR(ops(), "annotations were lost in a crash: {}: going back to those before",
                    pub(*error));
        error.reset();
    } else if (!error && lastSynced) {
        // What the file has now is whole, but may not be on the disk yet.
        isUnsynced_ = true;
    }
    cost_ = {};
    for (const auto& [key, annotation] : annotations_) cost_ += costOf(key.string(), annotation);
    if (error) probes::dbLoad(error->domain.c_str(), static_cast<std::uint64_t>(error->code));
    sync();
    return error;
}

std::optional<ZRError> ZRDAnnotationStore::saveDb(platform::Sync sync) {
    const auto bytes = text_.text(annotations_, cost_);
    if (!bytes) return zrError(bytes.error());
    if (auto error = platform::writeFileAtomically(annotationsURL_, *bytes, sync))
        return zrError(*error);
    isUnsynced_ = sync != platform::Sync::Yes;
    return std::nullopt;
}

const Dictionary* ZRDAnnotationStore::annotationForIdentifier(std::string_view key) const {
    const Value* annotation = annotations_.find(key);
    return annotation ? annotation->dictionary() : nullptr;
}

const Dictionary* ZRDAnnotationStore::annotationForPlugIn(const ZRDPlugIn& plugIn) const {
    return annotationForIdentifier(plugIn.annotationKey());
}

Dictionary ZRDAnnotationStore::merged(const Dictionary& annotation, const std::string& key) const {
    const Dictionary* current = annotationForIdentifier(key);
    Dictionary merged = current ? *current : Dictionary();
    for (const auto& [name, value] : annotation) merged.set(name, value);
    return merged;
}

bool ZRDAnnotationStore::hasRoomFor(const Dictionary& annotation, const ZRDPlugIn& plugIn) const {
    const std::string key(plugIn.annotationKey());
    platform::PropertyListCost after = cost_;
    after += costOf(key, merged(annotation, key));
    if (const Value* current = annotations_.find(key)) after -= costOf(key, *current);
    const bool isNoMore =
        after.objects <= cost_.objects && after.bytes <= cost_.bytes && after.work <= cost_.work;
    return isNoMore || after.fits(AnnotationText::kMaxSize - kReservedForElections);
}

bool ZRDAnnotationStore::hasShareFor(const Dictionary& annotation, const ZRDPlugIn& plugIn,
                                     const platform::Origin& origin) const {
    const std::string key(plugIn.annotationKey());
    return shares_.hasRoomFor(origin, key, costOf(key, merged(annotation, key)));
}

void ZRDAnnotationStore::setAnnotation(const std::optional<Dictionary>& annotation,
                                       const ZRDPlugIn& plugIn,
                                       const std::optional<platform::Origin>& origin,
                                       platform::Sync sync) {
    const std::string key(plugIn.annotationKey());
    std::optional<platform::PropertyListCost> cost;
    if (const Value* current = annotations_.find(key)) cost_ -= costOf(key, *current);
    if (annotation) {
        // Must not keep all of the message in which it came.
        Dictionary changed = merged(platform::detached(*annotation), key);
        cost = costOf(key, changed);
        cost_ += *cost;
        annotations_.set(key, std::move(changed));
        if (origin && annotation->contains(annotation::kExtension)) shares_.give(*origin, key);
    } else {
        annotations_.remove(key);
    }
    shares_.changed(key, cost);
    text_.changed(key);
    if (auto error = saveDb(sync)) logFailure(*error);
}

void ZRDAnnotationStore::sync() {
    if (!std::exchange(isUnsynced_, false) || !platform::syncFile(annotationsURL_)) return;
    if (auto error = saveDb()) logFailure(*error);
}

void ZRDAnnotationStore::logFailure(const ZRError& error) const {
    EVLOG_ERROR(ops(), "unable to save annotations:{} error:{}", pub(annotationsURL_), pub(error));
}

}  // namespace zorvan
