// A bundle's Info.plist, Entitlements.plist and Localized.plist, with the dictionary of its
// extension point, and the same directory as an application. What is not refused has a form that
// any host reads.
// Covers: platform/tandry/BundleReader.cpp platform/tandry/LocalizedNames.cpp
// Covers: platform/services/SdkDictionaries.cpp Zorvan/ZRPlugInSDK.cpp Zorvan/ZRPlugInForm.cpp
// Covers: zrd/ZRDPlugIn.cpp

#include "fuzz/Support.h"
#include "platform/services/SdkDictionaries.h"
#include "platform/system/Files.h"
#include "platform/tandry/BundleReader.h"
#include "platform/values/Cbor.h"
#include "tests/zrd/Fakes.h"

using namespace platform;
using namespace platform::tandry;

namespace {

void exportIt(const PlugInEntry& entry, const TDApplicationProxyRef& application) {
    static const zorvan::FakeWorld world;
    entry.record->containingApplication = application;
    entry.record->dataContainerPath = "/c";
    fuzz::require(isSafeName(*entry.record->plugInIdentifier));
    fuzz::require(isSafeName(entry.record->bundleIdentifier));
    const auto plugIn = world.record(entry.record);
    if (!plugIn || plugIn->diagnose()) return;
    std::optional<zorvan::ZRError> error;
    auto draft = plugIn->draftForm({}, error);
    if (!draft) return;
    const auto form = plugIn->completedForm(*draft, Wait::Allowed);
    fuzz::require(isPropertyList(Value(*form)));
    std::string bytes;
    encodeCbor(*form, bytes);
    fuzz::require(bool(decodeCbor(std::make_shared<const std::string>(bytes))));
    fuzz::require(bool(zorvan::ZRPlugInCore::initWithForm(*form)));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const Directories directories = fuzz::directories();
    static const std::string bundle = fuzz::home().makeDirectory("A.appex");
    const auto parts = fuzz::parts(fuzz::text(data, size), 4);
    constexpr const char* kFiles[] = {"A.appex/Info.plist", "A.appex/Entitlements.plist",
                                      "A.appex/Localized.plist", "data/zorvan/SDKs/point.plist"};
    for (std::size_t i = 0; i < parts.size(); ++i) {
        if (parts[i].empty())
            std::filesystem::remove(fuzz::home().path(kFiles[i]));
        else
            fuzz::home().write(kFiles[i], parts[i]);
    }

    SdkDictionaries sdks(directories);
    BundleReader reader(sdks, &zorvan::ZRPlugInCore::mergeDictionary, {"de", "fr"});
    reader.beginPass();
    const BundleFolder folder(bundle);
    const auto application = reader.readApplication(folder);
    const auto reading = reader.readPlugIn(folder);
    (void)reader.isUnchanged(folder, reading.entry.print);
    if (reading.refusal) return 0;
    fuzz::require(reading.entry.dictionaries->size() <= kMaxRecordSize);
    exportIt(reading.entry, application.record);
    return 0;
}
