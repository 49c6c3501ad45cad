#include "platform/values/Text.h"

#include <cstring>
#include <new>

namespace platform {

namespace {

/// The bytes lie behind the object, in the same allocation.
class CopiedBytes final : public Memory {
  public:
    static CopiedBytes* make(std::string_view bytes) {
        void* place = ::operator new(sizeof(CopiedBytes) + bytes.size());
        auto* copy = new (place) CopiedBytes;
        std::memcpy(copy->data(), bytes.data(), bytes.size());
        return copy;
    }
    char* data() { return reinterpret_cast<char*>(this + 1); }

    static void operator delete(void* place) { ::operator delete(place); }

  private:
    CopiedBytes() : Memory(Use::Fixed) {}
    ~CopiedBytes() override = default;
};

}  // namespace

Bytes::Bytes(std::string_view bytes) {
    if (bytes.empty()) return;
    auto* copy = CopiedBytes::make(bytes);
    memory_ = Hold(copy);
    data_ = copy->data();
    size_ = bytes.size();
}

}  // namespace platform
