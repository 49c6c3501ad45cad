#pragma once

#include <optional>
#include <string>
#include <utility>

#include "platform/system/Error.h"
#include "platform/system/FileStamp.h"
#include "platform/values/Value.h"

namespace platform {

/// Reads a property-list file whose root is a dictionary. Errors: those of `readPropertyListFile`;
/// the domain "PropertyList" when the root is something else. The text names the file.
Result<Dictionary> readDictionaryFile(const std::string& path);

/// The dictionary in a property-list file, read again whenever the file has changed. Use from one
/// thread at a time.
class DictionaryFile {
  public:
    /// `kind` says in log lines what the file is: "preferences".
    DictionaryFile(std::string path, std::string kind);

    const std::string& path() const { return path_; }

    /// Reads the file unless it was read when it had this stamp; `stamp` is the one that the file
    /// has now. None when the file was read or there is none. Errors: the system's, when there is a
    /// file that cannot be read; then what was read before stays, and the next call tries again.
    /// Each fault gives one error line until it or the file changes.
    std::optional<Error> update(const FileStamp& stamp);
    /// As of the last successful `update`; none when there was no file, or it was no dictionary.
    const std::optional<Dictionary>& dictionary() const { return dictionary_; }

  private:
    void report(const FileStamp& stamp, const Error& fault);

    std::string path_;
    std::string kind_;
    std::optional<FileStamp> stamp_;  // of `dictionary_`; none when it has to be read again
    std::optional<Dictionary> dictionary_;
    std::optional<std::pair<FileStamp, std::string>> reported_;  // by the last error line
};

}  // namespace platform
