#pragma once

#include <memory>
#include <optional>
#include <string>

#include "Zorvan/ZRError.h"
#include "platform/system/Files.h"
#include "platform/values/Value.h"
#include "zrd/AnnotationShares.h"
#include "zrd/AnnotationText.h"

namespace platform {
struct Directories;
}

namespace zorvan {

class ZRDPlugIn;

/// The user's choices about plug-ins ("annotations"), kept over restarts: one small dictionary an
/// annotation key, in memory and in one property-list file that is rewritten after every change.
///
/// The file's root is {"version": 16, "data": {annotation key: annotation}}; it is read in any
/// property-list form and written as XML. Changes that others make to it while the daemon runs are
/// lost.
///
/// Owned by the database; used on its queue only, once it is built.
class ZRDAnnotationStore {
  public:
    /// The store, loaded. The file is at `path` as given, or at the default place. A file that
    /// cannot be loaded leaves the store empty, which is logged unless there is just no file; it is
    /// replaced by the first change.
    static std::unique_ptr<ZRDAnnotationStore> initWithDatabase(
        const std::optional<std::string>& path, const platform::Directories& directories);

    /// The annotation under a key, or null. Good until the next change.
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

    /// Merges the entries of `annotation` into the plug-in's annotation, or removes that when there
    /// are none, then saves. A failed save is logged; the change stays and reaches the file with
    /// the next successful one. Hosts' data belongs to the origin from then on, if one is given.
    /// Who makes many changes syncs the file once, after the last one.
    void setAnnotation(const std::optional<platform::Dictionary>& annotation,
                       const ZRDPlugIn& plugIn,
                       const std::optional<platform::Origin>& origin = std::nullopt,
                       platform::Sync sync = platform::Sync::Yes);
    /// Syncs the file if changes were saved without. What cannot be synced is saved once more; a
    /// failure of that is logged.
    void sync();

    /// Each answers what went wrong, or none.
    std::optional<ZRError> loadDb();
    std::optional<ZRError> saveDb(platform::Sync sync = platform::Sync::Yes);

    /// <user directory>/com.orbel.zorvan/Annotations. Makes the directory (0700). Without one the
    /// daemon cannot do its work: an internal inconsistency.
    static std::string defaultDatabaseURL(const platform::Directories& directories);

    const std::string& annotationsURL() const { return annotationsURL_; }
    const platform::Dictionary& annotations() const { return annotations_; }

  private:
    platform::Dictionary merged(const platform::Dictionary& annotation,
                                const std::string& key) const;

    void logFailure(const ZRError& error) const;

    explicit ZRDAnnotationStore(std::string path) : annotationsURL_(std::move(path)) {}

    std::string annotationsURL_;
    platform::Dictionary annotations_;
    platform::PropertyListCost cost_;  // of the annotations
    AnnotationText text_;
    bool isUnsynced_ = false;
    AnnotationShares shares_{AnnotationText::kMaxSize - kReservedForElections};
};

}  // namespace zorvan
