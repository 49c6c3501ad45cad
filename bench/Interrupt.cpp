#include "bench/Interrupt.h"

#include <signal.h>
#include <unistd.h>

#include "bench/Failure.h"

namespace bench {

namespace {

volatile sig_atomic_t caughtSignal = 0;

}  // namespace

void catchInterrupts(unsigned seconds) {
    struct sigaction action {};
    action.sa_handler = [](int number) { caughtSignal = number; };
    for (int number : {SIGINT, SIGTERM, SIGALRM}) ::sigaction(number, &action, nullptr);
    ::alarm(seconds);
}

void checkInterrupted() {
    if (caughtSignal == SIGALRM) fail("the measurements take too long");
    if (caughtSignal) fail("interrupted");
}

}  // namespace bench
