#pragma once

#include <sys/types.h>

namespace platform {

/// The number of a process's parent; 0 when that cannot be told.
pid_t parentOf(pid_t process);

/// Opens /dev/null in place of standard input, output and error where they are closed: otherwise
/// the first files opened would get their numbers, and what is written to a standard stream would
/// end in such a file. To be called before anything opens a file.
void openStandardDescriptors();

/// What a daemon settles about its own process before it does anything else: files are its user's
/// alone (umask 077), writing to a closed pipe or beyond a size limit is an error and no signal,
/// as many descriptors may be open as the system lets it have, and memory that was freed goes back
/// to the system but for a little.
void prepareDaemonProcess();

/// Tells the service manager, when there is one, that the daemon serves.
void notifyServiceManagerReady();

}  // namespace platform
