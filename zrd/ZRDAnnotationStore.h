#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>

#include "platform/values/Value.h"
#include "zrd/AnnotationFile.h"
#include "zrd/AnnotationShares.h"

namespace platform {
struct Directories;
}

namespace zorvan {

class ZRDPlugIn;

/// The user's choices about plug-ins ("annotations"), kept over restarts: one small dictionary an
/// annotation key, in memory and in one property-list file that is rewritten after every change.
///
/// Owned by the database; used on its queue only, once it is built, but for the file: that is used
/// by the thread that saves, so that nobody waits for the disk.
class ZRDAnnotationStore {
  public:
    /// The store, loaded. The file is at `path` as given, or at the default place. A file that
    /// cannot be loaded leaves the store empty, which is logged unless there is just no file; it is
    /// replaced by the first change.
    static std::unique_ptr<ZRDAnnotationStore> initWithDatabase(
        const std::optional<std::string>& path, const platform::Directories& directories);

    /// What lookups see under a key, or null. Good until the next change.
    const platform::Dictionary* annotationForIdentifier(std::string_view key) const;
    const platform::Dictionary* annotationForPlugIn(const ZRDPlugIn& plugIn) const;

    /// Of the file's largest size, what hosts' data leaves for the user's elections.
    static constexpr std::size_t kReservedForElections = 64u << 20;

    /// Whether the file, which has a largest size, could hold a host's data as well and still have
    /// room for elections, or holds no more than before. A change that is made all the same might
    /// keep every later one from being saved.
    bool hasRoomFor(const platform::Dictionary& annotation, const ZRDPlugIn& plugIn) const;

    /// Whether hosts of that origin, too, may have the data of `annotation` stored: what they have
    /// set since the daemon began is a quarter of that room at the most.
    bool hasShareFor(const platform::Dictionary& annotation, const ZRDPlugIn& plugIn,
                     const platform::Origin& origin) const;

    /// When lookups see a change: at once, or when it is in the file, so that whatever was seen
    /// outlives the daemon.
    enum class Shown { AtOnce, OnceSaved };
    /// Merges the entries of `annotation` into the plug-in's annotation, or removes that when there
    /// are none. Hosts' data belongs to the origin from then on, if one is given. To be saved next.
    void setAnnotation(const std::optional<platform::Dictionary>& annotation,
                       const ZRDPlugIn& plugIn,
                       const std::optional<platform::Origin>& origin = std::nullopt,
                       Shown shown = Shown::OnceSaved);

    AnnotationSnapshot snapshot();
    bool hasChanged() const { return !changed_.empty(); }
    /// A snapshot is in the file, or could not be written: the changes stay either way, and reach
    /// the file with the next successful save.
    void saved(std::uint64_t number);
    AnnotationFile& file() { return file_; }

    /// <user directory>/com.orbel.zorvan/Annotations. Makes the directory (0700). Without one the
    /// daemon cannot do its work: an internal inconsistency.
    static std::string defaultDatabaseURL(const platform::Directories& directories);

    const platform::Dictionary& annotations() const { return annotations_; }

  private:
    /// What lookups see of an annotation until its last change is in the file.
    struct Hidden {
        std::optional<platform::Value> before;
        std::uint64_t change = 0;
    };

    platform::Dictionary merged(const platform::Dictionary& annotation,
                                const std::string& key) const;

    explicit ZRDAnnotationStore(std::string path) : file_(std::move(path)) {}

    AnnotationFile file_;
    platform::Dictionary annotations_;
    platform::PropertyListCost cost_;  // of the annotations
    std::set<std::string> changed_;    // keys, since the last snapshot
    std::uint64_t changes_ = 0;
    std::map<std::string, Hidden, std::less<>> hidden_;
    AnnotationShares shares_{AnnotationText::kMaxSize - kReservedForElections};
};

}  // namespace zorvan
