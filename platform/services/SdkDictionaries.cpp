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
    const std::vector<std::string> candidates = candidateFiles(name);
    const std::lock_guard lock(mutex_);
    for (const std::string& path : candidates) {
        const FileStamp stamp = FileStamp::of(path);
        if (stamp.isMissing()) continue;
        DictionaryFile& file = entries_.try_emplace(name, path, "SDK dictionary").first->second;
        if (file.path() != path) file = DictionaryFile(path, "SDK dictionary");
        const std::optional<Error> error = file.update(stamp);
        if (!error) return file.dictionary();
        if (isTransient(*error)) return *error;
        return std::optional<Dictionary>();
    }
    // Names without a file are not kept: there is no end of them.
    entries_.erase(name);
    return std::optional<Dictionary>();
}

void SdkDictionaries::clear() {
    const std::lock_guard lock(mutex_);
    entries_.clear();
}

}  // namespace platform
