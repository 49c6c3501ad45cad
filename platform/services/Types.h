#pragma once

#include <memory>
#include <string>

#include "platform/values/Value.h"

namespace platform {

struct Directories;

/// The hierarchy of type identifiers.
class Types {
  public:
    virtual ~Types() = default;
    /// Whether `type` equals `ancestor` or descends from it. From any thread.
    virtual bool conforms(const std::string& type, const std::string& ancestor) = 0;
};

/// MIME types with the hierarchy of the shared MIME database (<data dir>/mime: aliases and
/// subclasses, the user's directory first): every text/* descends from text/plain, and everything
/// but inode/* from application/octet-stream. Types compare without regard to ASCII case. Read at
/// the first question, and again as long as a file cannot be read for a reason that may pass; until
/// then its types are missing.
std::unique_ptr<Types> makeMimeTypes(const Directories& directories);

/// Whether an activation rule accepts what a host offers. The rule is a boolean, which answers at
/// once, or a dictionary from type to the most items of it (a number). The offer is
/// {"items": [{"types": [type, ...]}, ...]}. It is accepted when it has at least one item, every
/// item has a type that conforms to a listed type, and no listed type has more items than its
/// count; an item counts for every listed type that one of its types conforms to. Rules and offers
/// of other shapes are not accepted, nor are negative counts, rules that list more than 256 types,
/// items of more than 256 types, and offers of more than 4 096 items or 16 384 types in all.
bool evaluateActivationRule(const Value& rule, const Dictionary& offer, Types& types);

}  // namespace platform
