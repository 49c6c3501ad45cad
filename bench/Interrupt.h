#pragma once

namespace bench {

/// From now on SIGINT, SIGTERM and the end of `seconds` do not end the process at once: they make
/// `checkInterrupted` throw, so that daemons and files are cleaned up first.
void catchInterrupts(unsigned seconds);

/// Throws a `Failure` once a signal came or the time is over.
void checkInterrupted();

}  // namespace bench
