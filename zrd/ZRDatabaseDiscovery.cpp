// The candidates of a discovery query. The rules themselves are judged later, by matching.

#include <algorithm>
#include <cctype>
#include <cwctype>
#include <memory_resource>
#include <string>
#include <unordered_set>
#include <vector>

#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "zrd/ZRDAnnotationStore.h"
#include "zrd/ZRDPlugIn.h"
#include "zrd/ZRDatabase.h"

namespace zorvan {

using platform::Dictionary;
using platform::TDPlugInProxyList;
using platform::Value;

namespace {

/// Records for a log line.
struct ProxyList {
    const TDPlugInProxyList* proxies;
};

std::string describe(const ProxyList& list) {
    std::string text = "(";
    for (const auto& proxy : *list.proxies) {
        if (text.size() > 1) text += ", ";
        text += platform::describe(*proxy);
    }
    return text + ")";
}

/// Whether a discovery may answer a record; what it leaves out is logged.
bool isUsable(const platform::TDPlugInProxyRef& proxy) {
    if (!proxy->bundlePath) {
        EVLOG_INFO(ops(), "skipping td proxy {} with nil bundleURL", *proxy);
        return false;
    }
    if (proxy->containingApplication && proxy->containingApplication->isPlaceholder) {
        EVLOG_INFO(ops(), "skipping td proxy {} because its app is a placeholder", *proxy);
        return false;
    }
    return true;
}

/// The first character of valid UTF-8 text that is not empty.
char32_t firstCharacter(std::string_view text) {
    auto lead = static_cast<unsigned char>(text[0]);
    int length = lead < 0x80 ? 1 : lead < 0xE0 ? 2 : lead < 0xF0 ? 3 : 4;
    char32_t character = length == 1 ? lead : lead & (0xFF >> (length + 1));
    for (std::size_t i = 1; i < static_cast<std::size_t>(length) && i < text.size(); ++i) {
        character = character << 6 | (static_cast<unsigned char>(text[i]) & 0x3F);
    }
    return character;
}

/// The election that a pattern asks for as text, or none for a pattern that cannot be used here.
std::optional<std::string> electionPattern(const Value& pattern) {
    const auto* text = pattern.string();
    if (!text || text->empty()) return std::nullopt;
    if (text->view().front() == '=') return std::string(text->view().substr(1));
    // Letters and digits in the sense of Unicode, whatever the process's locale is.
    static const locale_t unicode = newlocale(LC_CTYPE_MASK, "C.UTF-8", nullptr);
    auto first = static_cast<wint_t>(firstCharacter(*text));
    bool usable = unicode ? iswalnum_l(first, unicode) != 0
                          : first < 0x80 && std::isalnum(static_cast<int>(first)) != 0;
    return usable ? std::optional(text->string()) : std::nullopt;
}

/// The elections that a query admits, or none when it does not narrow by election.
std::optional<std::unordered_set<std::string>> electionFilter(const Dictionary& query) {
    const Value* election = query.find(rule::kUserElection);
    if (!election) return std::nullopt;
    const platform::Array* several = election->array();
    const Value* begin = several ? several->begin() : election;
    const Value* end = several ? several->end() : election + 1;
    std::unordered_set<std::string> patterns;
    for (const Value* pattern = begin; pattern != end; ++pattern) {
        auto usable = electionPattern(*pattern);
        if (!usable) return std::nullopt;
        patterns.insert(*std::move(usable));
    }
    return patterns;
}

}  // namespace

bool ZRDatabase::electionAdmits(const std::unordered_set<std::string>& patterns,
                                const std::optional<std::string>& identifier,
                                const Dictionary& entitlements) {
    const Value* replaced = entitlements.find(entitlement::kReplacePlugIn);
    std::string key =
        replaced && replaced->string() ? replaced->string()->string() : identifier.value_or("");
    auto stored = sync_.sync([&]() -> std::optional<std::uint64_t> {
        const Dictionary* annotation = annotations_->annotationForIdentifier(key);
        const Value* election = annotation ? annotation->find(annotation::kElection) : nullptr;
        return election ? std::optional(election->numberAsBits().value_or(0)) : std::nullopt;
    });
    if (!stored) {
        const Value* autoElect = entitlements.find(entitlement::kAutoElectPlugIn);
        stored = autoElect && autoElect->isNumber() && !platform::equalsFalse(*autoElect) ? 1 : 0;
    }
    std::string text = std::to_string(static_cast<std::uint8_t>(*stored));
    bool kept = patterns.contains(text);
    EVLOG_DEBUG(ops(), "td filter {} -> {}", key, kept ? 1 : 0);
    return kept;
}

std::optional<TDPlugInProxyList> ZRDatabase::candidates(const Dictionary* query) {
    if (!query || query->empty()) {
        auto installed = workspace().installedPlugIns();
        EVLOG_DEBUG(td(), "{} installedPlugins: {}", installed.size(), ProxyList{&installed});
        return installed;
    }
    platform::Workspace::Filter filter;
    if (auto elections = electionFilter(*query)) {
        filter = [this, elections = *std::move(elections)](
                     const std::optional<std::string>& identifier, const Dictionary& entitlements) {
            return electionAdmits(elections, identifier, entitlements);
        };
    }
    auto matching = workspace().plugInsMatching(*query, filter);
    TDPlugInProxyList none;
    const TDPlugInProxyList& found = matching ? *matching : none;
    EVLOG_DEBUG(td(), "{} plugin(s) matching {} = {}", found.size(), *query, ProxyList{&found});
    return matching;
}

std::optional<ZRDPlugInList> ZRDatabase::findPlugIns(const Dictionary* query) {
    auto proxies = candidates(query);
    std::size_t cachedBefore = cacheCount_;
    if (!proxies) return std::nullopt;
    ZRDPlugInList plugIns;
    plugIns.reserve(proxies->size());
    std::pmr::monotonic_buffer_resource nodes;
    std::pmr::unordered_set<platform::Uuid> seen(proxies->size(), &nodes);
    // Entered once for all: thousands pass through here at a request.
    sync_.sync([&] {
        for (const auto& proxy : *proxies) {
            if (!isUsable(proxy)) continue;
            auto plugIn = recordForProxy(proxy);
            if (plugIn && seen.insert(proxy->plugInUuid).second)
                plugIns.push_back(std::move(plugIn));
        }
    });
    EVLOG_DEBUG(ops(), "TD reported {} plug-ins (cache {}/{})", plugIns.size(), cachedBefore,
                cacheCount_.load());
    return plugIns;
}

}  // namespace zorvan
