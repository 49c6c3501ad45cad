#pragma once

namespace platform {

/// Whether something open (borrowed) lies on a file system of the kernel's own, on disks or in
/// memory. Who looks at it, and beneath it with `openBeneath`, waits for no server and no program.
/// Asks no file system itself. From any thread.
bool isOnOwnMount(int fd);

}  // namespace platform
