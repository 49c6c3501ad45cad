#pragma once

#include <string>
#include <vector>

#include "platform/tandry/BundleReader.h"
#include "platform/tandry/DataContainers.h"
#include "platform/tandry/RegistryState.h"

namespace platform::tandry {

/// Brings the registry's state in line with the disk. What did not change since the state was last
/// in line is only looked at, not read. Belongs to the registry's thread, as the state does.
class ApplicationScanner {
  public:
    /// `applicationFolders` hold the `.app` directories. All references must outlive this.
    ApplicationScanner(RegistryState& state, BundleReader& reader, DataContainers& containers,
                       std::vector<std::string> applicationFolders);

    /// Walks every application folder and everything that was registered by path.
    RegistryChanges scanAll();
    /// The same for one canonical path alone: that of a plug-in or of an application.
    /// `hasPlugIns` says whether good plug-ins were met there.
    RegistryChanges scanPath(const std::string& path, bool& hasPlugIns);

    /// Whether an application folder holds the plug-in or application at a path, so that a walk
    /// would find it by itself.
    bool isHeld(const std::string& path) const;

    /// The canonical path of the nearest application above a bundle; empty when there is none.
    static std::string applicationAbove(std::string_view path);
    static bool isApplication(std::string_view path);

  private:
    void begin();
    void visitAll();
    void visitFolder(const std::string& folder);
    void visitPath(const std::string& path);
    void visitApplication(const std::string& path);
    void visitPlugIns(const std::string& application, const std::string& folder);
    void visitPlugIn(const BundleFolder& folder, const TDApplicationProxyRef& application);
    void refuse(const BundleFolder& folder, BundleReader::Reading reading);
    void install(const BundleFolder& folder, PlugInEntry entry,
                 const TDApplicationProxyRef& application);
    TDApplicationProxyRef applicationAt(const std::string& path);
    TDApplicationProxyRef applicationOf(const std::string& plugInPath);
    bool isForgotten(const BundleFolder& folder);
    bool isRefused(const BundleFolder& folder);
    bool isAllMet(const std::string& scope);
    bool isUnreachable(const std::string& path) const;
    RegistryChanges finish(const std::string& scope);

    RegistryState& state_;
    BundleReader& reader_;
    DataContainers& containers_;
    std::vector<std::string> folders_;
    // Of the walk under way:
    Pass pass_ = 0;
    RegistryChanges changes_;
    std::size_t metPlugIns_ = 0;            // good ones that were looked at
    bool isIncomplete_ = false;             // something failed that says nothing about the disk
    std::vector<std::string> unreachable_;  // paths that could not be looked into
};

}  // namespace platform::tandry
