#include "platform/plist/DictionaryFile.h"

#include <fmt/format.h>

#include "platform/log/OpsLog.h"
#include "platform/plist/PropertyList.h"

namespace platform {

Result<Dictionary> readDictionaryFile(const std::string& path) {
    const Result<Value> value = readPropertyListFile(path);
    if (!value) return value.error();
    if (const Dictionary* dictionary = value->dictionary()) return *dictionary;
    return Error{"PropertyList", 0, fmt::format("{}: not a dictionary", path)};
}

DictionaryFile::DictionaryFile(std::string path, std::string kind)
    : path_(std::move(path)), kind_(std::move(kind)) {}

std::optional<Error> DictionaryFile::update(const FileStamp& stamp) {
    if (stamp_ == stamp) return std::nullopt;
    std::optional<Dictionary> read;
    if (!stamp.isMissing()) {
        // The file may be gone since its stamp was taken.
        Result<Dictionary> dictionary = readDictionaryFile(path_);
        if (dictionary) {
            read = std::move(*dictionary);
            reported_.reset();
        } else if (const Error& error = dictionary.error(); !isMissingFile(error)) {
            report(stamp, error);
            if (error.domain == "POSIX") return error;
        }
    }
    dictionary_ = std::move(read);
    // The stamp is older than what was read, so a change in between is seen the next time.
    stamp_ = stamp.settled ? std::optional(stamp) : std::nullopt;
    return std::nullopt;
}

void DictionaryFile::report(const FileStamp& stamp, const Error& fault) {
    if (reported_ && reported_->first == stamp && reported_->second == fault.text) return;
    reported_ = {stamp, fault.text};
    EVLOG_ERROR(ops(), "cannot read {}: {}", pub(kind_), pub(fault));
}

}  // namespace platform
