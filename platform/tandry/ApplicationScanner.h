#pragma once

#include <map>
#include <string>
#include <vector>

#include "platform/tandry/BundleReader.h"
#include "platform/tandry/Complaints.h"
#include "platform/tandry/DataContainers.h"
#include "platform/tandry/DictionaryRoom.h"
#include "platform/tandry/FolderWatch.h"
#include "platform/tandry/ForeignPlaces.h"
#include "platform/tandry/RegistryState.h"
#include "platform/tandry/UntrustedPlaces.h"

namespace platform::tandry {

struct FolderEntries;

/// Brings the registry's state in line with the disk. What did not change since the state was last
/// in line is only looked at, not read. Belongs to the registry's thread, as the state does.
class ApplicationScanner {
  public:
    /// Which directories a walk starts from.
    struct Folders {
        std::vector<std::string> applications;  // hold the `.app` directories
        std::vector<std::string> dictionaries;  // hold what the reader merges into bundles
    };

    /// Every directory that a walk looks into is marked in `watch`; bundles in untrusted places are
    /// left out. What a walk gives to whom is to be stored by the caller. All references must
    /// outlive this.
    ApplicationScanner(RegistryState& state, BundleReader& reader, DataContainers& containers,
                       FolderWatch& watch, UntrustedPlaces& untrusted, ForeignPlaces& places,
                       Folders folders);

    /// Walks every application folder and everything that was registered by path.
    RegistryChanges scanAll();
    /// The same for one canonical path alone: that of a plug-in or of an application that is held
    /// or registered. `hasPlugIns` says whether good plug-ins were met there.
    RegistryChanges scanPath(const std::string& path, bool& hasPlugIns);
    /// The same for what the watch says was touched.
    RegistryChanges scanTouched(const Scopes& scopes);

    /// Whether the last walk could read whatever it met, but for what only a change on disk can
    /// mend, and all that matters is watched.
    bool isComplete() const { return !hasTransientFailure_ && !watch_.isShort(); }

    /// The paths of plug-ins whose exchange for another directory the watch would not show at once.
    const std::set<std::string>& unwatched() const { return unwatched_; }

    /// Whether an application folder holds the plug-in or application at a path, so that a walk
    /// would find it by itself.
    bool isHeld(const std::string& path);

    /// The canonical path of the nearest application above a bundle; empty when there is none.
    static std::string applicationAbove(std::string_view path);
    static bool isApplication(std::string_view path);

  private:
    void begin(bool overEverything);
    void visitAll();
    void keepUnseen(const std::string& path);
    void noteLost(const FolderEntries& found);
    bool canSee(const std::string& path);
    bool canSee(const BundleFolder& folder);
    void visitFolder(const std::string& folder);
    void visitRegistration(const std::string& path);
    bool visitScope(const std::string& path);
    void visitPath(const std::string& path);
    void visitApplication(const BundleFolder& place);
    void visitPlugIns(const BundleFolder& application, const std::string& folder);
    void visitPlugIn(const BundleFolder& folder, const TDApplicationProxyRef& application,
                     const std::string& scope);
    bool isUntrusted(const std::string& path, const char* kind);
    bool isUntrusted(const std::string& path, const FileIdentity& directory, const char* kind);
    void refuse(const BundleFolder& folder, BundleReader::Reading reading);
    bool noteTransient(const Error& error);
    void install(const BundleFolder& folder, BundleReader::Reading reading,
                 const TDApplicationProxyRef& application);
    TDApplicationProxyRef applicationAt(const BundleFolder& folder);
    TDApplicationProxyRef applicationOf(const std::string& plugInPath);
    void keep(PlugInEntry& entry);
    void replace(PlugInEntry& entry);
    bool isSame(PlugInEntry& known, const PlugInEntry& read);
    bool isBeyondRoom(const PlugInEntry& entry) const;
    bool isForgotten(const BundleFolder& folder);
    bool isRefused(const BundleFolder& folder, const FileIdentity& directory,
                   const std::string& application);
    bool isAllMet(const std::string& scope);
    bool isSelfContained(const std::string& scope) const;
    bool isOutdated(const std::string& application) const;
    void noteLink(const std::string& link, const std::string& target);
    bool isUnreachable(const std::string& path) const;
    void dropUnmet(const std::string& scope);
    void noteUnwatched(const std::string& scope);
    RegistryChanges finish(const Scopes& scopes);

    RegistryState& state_;
    BundleReader& reader_;
    DataContainers& containers_;
    FolderWatch& watch_;
    UntrustedPlaces& untrusted_;
    ForeignPlaces& places_;
    Folders folders_;
    Complaints complaints_;
    std::map<std::string, std::string> folderPaths_;  // canonical ones, when they were last seen
    std::set<std::string> links_;  // links to bundles since the last walk over everything, and
                                   // what they lead to
    std::set<std::string> unwatched_;
    // Of the walk under way:
    Pass pass_ = 0;
    RegistryChanges changes_;
    DictionaryRoom room_;
    std::size_t metPlugIns_ = 0;            // good ones that were looked at
    bool isIncomplete_ = false;             // what was not met may be there all the same
    bool hasTransientFailure_ = false;      // something failed that says nothing about the disk
    std::vector<std::string> unreachable_;  // paths that could not be looked into
};

}  // namespace platform::tandry
