#include "zrd/ZRDUserPrefs.h"

namespace zorvan {

namespace {
constexpr const char* kDomain = "com.orbel.zorvan.userprefs";
}

std::optional<platform::Value> ZRDUserPrefs::exclusions() {
    preferences_.synchronize(kDomain);
    return preferences_.value(kDomain, "exclusions");
}

}  // namespace zorvan
