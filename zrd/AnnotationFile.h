#pragma once

#include <cstdint>
#include <optional>
#include <set>
#include <string>

#include "Zorvan/ZRError.h"
#include "platform/plist/PropertyListCost.h"
#include "platform/system/Files.h"
#include "platform/values/Value.h"
#include "zrd/AnnotationText.h"

namespace zorvan {

/// All annotations as they were at a moment, to be saved.
struct AnnotationSnapshot {
    platform::Dictionary annotations;
    platform::PropertyListCost cost;  // of each with its key
    std::set<std::string> changed;    // keys, since the last snapshot
    std::uint64_t number = 0;         // of changes until then
};

/// The file of annotations. Its root is {"version": 16, "data": {annotation key: annotation}}; it
/// is read in any property-list form and written as XML, atomically. Changes that others make to it
/// while the daemon runs are lost.
///
/// Used by one thread at a time.
class AnnotationFile {
  public:
    explicit AnnotationFile(std::string path) : path_(std::move(path)) {}

    const std::string& path() const { return path_; }

    /// Reads the annotations; leaves `annotations` alone when it answers what went wrong. Goes back
    /// to those that were synced last when a crash of the machine has spoilt later ones.
    std::optional<ZRError> loadDb(platform::Dictionary& annotations);

    /// Replaces the file, by each snapshot in its order. Answers what went wrong; the next save
    /// makes up for it.
    std::optional<ZRError> saveDb(const AnnotationSnapshot& snapshot, platform::Sync sync);
    /// Syncs what was saved to be synced later; answers whether that succeeded.
    bool sync();

  private:
    const std::string path_;
    AnnotationText text_;
    bool isUnsynced_ = false;
};

}  // namespace zorvan
