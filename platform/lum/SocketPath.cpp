#include <sys/un.h>

#include <cerrno>

#include "platform/lum/Listener.h"
#include "platform/system/Directories.h"
#include "platform/system/Files.h"

namespace platform::lum {

Result<std::string> socketPath(const Directories& directories, const std::string& serviceName) {
    if (!isSafeName(serviceName))
        return Error::posix(EINVAL, "service name \"" + serviceName + "\"");
    std::string path = joinPath(directories.zorvanRuntime() + "/services", serviceName);
    if (path.size() >= sizeof(sockaddr_un::sun_path)) return Error::posix(ENAMETOOLONG, path);
    return path;
}

}  // namespace platform::lum
