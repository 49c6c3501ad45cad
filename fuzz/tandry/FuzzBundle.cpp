// A bundle's Info.plist, Entitlements.plist and Localized.plist, with the dictionary of its
// extension point, the user's languages, and the Info.plist that it has later; "->" stands before
// where a symbolic link leads. The same directory is an application as well. What is not refused
// has a form that any host reads, and can be made ready.
// Covers: platform/tandry/BundleReader.cpp platform/tandry/LocalizedNames.cpp
// Covers: platform/services/SdkDictionaries.cpp Zorvan/ZRPlugInSDK.cpp Zorvan/ZRPlugInForm.cpp
// Covers: zrd/ZRDPlugIn.cpp zrd/ZRDPlugInEnabling.cpp zrd/ZRDPlugInAdmission.cpp

#include "fuzz/Support.h"
#include "platform/services/Consent.h"
#include "platform/services/SdkDictionaries.h"
#include "platform/system/Files.h"
#include "platform/tandry/BundleReader.h"
#include "platform/tandry/LocalizedNames.h"
#include "platform/values/Cbor.h"
#include "tests/zrd/Fakes.h"

using namespace platform;
using namespace platform::tandry;

namespace {

/// A file or a symbolic link; none without content.
void put(const std::string& file, std::string_view content) {
    std::filesystem::remove(fuzz::home().path(file));
    if (content.starts_with("->") && content.size() > 2 && content.size() < 200 &&
        content.find('\0') == content.npos)
        std::filesystem::create_symlink(content.substr(2), fuzz::home().path(file));
    else if (!content.empty())
        fuzz::home().write(file, content);
}

/// What a host makes of a form, and of a bundle that it reads itself.
void readAsHost(const Dictionary& form, const PlugInEntry& entry, SdkDictionaries& sdks) {
    const auto plugIn = zorvan::ZRPlugInCore::initWithForm(form);
    fuzz::require(bool(plugIn));
    plugIn->setAnnotation("k", Value("v"));
    plugIn->setAnnotation("k", std::nullopt);
    std::optional<zorvan::ZRError> error;
    fuzz::require(bool(plugIn->exportForm(error)));
    plugIn->updateFromForm(form);
    const auto own = zorvan::ZRPlugInCore::initWithName(
        entry.record->plugInIdentifier, entry.record->bundlePath,
        Value(entry.record->infoPlist.get()), std::nullopt, std::nullopt);
    fuzz::require(bool(own));
    own->resolveSDK(sdks);
}

/// What a host gets, and what the launcher is told, of a plug-in; also of one that may share some
/// of its files, which an application extension does as a whole.
void makeReady(const zorvan::FakeWorld& world, const TDPlugInProxy& record) {
    static const zorvan::FakeHost host;
    world.consent->records = {
        {{kConsentGranted, true}, {kConsentService, kKeyboardNetworkConsent}}};
    const std::string application = fuzz::home().path("A.appex");
    for (const std::string& path : {application, application.substr(0, application.size() - 2)}) {
        auto copy = std::make_shared<TDPlugInProxy>(record);
        copy->bundlePath = path;
        const auto plugIn = world.record(copy);
        if (!plugIn) continue;
        (void)plugIn->allowForClient(host);
        (void)plugIn->enableForClient(
            host, plugIn->prepareForClient(host, plugIn->overlayForClient(host)));
        std::optional<zorvan::ZRError> error;
        auto draft = plugIn->draftForm({}, error);
        const auto form = draft ? plugIn->completedForm(*draft, Wait::Allowed) : std::nullopt;
        if (form) fuzz::require(isPropertyList(Value(*form)));
    }
    for (const auto& [executable, overlay] : world.launcher->granted)
        fuzz::require(isPropertyList(Value(overlay)));
    world.launcher->granted.clear();
    world.launcher->services.clear();
    world.workspace->restored.clear();
}

void exportIt(const PlugInEntry& entry, const TDApplicationProxyRef& application,
              SdkDictionaries& sdks) {
    static const zorvan::FakeWorld world;
    entry.record->containingApplication = application;
    entry.record->dataContainerPath = "/c";
    fuzz::require(isSafeName(*entry.record->plugInIdentifier));
    fuzz::require(isSafeName(entry.record->bundleIdentifier));
    const auto plugIn = world.record(entry.record);
    if (!plugIn) return;
    fuzz::require(!plugIn->diagnose());
    std::optional<zorvan::ZRError> error;
    auto draft = plugIn->draftForm({}, error);
    if (!draft) return;
    const auto completed = plugIn->completedForm(*draft, Wait::Allowed);
    fuzz::require(bool(completed));
    const Dictionary& form = *completed;
    fuzz::require(isPropertyList(Value(form)));
    std::string bytes;
    encodeCbor(form, bytes);
    fuzz::require(bool(decodeCbor(std::make_shared<const std::string>(bytes))));
    // The form that is kept is the same.
    auto kept = plugIn->draftForm({}, error);
    fuzz::require(kept && (!kept->isComplete || kept->form == form));
    for (const std::string_view name : {"", "e", "network"}) (void)plugIn->hasEntitlement(name);
    (void)plugIn->annotationKey();
    (void)zorvan::ZRDPlugIn::prunedInfoDictionaryFor(entry.record->infoPlist.get());
    readAsHost(form, entry, sdks);
    makeReady(world, *entry.record);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const Directories directories = fuzz::directories();
    static const std::string bundle = fuzz::home().makeDirectory("A.appex");
    static const std::string folderOfSdks = fuzz::home().makeDirectory("data/zorvan/SDKs");
    static const std::string executable = fuzz::home().write("A.appex/run", "#!/bin/true\n");
    static const std::string plain = fuzz::home().makeDirectory("A.app");
    const auto parts = fuzz::parts(fuzz::text(data, size), 6);
    constexpr const char* kFiles[] = {"A.appex/Info.plist", "A.appex/Entitlements.plist",
                                      "A.appex/Localized.plist", "data/zorvan/SDKs/point.plist"};
    for (std::size_t i = 0; i < std::size(kFiles); ++i) put(kFiles[i], parts[i]);
    put("A.app/Info.plist", parts[0]);
    const std::string languages(parts[4].substr(0, parts[4].find('\0')));
    ::setenv("LANGUAGE", languages.c_str(), 1);
    ::setenv("LC_ALL", languages.substr(languages.rfind(':') + 1).c_str(), 1);

    SdkDictionaries sdks(directories);
    ForeignPlaces places;
    places.beginWalk();
    BundleReader reader(sdks, &zorvan::ZRPlugInCore::mergeDictionary, userLanguages(), places);
    reader.beginPass();
    const BundleFolder folder(bundle);
    const auto application = reader.readApplication(folder);
    const auto reading = reader.readPlugIn(folder);
    (void)reader.isUnchanged(folder, reading.entry.print.directory(), reading.entry.print);
    fuzz::require(reader.isLike(reading.entry.print, reading.entry.print));
    if (!reading.refusal) {
        fuzz::require(reading.entry.dictionaries->size() <= kMaxRecordSize);
        exportIt(reading.entry, application.record, sdks);
    }
    if (parts[5].empty()) return 0;

    put(kFiles[0], parts[5]);
    sdks.clear();
    reader.beginPass();
    const Fingerprint later = reader.toRemember(folder, reading.entry.print);
    (void)reader.isLike(reading.entry.print, later);
    (void)reader.areApplicationStampsLike(application.stamps, reader.applicationStamps(folder));
    (void)reader.readPlugIn(folder, true);
    return 0;
}
