#include "platform/Preferences.h"

#include <algorithm>

#include "platform/Directories.h"
#include "platform/FileStamp.h"
#include "platform/Log.h"
#include "platform/PropertyList.h"

namespace platform {

namespace {

const Log& ops() {
    static const Log& handle = Log::make("com.orbel.Zorvan", "ops");
    return handle;
}

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

Dictionary readValues(const std::string& path) {
    const Result<Value> value = readPropertyListFile(path);
    if (!value) {
        EVLOG_ERROR(ops(), "cannot read preferences: {}", pub(value.error()));
        return {};
    }
    const Dictionary* dictionary = value->dictionary();
    if (!dictionary) {
        EVLOG_ERROR(ops(), "preference file {} is not a dictionary", pub(path));
        return {};
    }
    return *dictionary;
}

}  // namespace

Preferences::Preferences(const Directories& directories)
    : folder_(directories.configHome + "/zorvan/ByHost"), host_(machineId()) {}

std::string Preferences::path(const std::string& domain) const {
    return joinPath(folder_, domain + "." + host_ + ".plist");
}

void Preferences::synchronize(const std::string& domain) {
    Domain& known = domains_[domain];
    const std::string file = path(domain);
    // The stamp is older than what is read, so a change in between is seen the next time.
    std::string stamp = fileStamp(file);
    if (stamp == known.stamp) return;
    known.values = stamp.empty() ? Dictionary() : readValues(file);
    known.stamp = std::move(stamp);
}

std::optional<Value> Preferences::value(const std::string& domain, const std::string& key) const {
    const auto known = domains_.find(domain);
    const Value* value = known != domains_.end() ? known->second.values.find(key) : nullptr;
    return value ? std::optional(*value) : std::nullopt;
}

}  // namespace platform
