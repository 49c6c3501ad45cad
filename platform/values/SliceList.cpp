#include "platform/values/SliceList.h"

#include <algorithm>

namespace platform {

namespace {

/// Sharing a slice costs about as much as copying so many bytes.
constexpr std::size_t kLeastShared = 256;

}  // namespace

void SliceList::append(std::string_view bytes) {
    if (slices_.empty() || slices_.back().owner) {
        slices_.push_back({nullptr, nullptr, own_.size(), 0});
    }
    own_ += bytes;
    slices_.back().size += bytes.size();
    size_ += bytes.size();
}

void SliceList::appendShared(const EncodedBytes& bytes) {
    if (bytes.bytes.size() < kLeastShared) return append(bytes.bytes);
    slices_.push_back({bytes.owner, bytes.bytes.data(), 0, bytes.bytes.size()});
    size_ += bytes.bytes.size();
}

SliceList::Gap SliceList::appendGap(std::size_t size) {
    append(std::string(size, '\0'));
    return {own_.size() - size};
}

void SliceList::fill(Gap gap, std::string_view bytes) {
    std::ranges::copy(bytes, own_.begin() + static_cast<std::ptrdiff_t>(gap.offset));
}

std::size_t SliceList::gather(std::span<iovec> vectors) const {
    std::size_t used = 0;
    std::size_t skip = consumedOfNext_;
    for (std::size_t i = nextSlice_; i < slices_.size() && used < vectors.size(); ++i) {
        // The kernel only reads what it is asked to send.
        vectors[used++] = {const_cast<char*>(begin(slices_[i])) + skip, slices_[i].size - skip};
        skip = 0;
    }
    return used;
}

void SliceList::consume(std::size_t count) {
    consumed_ += count;
    consumedOfNext_ += count;
    while (nextSlice_ < slices_.size() && consumedOfNext_ >= slices_[nextSlice_].size) {
        consumedOfNext_ -= slices_[nextSlice_].size;
        slices_[nextSlice_++].owner.reset();
    }
}

std::string SliceList::string() const {
    std::string bytes;
    bytes.reserve(remaining());
    std::size_t skip = consumedOfNext_;
    for (std::size_t i = nextSlice_; i < slices_.size(); ++i) {
        bytes.append(begin(slices_[i]) + skip, slices_[i].size - skip);
        skip = 0;
    }
    return bytes;
}

}  // namespace platform
