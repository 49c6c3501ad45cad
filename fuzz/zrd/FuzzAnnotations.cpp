// A file of annotations that somebody wrote, and what hosts change in it: dictionaries that lead
// from plug-ins "a", "b" and "c" to what is set, or to something else for what is removed. Whatever
// is kept can be stored, and is kept again, in the text that a store has which knows nothing else.
// Covers: zrd/ZRDAnnotationStore.cpp zrd/AnnotationText.cpp platform/plist/PropertyListCost.cpp
// Covers: platform/plist/XmlPropertyListText.cpp

#include "fuzz/Support.h"
#include "platform/lum/Origin.h"
#include "platform/system/Files.h"
#include "tests/zrd/Fakes.h"
#include "zrd/ZRDAnnotationStore.h"

using namespace platform;
using zorvan::ZRDAnnotationStore;

namespace {

struct PlugIns {
    PlugIns() {
        for (const char* identifier : {"a", "b", "c"})
            all[identifier] = world.record(zorvan::makeProxy(identifier));
    }
    zorvan::FakeWorld world;
    std::map<std::string, std::shared_ptr<zorvan::ZRDPlugIn>> all;
};

/// Does what a host may have done, as requests do it.
void change(ZRDAnnotationStore& store, const Dictionary& changes) {
    static const PlugIns plugIns;
    static const Origin origin = Origin::of(*AuditToken::ofSelf());
    for (const auto& [identifier, value] : changes) {
        const auto plugIn = plugIns.all.find(identifier.string());
        if (plugIn == plugIns.all.end() || !isPropertyList(value)) continue;
        const Dictionary* annotation = value.dictionary();
        if (!annotation)
            store.setAnnotation(std::nullopt, *plugIn->second);
        else if (store.hasShareFor(*annotation, *plugIn->second, origin) &&
                 store.hasRoomFor(*annotation, *plugIn->second))
            store.setAnnotation(*annotation, *plugIn->second, origin);
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const Directories directories = fuzz::directories();
    static const std::string file = ZRDAnnotationStore::defaultDatabaseURL(directories);
    const auto parts = fuzz::parts(fuzz::text(data, size), 4);
    fuzz::home().write(file.substr(fuzz::home().path().size() + 1), parts[0]);
    const auto store = ZRDAnnotationStore::initWithDatabase(std::nullopt, directories);
    fuzz::require(!store->saveDb());
    for (std::size_t i = 1; i < parts.size(); ++i) change(*store, fuzz::dictionaryIn(parts[i]));
    const auto first = readFile(file, 1u << 20);
    const auto again = ZRDAnnotationStore::initWithDatabase(file, directories);
    fuzz::require(again->annotations().size() == store->annotations().size());
    fuzz::require(!again->saveDb());
    const auto second = readFile(file, 1u << 20);
    fuzz::require(first && second && *first == *second);
    return 0;
}
