#include "fuzz/Support.h"

#include <algorithm>
#include <cstdlib>

#include "platform/log/Log.h"
#include "platform/plist/PropertyList.h"
#include "platform/values/Cbor.h"

namespace fuzz {

namespace {

/// Before the log looks at it.
[[gnu::constructor]] void quieten() {
    ::setenv("ZR_LOG", "off", 1);
}

const platform::LogCapture dropped([](const auto&, auto, const auto&) {});

}  // namespace

void require(bool condition) {
    if (!condition) std::abort();
}

std::string_view text(const std::uint8_t* data, std::size_t size) {
    return {reinterpret_cast<const char*>(data), size};
}

std::vector<std::string_view> parts(std::string_view input, std::size_t count) {
    constexpr std::string_view kCut = "\n====\n";
    std::vector<std::string_view> found;
    while (found.size() < count) {
        const std::size_t end = std::min(input.find(kCut), input.size());
        found.push_back(input.substr(0, end));
        input.remove_prefix(std::min(end + kCut.size(), input.size()));
    }
    return found;
}

platform::Dictionary dictionaryIn(std::string_view bytes) {
    auto value = platform::parsePropertyList(bytes);
    if (!value) value = platform::decodeCbor(std::make_shared<const std::string>(bytes));
    return value && value->dictionary() ? *value->dictionary() : platform::Dictionary();
}

const test::TemporaryDirectory& home() {
    static const test::TemporaryDirectory home;
    return home;
}

platform::Directories directories() {
    return {.runtime = home().makeDirectory("run"),
            .dataHome = home().path("data"),
            .dataDirs = {home().path("system")},
            .configHome = home().path("config"),
            .stateHome = home().path("state")};
}

}  // namespace fuzz
