// A plug-in as its author would write it: turns what its host sends into upper case, a line at a
// time, and is busy from the first line on.

#include <unistd.h>

#include <cctype>
#include <optional>

#include "Zorvan/ZRPlugInHost.h"

int main() {
    const auto host = zorvan::ZRPlugInHost::take();
    if (!host || host->bundleIdentifier() != "com.test.upper") return 2;
    std::optional<platform::BusyAssertion> busy;
    for (char byte; ::read(host->connection(), &byte, 1) == 1;) {
        if (!busy) {
            auto taken = host->beginBusy();
            if (!taken) return 3;
            busy = std::move(*taken);
        }
        byte = static_cast<char>(std::toupper(static_cast<unsigned char>(byte)));
        if (::write(host->connection(), &byte, 1) != 1) return 4;
    }
    return 5;
}
