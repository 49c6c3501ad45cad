#pragma once

#include <map>
#include <optional>
#include <string>
#include <unordered_map>

#include "platform/lum/Origin.h"
#include "platform/plist/PropertyListCost.h"

namespace zorvan {

/// Whose the stored annotations are, as far as sharing goes: an annotation belongs, as a whole, to
/// the origin that set its "extension" last, and to nobody when that was before this daemon began.
/// One origin may have a quarter of the room that there is for hosts' data.
///
/// Numbers of sessions and namespaces are given out again. Whoever comes to have that of an origin
/// that has gone takes over what it has stored: it may then store less, never more than a quarter,
/// until it replaces that or the daemon starts anew, and the user's elections find room all the
/// same. To forget an origin at its end would let everybody begin a new quarter by connecting anew.
///
/// Owned and used by the annotation store.
class AnnotationShares {
  public:
    /// `room` is the room for the data of all hosts, in bytes.
    explicit AnnotationShares(std::size_t room) : room_(room) {}

    /// Whether the origin may have an annotation of that cost under a key.
    bool hasRoomFor(const platform::Origin& origin, const std::string& key,
                    const platform::PropertyListCost& cost) const;
    /// The annotation under a key belongs to the origin from now on.
    void give(const platform::Origin& origin, const std::string& key);
    /// The annotation under a key costs so much now; nothing when it is gone.
    void changed(const std::string& key, const std::optional<platform::PropertyListCost>& cost);

  private:
    struct Owned {
        platform::Origin owner;
        platform::PropertyListCost cost;
    };
    void drop(const std::string& key);

    const std::size_t room_;
    std::unordered_map<std::string, Owned> byKey_;
    std::map<platform::Origin, platform::PropertyListCost> byOrigin_;
};

}  // namespace zorvan
