// What the registry announces, and the election that plug-ins may ask for.

#include "Zorvan/Helpers.h"
#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "zrd/ZRDAnnotationStore.h"
#include "zrd/ZRDPlugIn.h"
#include "zrd/ZRDatabase.h"

namespace zorvan {

using platform::Dictionary;
using platform::Value;

void ZRDatabase::pluginsDidInstall(const platform::TDPlugInProxyList& plugIns) {
    // The cache is left alone: a new plug-in has a UUID of its own and is built at its first
    // lookup.
    for (const auto& proxy : plugIns) {
        EVLOG_DEFAULT(ops(), "plug-in INSTALLED:{} {}({}) {} {}", proxy->bundleIdentifier,
                      proxy->plugInIdentifier.value_or(""), proxy->bundleVersion,
                      pub(proxy->plugInUuid), proxy->bundlePath.value_or(""));
    }
}

void ZRDatabase::pluginsWillUninstall(const platform::TDPlugInProxyList& plugIns) {
    sync_.sync([&] {
        for (const auto& proxy : plugIns) {
            EVLOG_DEFAULT(ops(), "plug-in UNINSTALLED:{} {}({}) {} {}", proxy->bundleIdentifier,
                          proxy->plugInIdentifier.value_or(""), proxy->bundleVersion,
                          pub(proxy->plugInUuid), proxy->bundlePath.value_or(""));
            cache_.erase(proxy->plugInUuid);
        }
        cacheCount_ = cache_.size();
    });
    if (auto delegate = delegate_.lock()) delegate->removedPlugIns(plugIns);
}

void ZRDatabase::autoElect(const ZRDPlugIn& plugIn) {
    sync_.assertCurrent();
    const Dictionary* stored = annotations_->annotationForPlugIn(plugIn);
    Dictionary annotation = stored ? *stored : Dictionary();
    const Value* election = annotation.find(annotation::kElection);
    if (election && election->numberAsInteger().value_or(0) != 0) return;
    annotations_->setAnnotation(dictionaryChanging(annotation, annotation::kElection, Value(1)),
                                plugIn);
}

}  // namespace zorvan
