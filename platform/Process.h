#pragma once

namespace platform {

/// What a daemon settles about its own process before it does anything else: files are its user's
/// alone (umask 077), writing to a closed pipe or beyond a size limit is an error and no signal,
/// and as many descriptors may be open as the system lets it have.
void prepareDaemonProcess();

/// Tells the service manager, when there is one, that the daemon serves.
void notifyServiceManagerReady();

}  // namespace platform
