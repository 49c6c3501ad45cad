#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/values/Uuid.h"
#include "zrd/ZRDPlugInHold.h"

namespace zorvan {

/// The holds that there are, in the order in which they were added. Each is found by its token, by
/// its client and by what it holds, so that none costs more the more there are. Not synchronised.
class HoldList {
  public:
    using Hold = std::shared_ptr<ZRDPlugInHold>;

    void add(const Hold& hold);
    /// Takes out the hold with a token, and answers it; null when there is none.
    Hold take(const platform::Uuid& token);
    /// The same with the oldest hold of this very client.
    Hold takeOldestOf(const ZRDLumClient& client);

    bool empty() const { return holds_.empty(); }
    /// Whether any hold has the plug-in: it is one of those that were blocked, or lies where one of
    /// them did, or in an application that is held.
    bool has(const ZRDPlugIn& plugIn) const;
    std::vector<Hold> all() const;

  private:
    using Number = std::uint64_t;  // later ones are greater
    /// By what the holds have, how many have it.
    template <class Key>
    using Counts = std::unordered_map<Key, std::size_t>;

    Hold takeNumber(Number number);
    template <class Change>
    void forEachCount(const ZRDPlugInHold& hold, Change change);

    std::map<Number, Hold> holds_;
    Number last_ = 0;
    std::unordered_map<platform::Uuid, Number> tokens_;
    std::map<std::weak_ptr<const ZRDLumClient>, std::set<Number>, std::owner_less<>> clients_;
    Counts<platform::Uuid> plugIns_;
    Counts<std::string> bundles_, applications_;  // by canonical path
};

}  // namespace zorvan
