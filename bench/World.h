#pragma once

#include <cstddef>
#include <string>
#include <vector>

#include "bench/Child.h"

namespace bench {

/// A directory that goes away with the object, with all that is in it.
class TemporaryDirectory {
  public:
    TemporaryDirectory();
    TemporaryDirectory(const TemporaryDirectory&) = delete;
    ~TemporaryDirectory();
    const std::string& path() const { return path_; }

  private:
    std::string path_;
};

/// Generated plug-ins in the directories of a user who has nothing else, for a daemon of their own.
///
/// Plug-ins lie in applications of ten, each with an Info.plist of about 3 KB. Of N plug-ins, 10
/// (and 100 and 1 000 where N is at least ten times that) belong to the extension point
/// `pointOf(10)` and so on, spread evenly; the rest belong to other points, and are smaller where
/// they are too many for the registry. Ten plug-ins of any N carry the attribute `kRareAttribute`;
/// all carry their number as `kNumberAttribute`.
class World {
  public:
    static constexpr const char* kRareAttribute = "ExampleSpeciality";
    static constexpr const char* kRareValue = "rare";
    static constexpr const char* kNumberAttribute = "ExampleNumber";
    static std::string pointOf(std::size_t matches);

    /// Makes the plug-ins in a new directory under `parent`.
    World(const std::string& parent, std::size_t plugIns);

    std::size_t plugIns() const { return plugIns_; }
    std::string runtimeDirectory() const { return root_ + "/run"; }
    std::string socketPath() const;
    /// Where applications are found.
    std::string applications() const { return root_ + "/data/zorvan/Applications"; }
    /// The daemon's file of annotations.
    std::string annotationsFile() const { return root_ + "/state/com.orbel.zorvan/Annotations"; }
    /// Every file that a first scan reads.
    const std::vector<std::string>& files() const { return files_; }

    /// With `more` in its environment.
    Child startDaemon(const std::vector<std::string>& more = {}) const;
    /// Removes all that daemons have made here, but the plug-ins' data containers when
    /// `keepContainers`, and waits until the file system is done with it.
    void forget(bool keepContainers) const;
    /// The end of what the daemons here have logged.
    std::string logTail() const;
    /// What a sanitizer has said among it, from its first report on; empty if it has said nothing.
    std::string sanitizerReport() const;

  private:
    void makeApplication(std::size_t number);
    void makePlugIn(const std::string& application, std::size_t number);
    std::string pointOfPlugIn(std::size_t number) const;
    bool isOneOf(std::size_t matches, std::size_t offset, std::size_t number) const;
    void writeFile(const std::string& path, const std::string& text, bool isRead);

    std::string root_;
    std::size_t plugIns_;
    std::vector<std::string> files_;
};

}  // namespace bench
