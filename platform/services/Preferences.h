#pragma once

#include <functional>
#include <map>
#include <optional>
#include <string>

#include "platform/plist/DictionaryFile.h"
#include "platform/system/Error.h"
#include "platform/values/Value.h"

namespace platform {

struct Directories;

/// Preferences of the current user on the current host, by domain:
/// <config>/zorvan/ByHost/<domain>.<machine id>.plist, a dictionary of keys. Use from one thread at
/// a time.
class Preferences {
  public:
    explicit Preferences(const Directories& directories);

    /// Makes values that other processes have written since visible: re-reads the domain's file
    /// when its stamp has changed. While the file cannot be read the values stay as they were; a
    /// missing file, or one that is no dictionary, counts as empty. Each fault gives one error line
    /// until it or the file changes.
    void synchronize(const std::string& domain);
    /// The value of a key as of the last `synchronize`; none when it is absent.
    std::optional<Value> value(const std::string& domain, const std::string& key) const;

    /// What a domain's file holds now, read for somebody who must know when that is not possible:
    /// empty when there is no file. Errors: those of `readDictionaryFile`.
    Result<Dictionary> read(const std::string& domain) const;
    /// Changes the dictionary in a domain's file as it is now (empty without a file, which is made
    /// then), in one atomic step: `change` alters it, or answers false to leave all as it is. Two
    /// edits never run at once. A damaged file is an error, and stays as it is. Errors: those of
    /// `read`, and of writing.
    std::optional<Error> edit(const std::string& domain,
                              const std::function<bool(Dictionary&)>& change) const;

    /// The file of a domain.
    std::string path(const std::string& domain) const;

  private:
    std::string folder_;
    std::string host_;
    std::map<std::string, DictionaryFile> domains_;
};

}  // namespace platform
