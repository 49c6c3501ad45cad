#include "platform/Preferences.h"

#include "platform/Directories.h"
#include "platform/FileStamp.h"
#include "platform/Files.h"

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
    const auto known = domains_.try_emplace(domain, path(domain), "preferences").first;
    DictionaryFile& file = known->second;
    // What was known stays in force while the file cannot be read.
    static_cast<void>(file.update(fileStamp(file.path())));
}

std::optional<Value> Preferences::value(const std::string& domain, const std::string& key) const {
    const auto known = domains_.find(domain);
    if (known == domains_.end() || !known->second.dictionary()) return std::nullopt;
    const Value* value = known->second.dictionary()->find(key);
    return value ? std::optional(*value) : std::nullopt;
}

}  // namespace platform
