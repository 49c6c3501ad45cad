#include "platform/values/Decoded.h"

#include <algorithm>
#include <mutex>

namespace platform {

namespace {

constexpr std::size_t kLeast = 1024, kMost = 64u << 10;
constexpr std::size_t kAlignment = alignof(std::max_align_t);

// A chunk that is used again would hide from the sanitizer who still reads in it.
#if defined(__SANITIZE_ADDRESS__)
constexpr std::size_t kMaxFree = 0;
#else
constexpr std::size_t kMaxFree = 96;
#endif

using Chunk = std::unique_ptr<std::byte[]>;

/// Chunks of the largest size, for the next message: that the kernel maps memory anew costs more
/// than decoding into it.
class FreeChunks {
  public:
    Chunk take() {
        std::lock_guard lock(mutex_);
        if (chunks_.empty()) return nullptr;
        Chunk chunk = std::move(chunks_.back());
        chunks_.pop_back();
        return chunk;
    }
    void give(Chunk chunk) {
        std::lock_guard lock(mutex_);
        if (chunks_.size() < kMaxFree) chunks_.push_back(std::move(chunk));
    }

  private:
    std::mutex mutex_;  // guards what follows
    std::vector<Chunk> chunks_;
};

/// Never destroyed: values may outlive everything else.
FreeChunks& freeChunks() {
    static auto* const chunks = new FreeChunks;
    return *chunks;
}

Chunk makeChunk(std::size_t size) {
    Chunk chunk = size == kMost ? freeChunks().take() : nullptr;
    return chunk ? std::move(chunk) : Chunk(new std::byte[size]);
}

}  // namespace

Decoded::~Decoded() {
    for (auto& [size, chunk] : chunks_)
        if (size == kMost) freeChunks().give(std::move(chunk));
}

void* Decoded::allocate(std::size_t size) {
    size = (size + kAlignment - 1) / kAlignment * kAlignment;
    if (size > left_) {
        // Each chunk is twice as large as the one before: few for a large message, little for a
        // small one.
        const std::size_t grown =
            std::min(kLeast << std::min<std::size_t>(chunks_.size(), 6), kMost);
        left_ = std::max(size, grown);
        next_ = chunks_.emplace_back(left_, makeChunk(left_)).second.get();
    }
    left_ -= size;
    return std::exchange(next_, next_ + size);
}

}  // namespace platform
