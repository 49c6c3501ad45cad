#include "platform/services/Types.h"

#include <algorithm>
#include <cerrno>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string_view>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "platform/log/OpsLog.h"
#include "platform/system/Directories.h"
#include "platform/system/Files.h"

namespace platform {

namespace {

/// The real files hold some tens of kilobytes.
constexpr std::size_t kMaxMimeFile = 4u << 20;

constexpr const char* kAnyText = "text/plain";
constexpr const char* kAnyContent = "application/octet-stream";

std::string lowerCase(std::string_view text) {
    std::string result(text);
    for (char& c : result)
        if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
    return result;
}

/// Calls `use` with the two types of every line of a file of the database. A missing file has none.
/// Answers the error of a file that cannot be read.
std::optional<Error> forEachPair(
    const std::string& path,
    const std::function<void(std::string first, std::string second)>& use) {
    const Result<std::string> text = readFile(path, kMaxMimeFile);
    if (!text) {
        if (text.error().code == ENOENT || text.error().code == ENOTDIR) return std::nullopt;
        return text.error();
    }
    std::string_view rest = *text;
    while (!rest.empty()) {
        const std::string_view line = rest.substr(0, rest.find('\n'));
        rest.remove_prefix(std::min(line.size() + 1, rest.size()));
        const std::size_t space = line.find(' ');
        if (space == 0 || space == line.npos || space + 1 == line.size()) continue;
        use(lowerCase(line.substr(0, space)), lowerCase(line.substr(space + 1)));
    }
    return std::nullopt;
}

/// What the files of the database say. Does not change once it is made.
struct Hierarchy {
    std::unordered_map<std::string, std::string> aliases;
    std::unordered_map<std::string, std::vector<std::string>> parents;

    const std::string& canonical(const std::string& type) const {
        const auto alias = aliases.find(type);
        return alias != aliases.end() ? alias->second : type;
    }

    /// A type and what a walk from it towards the ancestors meets. Files may hold cycles, so each
    /// type is walked once.
    std::vector<std::string> ancestry(const std::string& start) const {
        std::vector<std::string> met{start};
        std::unordered_set<std::string> seen{start};
        const auto meet = [&](const std::string& type) {
            if (seen.insert(type).second) met.push_back(type);
        };
        for (std::size_t i = 0; i < met.size(); ++i) {
            if (met[i].starts_with("text/")) meet(kAnyText);
            const auto found = parents.find(met[i]);
            if (found == parents.end()) continue;
            for (const std::string& parent : found->second) meet(canonical(parent));
        }
        return met;
    }
};

class MimeTypes : public Types {
  public:
    explicit MimeTypes(const Directories& directories) {
        folders_.push_back(directories.dataHome + "/mime");
        for (const std::string& folder : directories.dataDirs) folders_.push_back(folder + "/mime");
    }

    std::string name(const std::string& type) override {
        return hierarchy()->canonical(lowerCase(type));
    }

    std::vector<std::string> lineage(const std::string& type) override {
        const std::shared_ptr<const Hierarchy> known = hierarchy();
        const std::string start = known->canonical(lowerCase(type));
        std::vector<std::string> names = known->ancestry(start);
        if (start == kAnyContent) return names;
        std::erase(names, kAnyContent);
        if (!start.starts_with("inode/")) names.emplace_back(kAnyContent);
        return names;
    }

  private:
    /// What was read; read again as long as a file could not be, for a reason that may pass.
    std::shared_ptr<const Hierarchy> hierarchy() {
        const std::lock_guard lock(mutex_);
        if (!isComplete_) read();
        return hierarchy_;
    }

    void read() {
        auto fresh = std::make_shared<Hierarchy>();
        isComplete_ = true;
        for (const std::string& folder : folders_) {
            noteFault(
                forEachPair(folder + "/aliases", [&fresh](std::string alias, std::string type) {
                    fresh->aliases.emplace(std::move(alias), std::move(type));
                }));
            noteFault(
                forEachPair(folder + "/subclasses", [&fresh](std::string type, std::string parent) {
                    fresh->parents[std::move(type)].push_back(std::move(parent));
                }));
        }
        hierarchy_ = std::move(fresh);
    }

    void noteFault(const std::optional<Error>& fault) {
        if (!fault) return;
        if (isTransient(*fault)) isComplete_ = false;
        if (reported_.insert(fault->text).second)
            EVLOG_ERROR(ops(), "cannot read MIME types: {}", pub(*fault));
    }

    std::vector<std::string> folders_;
    std::mutex mutex_;  // guards what follows
    std::shared_ptr<const Hierarchy> hierarchy_;
    bool isComplete_ = false;
    std::unordered_set<std::string> reported_;  // faults that have had their error line
};

}  // namespace

bool Types::conforms(const std::string& type, const std::string& ancestor) {
    const auto names = lineage(type);
    return std::ranges::find(names, name(ancestor)) != names.end();
}

std::unique_ptr<Types> makeMimeTypes(const Directories& directories) {
    return std::make_unique<MimeTypes>(directories);
}

}  // namespace platform
