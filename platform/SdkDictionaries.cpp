#include "platform/SdkDictionaries.h"

#include "platform/Directories.h"
#include "platform/FileStamp.h"
#include "platform/Files.h"
#include "platform/Log.h"
#include "platform/PropertyList.h"

namespace platform {

namespace {

const Log& ops() {
    static const Log& handle = Log::make("com.orbel.Zorvan", "ops");
    return handle;
}

std::optional<Dictionary> readDictionary(const std::string& path) {
    const Result<Value> value = readPropertyListFile(path);
    if (!value) {
        EVLOG_ERROR(ops(), "cannot read SDK dictionary: {}", pub(value.error()));
        return std::nullopt;
    }
    const Dictionary* dictionary = value->dictionary();
    if (!dictionary) {
        EVLOG_ERROR(ops(), "SDK dictionary {} is not a dictionary", pub(path));
        return std::nullopt;
    }
    return *dictionary;
}

}  // namespace

struct SdkDictionaries::Entry {
    std::string path;
    std::string stamp;
    std::optional<Dictionary> dictionary;  // none when the file is no dictionary
};

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

std::optional<Dictionary> SdkDictionaries::copyExtensionSdkEntry(const std::string& name) {
    const std::vector<std::string> candidates = candidateFiles(name);
    const std::lock_guard lock(mutex_);
    for (const std::string& path : candidates) {
        // The stamp is older than what is read, so a change in between is seen the next time.
        std::string stamp = fileStamp(path);
        if (stamp.empty()) continue;
        std::shared_ptr<const Entry>& entry = entries_[name];
        if (!entry || entry->path != path || entry->stamp != stamp)
            entry =
                std::make_shared<const Entry>(Entry{path, std::move(stamp), readDictionary(path)});
        return entry->dictionary;
    }
    // Names without a file are not kept: there is no end of them.
    entries_.erase(name);
    return std::nullopt;
}

void SdkDictionaries::clear() {
    const std::lock_guard lock(mutex_);
    entries_.clear();
}

}  // namespace platform
