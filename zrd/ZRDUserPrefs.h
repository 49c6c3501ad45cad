#pragma once

#include <optional>

#include "platform/services/Preferences.h"
#include "platform/values/Value.h"

namespace zorvan {

/// The daemon's user preferences: the domain "com.orbel.zorvan.userprefs" of the current user on
/// the current host. Owned by the server; used on the service queue. Caches nothing of its own.
class ZRDUserPrefs {
  public:
    explicit ZRDUserPrefs(const platform::Directories& directories) : preferences_(directories) {}

    /// The rules that take plug-ins out of every discovery result, as stored: normally an array of
    /// rules dictionaries, but nothing checks that. None when there are none. Sees what other
    /// processes have written since the last call.
    std::optional<platform::Value> exclusions();

  private:
    platform::Preferences preferences_;
};

}  // namespace zorvan
