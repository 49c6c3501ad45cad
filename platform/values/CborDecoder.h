#pragma once

#include <cstddef>
#include <optional>
#include <span>
#include <string_view>
#include <vector>

#include "platform/values/Cbor.h"
#include "platform/values/CborHead.h"
#include "platform/values/Decoded.h"
#include "platform/values/Value.h"

namespace platform {

/// Reads one item, once, by recursive descent. Each step answers false after it has noted what is
/// wrong.
///
/// The nodes of a container lie one behind another. What claims to hold many may lie, so its nodes
/// are gathered on a stack first: only what has been seen takes memory.
class CborDecoder {
  public:
    CborDecoder(const EncodedBytes& bytes, CborOptions options,
                std::optional<std::size_t> maxValues);

    Result<Value> decode();
    /// Whether a property list could hold what has been read (`isPropertyList`, as deep as items
    /// may be).
    bool hasReadPropertyList() const { return isPropertyList_; }

  private:
    bool fail(const char* wrong) {
        wrong_ = wrong;
        return false;
    }
    std::size_t left() const { return bytes_.size() - position_; }
    Hold within() const { return Hold::within(memory_); }

    bool readHead(CborHead& head);
    /// Each sets `value`, which holds nothing yet.
    bool read(Value& value, int depth);
    bool readArray(Value& value, std::uint64_t count, int depth);
    bool readMap(Value& value, std::uint64_t count, int depth);
    bool readTagged(Value& value, std::uint64_t tag);
    bool readDate(Value& value, const CborHead& content);
    bool readEntry(Dictionary::Entry& entry, int depth);

    /// So many nodes, each made by `readNode`; null when one of them fails.
    template <class Node, class ReadNode>
    Node* readNodes(std::uint64_t count, std::vector<Node>& stack, const Node& none,
                    ReadNode readNode);
    bool isText(std::string_view text);

    const std::string_view bytes_;
    const bool keepEncoded_;
    std::size_t valuesLeft_;
    Decoded* const memory_;
    const Hold kept_;
    std::vector<Value> values_;  // the stacks
    std::vector<Dictionary::Entry> entries_;
    std::size_t position_ = 0;
    std::size_t start_ = 0;  // of the item read last, for the error
    bool isPropertyList_ = true;
    const char* wrong_ = nullptr;
};

}  // namespace platform
