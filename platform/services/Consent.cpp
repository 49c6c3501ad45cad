#include "platform/services/Consent.h"

#include <cerrno>

#include "platform/log/OpsLog.h"
#include "platform/plist/PropertyList.h"
#include "platform/system/Directories.h"
#include "platform/system/Files.h"

namespace platform {

namespace {

class FileConsent : public Consent {
  public:
    explicit FileConsent(const Directories& directories)
        : folder_(directories.configHome + "/zorvan/Consent") {}

    std::optional<std::vector<Dictionary>> copyConsentInformation(
        const LumBundle& application) override {
        const std::optional<Dictionary> info = application.infoDictionary();
        const Value* value = info ? info->find("QFBundleIdentifier") : nullptr;
        if (!value || !value->string()) return std::nullopt;
        const std::string file = value->string()->string() + ".plist";
        if (!isSafeName(file)) return std::nullopt;
        // Anybody may claim an identifier. Where it lies tells one application from another.
        const auto path = application.property(LumBundle::BundlePath);
        const auto place = path ? canonicalPath(*path) : std::nullopt;
        if (!place) return std::nullopt;
        return readRecords(joinPath(folder_, file), *place);
    }

  private:
    static bool isOf(const Dictionary& record, const std::string& place) {
        const Value* path = record.find(kConsentPath);
        const auto* text = path ? path->string() : nullptr;
        return text && text->view().starts_with('/') && canonicalPath(text->string()) == place;
    }

    static std::optional<std::vector<Dictionary>> readRecords(const std::string& path,
                                                              const std::string& place) {
        std::vector<Dictionary> records;
        const Result<Value> list = readPropertyListFile(path);
        if (!list) {
            const Error& error = list.error();
            if (error.domain == "POSIX" && (error.code == ENOENT || error.code == ENOTDIR))
                return records;
            EVLOG_ERROR(ops(), "cannot read consent records: {}", pub(error));
            return std::nullopt;
        }
        const Array* elements = list->array();
        if (!elements) {
            EVLOG_ERROR(ops(), "consent file {} is not a list", pub(path));
            return std::nullopt;
        }
        // What is not a record grants nothing.
        for (const Value& element : *elements)
            if (const Dictionary* record = element.dictionary(); record && isOf(*record, place))
                records.push_back(*record);
        return records;
    }

    const std::string folder_;
};

}  // namespace

std::unique_ptr<Consent> makeFileConsent(const Directories& directories) {
    return std::make_unique<FileConsent>(directories);
}

}  // namespace platform
