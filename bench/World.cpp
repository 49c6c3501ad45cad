#include "bench/World.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <system_error>

#include "Zorvan/Keys.h"
#include "bench/Failure.h"
#include "bench/InfoPlist.h"

namespace bench {

namespace fs = std::filesystem;

namespace {

constexpr std::size_t kPlugInsPerApplication = 10;
constexpr std::string_view kOtherPoint = "org.example.other-point-";
/// The registry keeps 128 MiB of dictionaries, and so no hundred thousand plug-ins of full size.
constexpr std::size_t kMostOfFullSize = 50'000;

}  // namespace

TemporaryDirectory::TemporaryDirectory() {
    const char* parent = std::getenv("TMPDIR");
    path_ = std::string(parent && *parent ? parent : "/tmp") + "/zrd-bench-XXXXXX";
    if (!::mkdtemp(path_.data())) failErrno(path_);
}

TemporaryDirectory::~TemporaryDirectory() {
    std::error_code ignored;
    fs::remove_all(path_, ignored);
}

std::string World::pointOf(std::size_t matches) {
    return fmt::format("org.example.point-of-{}", matches);
}

World::World(const std::string& parent, std::size_t plugIns)
    : root_(fmt::format("{}/{}", parent, plugIns)), plugIns_(plugIns) {
    for (const char* name : {"run", "config", "state", "home", "share"}) {
        fs::create_directories(root_ + "/" + name);
    }
    fs::permissions(root_ + "/run", fs::perms::owner_all);
    // The types that a real start reads.
    if (fs::exists("/usr/share/mime")) {
        fs::create_directory_symlink("/usr/share/mime", root_ + "/share/mime");
    }
    fs::create_directories(applications());
    for (std::size_t i = 0; i * kPlugInsPerApplication < plugIns; ++i) makeApplication(i);
    forget(false);
}

std::string World::socketPath() const {
    return runtimeDirectory() + "/zorvan/services/" + zorvan::kDefaultServiceName;
}

Child World::startDaemon(const std::vector<std::string>& more) const {
    std::vector<std::string> environment{
        "PATH=/usr/bin:/bin",
        "LANG=C.UTF-8",
        "HOME=" + root_ + "/home",
        "XDG_RUNTIME_DIR=" + runtimeDirectory(),
        "XDG_DATA_HOME=" + root_ + "/data",
        "XDG_DATA_DIRS=" + root_ + "/share",
        "XDG_CONFIG_HOME=" + root_ + "/config",
        "XDG_STATE_HOME=" + root_ + "/state",
    };
    environment.insert(environment.end(), more.begin(), more.end());
    return Child(ZRD_PROGRAM, {}, environment, root_ + "/zrd.log");
}

void World::forget(bool keepContainers) const {
    std::vector<fs::path> made;
    for (const auto& entry : fs::directory_iterator(root_ + "/data/zorvan")) {
        const fs::path name = entry.path().filename();
        if (name == "Applications" || (keepContainers && name == "Containers")) continue;
        made.push_back(entry.path());
    }
    for (const char* name : {"/state", "/run"}) {
        for (const auto& entry : fs::directory_iterator(root_ + name)) made.push_back(entry.path());
    }
    for (const fs::path& path : made) fs::remove_all(path);

    platform::UniqueFd directory(::open(root_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!directory || ::syncfs(directory.get()) < 0) failErrno(root_);
}

std::string World::logTail() const {
    constexpr std::size_t kTail = 2000;
    std::ifstream file(root_ + "/zrd.log");
    std::string text{std::istreambuf_iterator<char>(file), {}};
    if (text.size() > kTail) text.erase(0, text.size() - kTail);
    return text;
}

std::string World::sanitizerReport() const {
    constexpr std::size_t kMostReport = 8000;
    std::ifstream file(root_ + "/zrd.log");
    std::string report;
    for (std::string line; report.size() < kMostReport && std::getline(file, line);) {
        const bool begins = line.find("WARNING: ThreadSanitizer") != std::string::npos ||
                            line.find("ERROR: AddressSanitizer") != std::string::npos ||
                            line.find(": runtime error: ") != std::string::npos;
        if (begins || !report.empty()) report += line + "\n";
    }
    return report;
}

void World::makeApplication(std::size_t number) {
    const std::string path = fmt::format("{}/Application{:04}.app", applications(), number);
    fs::create_directories(path + "/PlugIns");
    writeFile(path + "/Info.plist", applicationInfo(number), true);
    for (std::size_t i = 0; i < kPlugInsPerApplication; ++i) {
        makePlugIn(path, number * kPlugInsPerApplication + i);
    }
}

void World::makePlugIn(const std::string& application, std::size_t number) {
    const std::string path = fmt::format("{}/PlugIns/PlugIn{:05}.appex", application, number);
    fs::create_directory(path);
    const bool isRare = isOneOf(10, 4, number);
    const auto attribute = [](const char* key, const auto& value) {
        return fmt::format("<key>{}</key><string>{}</string>", key, value);
    };
    const std::string attributes =
        attribute(kNumberAttribute, number) + (isRare ? attribute(kRareAttribute, kRareValue) : "");
    const std::string point = pointOfPlugIn(number);
    const bool isLean = plugIns_ > kMostOfFullSize && point.starts_with(kOtherPoint);
    writeFile(path + "/Info.plist", plugInInfo(number, point, attributes, isLean), true);
    if (number % 50 == 0) writeFile(path + "/Entitlements.plist", plugInEntitlements(number), true);
    const std::string executable = fmt::format("{}/PlugIn{:05}", path, number);
    // Says something as soon as it runs: to its host, or wherever else it may.
    writeFile(executable, "#!/bin/sh\nprintf x >&\"${ZORVAN_PLUGIN_FD:-1}\"\n", false);
    ::chmod(executable.c_str(), 0755);
}

/// Different offsets below ten never meet: every stride is a multiple of ten.
bool World::isOneOf(std::size_t matches, std::size_t offset, std::size_t number) const {
    if (plugIns_ < 10 * matches) return false;
    return number % (plugIns_ / matches) == offset;
}

std::string World::pointOfPlugIn(std::size_t number) const {
    std::size_t offset = 1;
    for (std::size_t matches : {1000, 100, 10}) {
        if (isOneOf(matches, offset++, number)) return pointOf(matches);
    }
    return fmt::format("{}{}", kOtherPoint, number % 23);
}

void World::writeFile(const std::string& path, const std::string& text, bool isRead) {
    std::ofstream file(path, std::ios::binary);
    file << text;
    if (!file.flush()) fail("{} cannot be written", path);
    if (isRead) files_.push_back(path);
}

}  // namespace bench
