#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/values/Value.h"

namespace platform {

struct Directories;

/// The hierarchy of type identifiers. From any thread.
class Types {
  public:
    virtual ~Types() = default;

    /// The one name of a type that may be spelt in several ways.
    virtual std::string name(const std::string& type) = 0;
    /// The names of a type and of all that it descends from, each once.
    virtual std::vector<std::string> lineage(const std::string& type) = 0;

    /// Whether `type` equals `ancestor` or descends from it.
    bool conforms(const std::string& type, const std::string& ancestor);
};

/// MIME types with the hierarchy of the shared MIME database (<data dir>/mime: aliases and
/// subclasses, the user's directory first): every text/* descends from text/plain, and everything
/// but inode/* from application/octet-stream. Types compare without regard to ASCII case. Read at
/// the first question, and again as long as a file cannot be read for a reason that may pass; until
/// then its types are missing.
std::unique_ptr<Types> makeMimeTypes(const Directories& directories);

/// What a host offers to plug-ins, made ready for the activation rules of many of them: {"items":
/// [{"types": [type, ...]}, ...]}. Immutable.
class ActivationOffer {
  public:
    ActivationOffer(const Dictionary& offer, Types& types);

    /// Whether a rule accepts the offer. The rule is a boolean, which answers at once, or a
    /// dictionary from type to the most items of it (a number). The offer is accepted when it has
    /// at least one item, every item has a type that conforms to a listed type, and no listed type
    /// has more items than its count; an item counts for every listed type that one of its types
    /// conforms to. Rules and offers of other shapes are not accepted, nor are negative counts,
    /// rules that list more than 256 types, items of more than 256 types, and offers of more than
    /// 4 096 items or 16 384 types in all. It costs a question for each listed type.
    bool isAcceptedBy(const Value& rule) const;

  private:
    /// Items by their number, as bits.
    using Items = std::vector<std::uint64_t>;

    bool addItem(const Value& item, std::size_t number, std::size_t& typesLeft);

    Types& types_;
    std::size_t count_ = 0;  // of items; 0 for an offer that no dictionary accepts
    std::unordered_map<std::string, Items> conforming_;  // to the type of that name
};

}  // namespace platform
