// A file of annotations that somebody wrote. Whatever is kept of it can be stored, and is kept
// again.
// Covers: zrd/ZRDAnnotationStore.cpp zrd/AnnotationText.cpp platform/plist/PropertyListCost.cpp
// Covers: platform/plist/XmlPropertyListText.cpp

#include "fuzz/Support.h"
#include "platform/system/Files.h"
#include "zrd/ZRDAnnotationStore.h"

using namespace platform;
using zorvan::ZRDAnnotationStore;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const Directories directories = fuzz::directories();
    const std::string file = fuzz::home().write("Annotations", fuzz::text(data, size));
    const auto store = ZRDAnnotationStore::initWithDatabase(file, directories);
    fuzz::require(!store->saveDb());
    const auto first = readFile(file, 1u << 20);
    const auto again = ZRDAnnotationStore::initWithDatabase(file, directories);
    fuzz::require(again->annotations().size() == store->annotations().size());
    fuzz::require(!again->saveDb());
    const auto second = readFile(file, 1u << 20);
    fuzz::require(first && second && *first == *second);
    return 0;
}
