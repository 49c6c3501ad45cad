#include "zrd/AnnotationFile.h"

#include <utility>

#include "Zorvan/LogHandles.h"
#include "platform/plist/PropertyList.h"
#include "zrd/Probes.h"

namespace zorvan {

using platform::Dictionary;
using platform::Value;

namespace {

ZRError zrError(const platform::Error& error) {
    return {error.domain, error.code, error.text};
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

std::optional<ZRError> AnnotationFile::loadDb(Dictionary& annotations) {
    text_.allChanged();
    platform::removeLeftovers(path_);
    const auto lastSynced = platform::lastSyncedFile(path_);
    auto error = read(path_, annotations);
    if (error && lastSynced && !read(*lastSynced, annotations)) {
        EVLOG_ERROR(ops(), "annotations were lost in a crash: {}: going back to those before",
                    pub(*error));
        return std::nullopt;
    }
    if (error) {
        probes::dbLoad(error->domain.c_str(), static_cast<std::uint64_t>(error->code));
    } else if (lastSynced) {
        // What the file has now is whole, but may not be on the disk yet.
        isUnsynced_ = true;
        sync();
    }
    return error;
}

std::optional<ZRError> AnnotationFile::saveDb(const AnnotationSnapshot& snapshot,
                                              platform::Sync sync) {
    for (const std::string& key : snapshot.changed) text_.changed(key);
    const auto bytes = text_.text(snapshot.annotations, snapshot.cost);
    if (!bytes) return zrError(bytes.error());
    if (auto error = platform::writeFileAtomically(path_, *bytes, sync)) return zrError(*error);
    isUnsynced_ = sync != platform::Sync::Yes;
    return std::nullopt;
}

bool AnnotationFile::sync() {
    return !std::exchange(isUnsynced_, false) || !platform::syncFile(path_);
}

}  // namespace zorvan
