#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/plist/DictionaryFile.h"
#include "platform/system/Error.h"
#include "platform/values/Value.h"

namespace platform {

struct Directories;

/// The SDK dictionaries registered for extension points: <data dir>/zorvan/SDKs/<name>.plist, the
/// user's directory first. Usable from any thread; what was read is kept until `clear`, or until
/// the file's stamp changes.
class SdkDictionaries {
  public:
    explicit SdkDictionaries(const Directories& directories);

    /// The dictionary registered for a name. None when there is none, the name could not be a
    /// file's name, or the file may not be read or is no dictionary (which is logged). Errors: the
    /// system's, also logged, when a file cannot be read just now, so that nobody knows.
    Result<std::optional<Dictionary>> copyExtensionSdkEntry(const std::string& name);
    /// The files that `copyExtensionSdkEntry` would look at for a name, first the one that counts
    /// when it exists; empty for a name that could not be a file's.
    std::vector<std::string> candidateFiles(const std::string& name) const;
    void clear();

  private:
    DictionaryFile known(const std::string& name, const std::string& path);

    std::vector<std::string> folders_;
    std::mutex mutex_;                               // guards entries_
    std::map<std::string, DictionaryFile> entries_;  // the file that counts, by name
};

}  // namespace platform
