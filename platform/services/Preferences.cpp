#include "platform/services/Preferences.h"

#include <fcntl.h>
#include <sys/file.h>

#include <cerrno>

#include "platform/plist/PropertyList.h"
#include "platform/system/Directories.h"
#include "platform/system/FileStamp.h"
#include "platform/system/Files.h"
#include "platform/system/UniqueFd.h"

namespace platform {

namespace {

/// The name of this host in the names of its preference files.
std::string machineId() {
    constexpr std::size_t kDigits = 32;
    const Result<std::string> text = readFile("/etc/machine-id", 4096);
    if (!text) return "local";
    const std::string id = text->substr(0, text->find('\n'));
    const bool usable =
        id.size() == kDigits && id.find_first_not_of("0123456789abcdefABCDEF") == std::string::npos;
    return usable ? id : "local";
}

}  // namespace

Preferences::Preferences(const Directories& directories)
    : folder_(directories.configHome + "/zorvan/ByHost"), host_(machineId()) {}

std::string Preferences::path(const std::string& domain) const {
    return joinPath(folder_, domain + "." + host_ + ".plist");
}

void Preferences::synchronize(const std::string& domain) {
    const auto [known, isNew] = domains_.try_emplace(domain, path(domain), "preferences");
    DictionaryFile& file = known->second;
    if (isNew) removeLeftovers(file.path());
    // What was known stays in force while the file cannot be read.
    static_cast<void>(file.update(FileStamp::of(file.path())));
}

std::optional<Value> Preferences::value(const std::string& domain, const std::string& key) const {
    const auto known = domains_.find(domain);
    if (known == domains_.end() || !known->second.dictionary()) return std::nullopt;
    const Value* value = known->second.dictionary()->find(key);
    return value ? std::optional(*value) : std::nullopt;
}

Result<Dictionary> Preferences::read(const std::string& domain) const {
    Result<Dictionary> dictionary = readDictionaryFile(path(domain));
    if (!dictionary && isMissingFile(dictionary.error())) return Dictionary();
    return dictionary;
}

std::optional<Error> Preferences::edit(const std::string& domain,
                                       const std::function<bool(Dictionary&)>& change) const {
    if (auto error = makeDirectories(folder_, 0700)) return error;
    // The file itself is replaced, so a lock on it would not last: the folder's stands for it.
    const UniqueFd folder(::open(folder_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!folder || ::flock(folder.get(), LOCK_EX) != 0) return Error::posix(errno, folder_);
    Result<Dictionary> dictionary = read(domain);
    if (!dictionary) return dictionary.error();
    if (!change(*dictionary)) return std::nullopt;
    const Result<std::string> text = writeXmlPropertyList(*dictionary);
    if (!text) return text.error();
    return writeFileAtomically(path(domain), *text);
}

}  // namespace platform
