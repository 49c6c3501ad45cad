// A plug-in: text in, the same text with a capital at the beginning of each word out.

#include <sys/socket.h>
#include <unistd.h>

#include <cctype>
#include <cstdio>
#include <optional>

#include "Zorvan/ZRPlugInHost.h"

int main() {
    const auto host = zorvan::ZRPlugInHost::take();
    if (!host) {
        std::fputs("title-case: a plug-in, for hosts to start\n", stderr);
        return 2;
    }
    // From the first text on this must not be disturbed.
    std::optional<platform::BusyAssertion> busy;
    bool isInWord = false;
    char buffer[4096];
    for (ssize_t count; (count = ::read(host->connection(), buffer, sizeof buffer)) > 0;) {
        if (!busy) {
            auto assertion = host->beginBusy();
            if (!assertion) return 1;
            busy = std::move(*assertion);
        }
        for (char* byte = buffer; byte < buffer + count; ++byte) {
            const auto letter = static_cast<unsigned char>(*byte);
            if (!isInWord) *byte = static_cast<char>(std::toupper(letter));
            isInWord = std::isalnum(letter) || letter == '\'' || letter >= 0x80;
        }
        for (ssize_t done = 0, sent; done < count; done += sent) {
            sent = ::send(host->connection(), buffer + done, static_cast<std::size_t>(count - done),
                          MSG_NOSIGNAL);
            if (sent < 0) return 1;
        }
    }
    return 0;
}
