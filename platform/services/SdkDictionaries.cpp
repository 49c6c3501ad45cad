#include "platform/services/SdkDictionaries.h"

#include "platform/system/Directories.h"
#include "platform/system/FileStamp.h"
#include "platform/system/Files.h"

namespace platform {

SdkDictionaries::SdkDictionaries(const Directories& directories) {
    folders_.push_back(directories.zorvanData() + "/SDKs");
    for (const std::string& folder : directories.dataDirs)
        folders_.push_back(folder + "/zorvan/SDKs");
}

std::vector<std::string> SdkDictionaries::candidateFiles(const std::string& name) const {
    std::vector<std::string> result;
    const std::string file = name + ".plist";
    if (!isSafeName(file)) return result;
    for (const std::string& folder : folders_) result.push_back(joinPath(folder, file));
    return result;
}

Result<std::optional<Dictionary>> SdkDictionaries::copyExtensionSdkEntry(const std::string& name) {
    for (const std::string& path : candidateFiles(name)) {
        const FileStamp stamp = FileStamp::of(path);
        if (stamp.isMissing()) continue;
        DictionaryFile file = known(name, path);
        const std::optional<Error> error = file.update(stamp);
        const std::optional<Dictionary> dictionary = file.dictionary();
        const std::lock_guard lock(mutex_);
        entries_.insert_or_assign(name, std::move(file));
        if (!error) return dictionary;
        if (isTransient(*error)) return *error;
        return std::optional<Dictionary>();
    }
    // Names without a file are not kept: there is no end of them.
    const std::lock_guard lock(mutex_);
    entries_.erase(name);
    return std::optional<Dictionary>();
}

/// What is known of a file. It is read without the lock, for which others would wait.
DictionaryFile SdkDictionaries::known(const std::string& name, const std::string& path) {
    const std::lock_guard lock(mutex_);
    const auto found = entries_.find(name);
    const bool isKnown = found != entries_.end() && found->second.path() == path;
    return isKnown ? found->second : DictionaryFile(path, "SDK dictionary");
}

void SdkDictionaries::clear() {
    const std::lock_guard lock(mutex_);
    entries_.clear();
}

}  // namespace platform
