// A preference file that somebody wrote: what is read of it, and an edit of it.
// Covers: platform/services/Preferences.cpp platform/plist/DictionaryFile.cpp

#include "fuzz/Support.h"
#include "platform/plist/PropertyList.h"
#include "platform/services/Preferences.h"
#include "platform/system/Files.h"

using namespace platform;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const Directories directories = fuzz::directories();
    Preferences preferences(directories);
    static const std::string file = preferences.path("domain");
    fuzz::home().write(file.substr(fuzz::home().path().size() + 1), fuzz::text(data, size));
    preferences.synchronize("domain");
    const auto value = preferences.value("domain", "exclusions");
    const auto before = preferences.read("domain");
    fuzz::require(!value || (before && before->contains("exclusions")));
    const auto failed = preferences.edit("domain", [](Dictionary& all) {
        all.set("added", true);
        return true;
    });
    // Whatever can be stored is there with all that was; what is damaged stays as it is.
    const auto after = preferences.read("domain");
    fuzz::require(failed ? bool(after) == bool(before) : after && after->contains("added"));
    fuzz::require(failed || after->size() == before->size() + !before->contains("added"));
    return 0;
}
