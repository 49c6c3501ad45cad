#pragma once

#include <sys/uio.h>

#include <cstddef>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/values/Value.h"

namespace platform {

/// Bytes that are written once and then sent: slices of its own memory, and large slices shared
/// with whoever encoded them before, so that nothing that exists already is copied. Move-only; not
/// synchronised.
class SliceList {
  public:
    SliceList() = default;
    SliceList(SliceList&&) noexcept = default;
    SliceList& operator=(SliceList&&) noexcept = default;

    /// Appends a copy.
    void append(std::string_view bytes);
    /// Appends the bytes, shared when they are many.
    void appendShared(const EncodedBytes& bytes);

    /// A place for `size` bytes that are known later.
    struct Gap {
        std::size_t offset;
    };
    Gap appendGap(std::size_t size);
    /// Writes into a gap; before anything is consumed.
    void fill(Gap gap, std::string_view bytes);

    /// All bytes, and those not consumed yet.
    std::size_t size() const { return size_; }
    std::size_t remaining() const { return size_ - consumed_; }

    /// Points `vectors` at the bytes that come next, as far as they go; answers how many it has
    /// used. Good until the list is changed.
    std::size_t gather(std::span<iovec> vectors) const;
    /// Marks `count` more bytes as done with.
    void consume(std::size_t count);

    /// A copy of the bytes that remain, in one piece.
    std::string string() const;

  private:
    struct Slice {
        std::shared_ptr<const std::string> owner;  // null: of `own_`
        const char* data;                          // into the owner's memory; unused for `own_`
        std::size_t offset;                        // into `own_`
        std::size_t size;
    };
    const char* begin(const Slice& slice) const {
        return slice.owner ? slice.data : own_.data() + slice.offset;
    }

    std::string own_;
    std::vector<Slice> slices_;
    std::size_t size_ = 0;
    std::size_t consumed_ = 0;
    std::size_t nextSlice_ = 0;       // the slice that holds the next byte
    std::size_t consumedOfNext_ = 0;  // bytes of it that are done with
};

}  // namespace platform
