#include "zrd/ZRDAnnotationStore.h"

#include <fmt/format.h>

#include <cerrno>
#include <utility>

#include "Zorvan/Helpers.h"
#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "platform/plist/PropertyListCost.h"
#include "platform/system/Directories.h"
#include "platform/system/Files.h"
#include "zrd/ZRDPlugIn.h"

namespace zorvan {

using platform::Dictionary;
using platform::Value;

namespace {

bool isMissingFile(const ZRError& error) {
    return error.domain == "POSIX" && error.code == ENOENT;
}

platform::PropertyListCost costOf(const std::string& key, const Value& annotation) {
    return platform::costOfPropertyList(Dictionary{{key, annotation}});
}

}  // namespace

std::unique_ptr<ZRDAnnotationStore> ZRDAnnotationStore::initWithDatabase(
    const std::optional<std::string>& path, const platform::Directories& directories) {
    std::unique_ptr<ZRDAnnotationStore> store(
        new ZRDAnnotationStore(path ? *path : defaultDatabaseURL(directories)));
    if (auto error = store->file_.loadDb(store->annotations_)) {
        if (!isMissingFile(*error)) {
            EVLOG_ERROR(ops(), "unable to load annotation database:{} error:{} (resetting)",
                        pub(store->file_.path()), pub(*error));
        }
    }
    for (const auto& [key, annotation] : store->annotations_)
        store->cost_ += costOf(key, annotation);
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

const Dictionary* ZRDAnnotationStore::annotationForIdentifier(std::string_view key) const {
    const Value* annotation = annotations_.find(key);
    if (const auto hidden = hidden_.find(key); hidden != hidden_.end())
        annotation = hidden->second.before ? &*hidden->second.before : nullptr;
    return annotation ? annotation->dictionary() : nullptr;
}

const Dictionary* ZRDAnnotationStore::annotationForPlugIn(const ZRDPlugIn& plugIn) const {
    return annotationForIdentifier(plugIn.annotationKey());
}

Dictionary ZRDAnnotationStore::merged(const Dictionary& annotation, const std::string& key) const {
    const Value* current = annotations_.find(key);
    Dictionary merged = current && current->dictionary() ? *current->dictionary() : Dictionary();
    for (const auto& [name, value] : annotation) merged.set(name, value);
    return merged;
}

bool ZRDAnnotationStore::hasRoomFor(const Dictionary& annotation, const ZRDPlugIn& plugIn) const {
    const std::string& key = plugIn.annotationKey();
    platform::PropertyListCost after = cost_;
    after += costOf(key, merged(annotation, key));
    if (const Value* current = annotations_.find(key)) after -= costOf(key, *current);
    const bool isNoMore =
        after.objects <= cost_.objects && after.bytes <= cost_.bytes && after.work <= cost_.work;
    return isNoMore || after.fits(AnnotationText::kMaxSize - kReservedForElections);
}

bool ZRDAnnotationStore::hasShareFor(const Dictionary& annotation, const ZRDPlugIn& plugIn,
                                     const platform::Origin& origin) const {
    const std::string& key = plugIn.annotationKey();
    return shares_.hasRoomFor(origin, key, costOf(key, merged(annotation, key)));
}

void ZRDAnnotationStore::setAnnotation(const std::optional<Dictionary>& annotation,
                                       const ZRDPlugIn& plugIn,
                                       const std::optional<platform::Origin>& origin, Shown shown) {
    const std::string& key = plugIn.annotationKey();
    const Value* current = annotations_.find(key);
    ++changes_;
    if (shown == Shown::OnceSaved) {
        const auto before = current ? std::optional(*current) : std::nullopt;
        hidden_.try_emplace(key, Hidden{before}).first->second.change = changes_;
    }
    std::optional<platform::PropertyListCost> cost;
    if (current) cost_ -= costOf(key, *current);
    if (annotation) {
        Dictionary changed = merged(*annotation, key);
        cost = costOf(key, changed);
        cost_ += *cost;
        annotations_.set(key, std::move(changed));
        if (origin && annotation->contains(annotation::kExtension)) shares_.give(*origin, key);
    } else {
        annotations_.remove(key);
    }
    shares_.changed(key, cost);
    changed_.insert(key);
}

AnnotationSnapshot ZRDAnnotationStore::snapshot() {
    return {annotations_, cost_, std::exchange(changed_, {}), changes_};
}

void ZRDAnnotationStore::saved(std::uint64_t number) {
    std::erase_if(hidden_, [&](const auto& entry) { return entry.second.change <= number; });
}

}  // namespace zorvan
