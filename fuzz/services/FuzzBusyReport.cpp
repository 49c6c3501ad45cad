// What a busy plug-in says of itself, which is all that it can write outside of its container.
// Covers: platform/services/Assertions.cpp

#include "fuzz/Support.h"
#include "platform/services/Assertions.h"

using namespace platform;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const Directories directories = fuzz::directories();
    static const auto assertions = makeFileAssertions(directories);
    static const auto busy = BusyAssertion::take(directories, "com.fuzz");
    fuzz::require(bool(busy));
    static const std::string file = [] {
        for (const auto& entry : std::filesystem::recursive_directory_iterator(
                 BusyFolder::ofBundle(directories, "com.fuzz")))
            if (entry.path().filename() == BusyFolder::kFile) return entry.path().string();
        return std::string();
    }();
    fuzz::home().write(file.substr(fuzz::home().path().size() + 1), fuzz::text(data, size));
    fuzz::require(assertions->busyInstancesForBundleIdentifiers({"com.fuzz"}, "/P").size() == 1);
    return 0;
}
