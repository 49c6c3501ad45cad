#include "Zorvan/ZRPlugInHost.h"

#include <fcntl.h>

#include <charconv>
#include <cstdlib>

#include "platform/spawnerd/Protocol.h"
#include "platform/system/Directories.h"

namespace zorvan {

namespace spawnerd = platform::spawnerd;

namespace {

std::string takeVariable(const char* name) {
    const char* value = std::getenv(name);
    std::string text = value ? value : "";
    ::unsetenv(name);
    return text;
}

}  // namespace

std::unique_ptr<ZRPlugInHost> ZRPlugInHost::take() {
    const std::string number = takeVariable(spawnerd::kConnectionVariable);
    std::string identifier = takeVariable(spawnerd::kIdentifierVariable);
    std::string service = takeVariable(spawnerd::kServiceVariable);
    int fd = -1;
    const char* end = number.data() + number.size();
    if (std::from_chars(number.data(), end, fd).ptr != end || fd < 0 || number.empty() ||
        ::fcntl(fd, F_SETFD, FD_CLOEXEC) != 0)
        return nullptr;
    return std::unique_ptr<ZRPlugInHost>(
        new ZRPlugInHost(platform::UniqueFd(fd), std::move(identifier), std::move(service)));
}

platform::Result<platform::BusyAssertion> ZRPlugInHost::beginBusy() const {
    return platform::BusyAssertion::take(platform::Directories::fromEnvironment(),
                                         bundleIdentifier_);
}

}  // namespace zorvan
