#pragma once

#include <sys/inotify.h>

#include <cstdint>
#include <limits>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "platform/system/UniqueFd.h"
#include "platform/tandry/SharedTexts.h"

namespace platform::tandry {

/// Parts of the disk that a walk has to look at again, as canonical paths; "" is everything.
using Scopes = std::set<std::string>;

/// Scopes that have been touched, and whether the last that happened to each was that a directory
/// was renamed into its place: then it is there in whole.
using Touches = std::map<std::string, bool>;

/// The directories that walks over the disk depend on, watched by inotify. A walk marks each
/// directory before it looks into it, so that no later change is lost; at the walk's end the
/// directories that it did not mark any more are let go. Belongs to the registry's thread, but for
/// `isQuiet`.
///
/// A directory that is not there, or that may not be read, is not watched: whoever marks it marks
/// the directory that holds it, too, where its coming or a change of its mode shows.
class FolderWatch {
  public:
    /// At most `mostWatches` directories are watched, as if the system allowed no more.
    explicit FolderWatch(std::size_t mostWatches = std::numeric_limits<std::size_t>::max())
        : mostWatches_(mostWatches) {}

    /// While it is postponed, walks mark nothing.
    void setPostponed(bool isPostponed) { isPostponed_ = isPostponed; }
    bool isPostponed() const { return isPostponed_; }

    /// Begins a walk. `overEverything` says that it will mark all that still matters.
    void beginWalk(bool overEverything);

    /// Any change directly in the directory touches `scope`.
    void markContents(const std::string& path, const std::string& scope);
    /// A change of an entry whose name ends in `suffix` touches the path of that entry, a change of
    /// the directory itself everything.
    void markEntries(const std::string& path, std::string_view suffix);
    /// Whatever makes an absolute path lead somewhere else touches everything: a directory on the
    /// way comes, goes or is renamed, or a symbolic link on the way is replaced.
    void markWay(const std::string& path);

    /// Lets go what lies within `scope` and was not marked by this walk.
    void releaseUnmarked(const std::string& scope);
    void endWalk();

    /// Whether directories stay unwatched because the system has no more watches, descriptors or
    /// memory. Told in one error line when it begins; a walk over everything tries again.
    bool isShort() const { return isShort_; }

    /// Whether a directory, by its canonical path, and all above it are watched. `known` is one for
    /// which this was so a moment ago, or "": neighbours share most of the way.
    bool watchesWayTo(const std::string& directory, const std::string& known) const;
    /// Whether all changes of a file system pass through this kernel, so that its watch tells of
    /// them.
    static bool isLocal(const std::string& path);

    /// Readable when there are changes. -1 when the system has no descriptor.
    int descriptor() const { return inotify_.get(); }
    /// What has been touched since the last call. Does not wait; after a flood some may be left for
    /// the next call.
    Touches takeTouched();

    /// All that was taken has been acted upon, and what walks found is there for all to see.
    void settle();
    /// Whether nothing has happened to what is watched that walks have not taken in. From any
    /// thread; false from the beginning of a walk, or of taking changes, until all is settled.
    bool isQuiet() const;

  private:
    enum class Kind { Self, Name, Entries, Contents };
    /// Why a directory is watched. There may be many directories: what they have in common is
    /// shared.
    struct Reason {
        Kind kind;
        /// `Name`: which one matters, `Entries`: the suffix of those that do, `Contents`: the
        /// scope.
        SharedText text;
        bool operator==(const Reason& other) const;
    };
    struct Watched {
        const std::string* path = nullptr;  // in `paths_`
        std::vector<Reason> reasons;        // each once
        std::uint32_t walk = 0;             // the last that marked it
    };
    using Descriptor = int;  // the kernel's, of one watched directory

    void mark(const std::string& path, Kind kind, std::string_view text = {});
    Descriptor add(const std::string& path, Kind kind, bool isKnown);
    void release(std::map<std::string, Descriptor>::iterator place);
    void take(const inotify_event& event, std::string_view name, Touches& touched);
    void disturb();

    std::size_t mostWatches_;
    UniqueFd inotify_;  // the same one from the first walk that marks something
    std::unordered_map<Descriptor, Watched> watches_;
    std::map<std::string, Descriptor> paths_;
    SharedTexts texts_;  // of reasons: neighbours have the same
    std::uint32_t walk_ = 0;
    bool isOverEverything_ = false;
    bool isPostponed_ = false;
    bool isShort_ = false;
    int shortage_ = 0;  // the errno that kept this walk from a watch
    mutable std::mutex mutex_;
    bool isSettled_ = false;  // guarded by mutex_; the descriptor is there when it is true
};

}  // namespace platform::tandry
