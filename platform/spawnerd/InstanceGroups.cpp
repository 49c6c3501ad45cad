#include "platform/spawnerd/InstanceGroups.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <iterator>
#include <optional>
#include <sstream>
#include <string_view>

#include "platform/system/Files.h"
#include "platform/system/Process.h"

namespace platform::spawnerd {

namespace {

constexpr std::size_t kMostBytes = 64u << 10;
constexpr const char* kProcesses = "cgroup.procs";
constexpr const char* kDivision = "cgroup.subtree_control";
/// Two are bubblewrap's, one carries the network.
constexpr std::uint64_t kOwnProcesses = 3;
const std::string kInstance = "instance-";

bool writeTo(const UniqueFd& folder, const char* name, const std::string& text) {
    const UniqueFd file(::openat(folder.get(), name, O_WRONLY | O_TRUNC | O_CLOEXEC));
    return file &&
           ::write(file.get(), text.data(), text.size()) == static_cast<ssize_t>(text.size());
}

UniqueFd openFolder(const std::string& path) {
    return UniqueFd(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
}

bool holdsWord(const std::string& text, std::string_view wanted) {
    std::istringstream words(text);
    for (std::string word; words >> word;)
        if (word == wanted) return true;
    return false;
}

/// This process's place in the unified tree: the line without controllers.
std::optional<std::string> placeIn(const std::string& membership) {
    constexpr std::string_view kUnified = "0::";
    const Result<std::string> text = readFile(membership, kMostBytes);
    if (!text) return std::nullopt;
    std::istringstream lines(*text);
    for (std::string line; std::getline(lines, line);)
        if (line.starts_with(kUnified)) return line.substr(kUnified.size());
    return std::nullopt;
}

/// The numbers in a file of processes.
std::vector<pid_t> processesIn(const UniqueFd& folder) {
    const auto text = readFileAt(folder.get(), kProcesses, kMostBytes);
    std::istringstream numbers(text ? *text : std::string());
    return {std::istream_iterator<pid_t>(numbers), {}};
}

bool isOurs(pid_t process) {
    return process == ::getpid() || parentOf(process) == ::getpid();
}

bool isOursAlone(const UniqueFd& folder, const std::vector<pid_t>& there) {
    const auto controllers = readFileAt(folder.get(), "cgroup.controllers", kMostBytes);
    return controllers && holdsWord(*controllers, "memory") && holdsWord(*controllers, "pids") &&
           std::ranges::all_of(there, isOurs) &&
           ::faccessat(folder.get(), ".", W_OK, AT_EACCESS) == 0;
}

bool moveTo(const UniqueFd& folder, const std::vector<pid_t>& processes) {
    return std::ranges::all_of(processes, [&](pid_t process) {
        return writeTo(folder, kProcesses, std::to_string(process));
    });
}

bool divide(const std::string& path, const UniqueFd& folder, const std::vector<pid_t>& own) {
    const std::string place = joinPath(path, "daemon");
    if (::mkdir(place.c_str(), 0755) != 0 && errno != EEXIST) return false;
    if (moveTo(openFolder(place), own) && writeTo(folder, kDivision, "+memory +pids")) {
        writeTo(folder, kDivision, "+cpu");  // not everywhere delegated, and less needed
        return true;
    }
    moveTo(folder, own);
    ::rmdir(place.c_str());
    return false;
}

/// What still has processes stays.
void removeInstances(const std::string& path) {
    std::error_code ignored;
    for (const auto& entry : std::filesystem::directory_iterator(path, ignored))
        if (entry.path().filename().string().starts_with(kInstance)) ::rmdir(entry.path().c_str());
}

}  // namespace

InstanceGroup::~InstanceGroup() {
    // A process that has just ended may still count as one that is there.
    if (folder_ && ::rmdir(path_.c_str()) != 0 && errno == EBUSY) leftBehind_->push_back(path_);
}

bool InstanceGroup::add(pid_t process) const {
    return !folder_ || writeTo(folder_, kProcesses, std::to_string(process));
}

void InstanceGroup::kill() const {
    if (folder_) writeTo(folder_, "cgroup.kill", "1");
}

InstanceGroups InstanceGroups::find(const std::string& tree, const std::string& membership) {
    InstanceGroups groups;
    const auto place = placeIn(membership);
    if (!place) return groups;
    const std::string path = tree + *place;
    const UniqueFd folder = openFolder(path);
    const auto own = processesIn(folder);
    if (!folder || !isOursAlone(folder, own) || !divide(path, folder, own)) return groups;
    groups.path_ = path;
    removeInstances(path);
    return groups;
}

Result<InstanceGroup> InstanceGroups::make(std::uint64_t instance,
                                           const InstanceLimits& limits) const {
    InstanceGroup group;
    if (!areThere()) return group;
    std::erase_if(*leftBehind_, [](const std::string& path) { return ::rmdir(path.c_str()) == 0; });
    group.leftBehind_ = leftBehind_;
    group.path_ = joinPath(path_, kInstance + std::to_string(instance));
    // One that an earlier daemon has left will do.
    if (::mkdir(group.path_.c_str(), 0755) != 0 && errno != EEXIST)
        return Error::posix(errno, group.path_);
    group.folder_ = openFolder(group.path_);
    const bool isLimited =
        writeTo(group.folder_, "memory.max", std::to_string(limits.memory)) &&
        writeTo(group.folder_, "pids.max", std::to_string(limits.processes + kOwnProcesses));
    if (!isLimited) return Error::posix(errno, group.path_);
    // Not on all machines: swap, ending the whole instance when its memory is used up, processors.
    writeTo(group.folder_, "memory.swap.max", "0");
    writeTo(group.folder_, "memory.oom.group", "1");
    writeTo(group.folder_, "cpu.weight", std::to_string(limits.cpuWeight));
    return group;
}

}  // namespace platform::spawnerd
