// The consent records of an application, of which "-" stands for none, and the Info.plist by which
// they are found. Nothing counts that was recorded of an application elsewhere.
// Covers: platform/services/Consent.cpp platform/lum/LumBundle.cpp

#include "fuzz/Support.h"
#include "platform/services/Consent.h"
#include "platform/system/Files.h"

using namespace platform;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const Directories directories = fuzz::directories();
    static const auto consent = makeFileConsent(directories);
    static const std::string application = fuzz::home().makeDirectory("A.app");
    static const std::string plain =
        "<plist><dict><key>QFBundleIdentifier</key><string>a</string></dict></plist>";

    const auto parts = fuzz::parts(fuzz::text(data, size), 2);
    // "@" in the records is the application's path.
    std::string records(parts[0]);
    if (const std::size_t at = records.find('@'); at != records.npos)
        records.replace(at, 1, application);
    const std::string file = fuzz::home().write("config/zorvan/Consent/a.plist", records);
    if (records == "-") std::filesystem::remove(file);
    fuzz::home().write("A.app/Info.plist", parts[1].empty() ? plain : parts[1]);
    const auto bundle = LumBundle::make(application, LumBundle::BundleDirectory);
    fuzz::require(bool(bundle));
    const auto executable = bundle->property(LumBundle::ExecutablePath);
    if (executable) {
        // The bundle is found from its executable as well.
        const auto same = LumBundle::make(*executable, LumBundle::Executable);
        fuzz::require(same && same->property(LumBundle::BundlePath) == application);
        same->discardCache();
        fuzz::require(same->property(LumBundle::ExecutablePath) == executable);
    }
    (void)describe(*bundle);
    if (const auto found = consent->copyConsentInformation(*bundle))
        for (const Dictionary& record : *found)
            fuzz::require(canonicalPath(record.find(kConsentPath)->string()->string()) ==
                          application);
    return 0;
}
