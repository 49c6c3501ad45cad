#include "zrd/ZRDUserPrefs.h"

#include "Zorvan/Keys.h"

namespace zorvan {

std::optional<platform::Value> ZRDUserPrefs::exclusions() {
    preferences_.synchronize(kUserPreferences);
    return preferences_.value(kUserPreferences, kExclusions);
}

}  // namespace zorvan
