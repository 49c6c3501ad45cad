#pragma once

#include <cstddef>
#include <memory>
#include <new>
#include <span>
#include <string>
#include <type_traits>
#include <utility>
#include <vector>

#include "platform/values/Memory.h"

namespace platform {

/// Encoded bytes with the nodes that were decoded from them: texts and data are slices of the
/// bytes, containers point at the nodes of what they contain, which lie one behind another.
class Decoded final : public Memory {
  public:
    explicit Decoded(std::shared_ptr<const std::string> bytes)
        : Memory(Use::Fixed), bytes_(std::move(bytes)) {}
    ~Decoded() override;

    const std::shared_ptr<const std::string>& bytes() const { return bytes_; }

    /// Nodes in this memory, where they stay as long as it does. They are never destroyed: what
    /// they keep must be this memory, uncounted, or nothing.
    template <class Node>
    Node* make(std::size_t count, const Node& node) {
        Node* nodes = place<Node>(count);
        std::uninitialized_fill_n(nodes, count, node);
        return nodes;
    }
    /// The same of nodes that are moved there.
    template <class Node>
    Node* keep(std::span<Node> nodes) {
        Node* kept = place<Node>(nodes.size());
        std::uninitialized_move(nodes.begin(), nodes.end(), kept);
        return kept;
    }

  private:
    template <class Node>
    Node* place(std::size_t count) {
        static_assert(alignof(Node) <= alignof(std::max_align_t));
        return static_cast<Node*>(allocate(count * sizeof(Node)));
    }
    void* allocate(std::size_t size);

    const std::shared_ptr<const std::string> bytes_;
    std::vector<std::pair<std::size_t, std::unique_ptr<std::byte[]>>> chunks_;  // with their sizes
    std::byte* next_ = nullptr;
    std::size_t left_ = 0;
};

}  // namespace platform
