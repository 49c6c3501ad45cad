#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <utility>

namespace platform {

/// Memory that values are views of: the bytes of a message with the nodes that were decoded from
/// it, a text, the elements of an array. It goes when nobody outside it holds it any more. Counting
/// is safe from any thread.
class Memory {
  public:
    enum class Use { Fixed, Changed };

    Memory(const Memory&) = delete;
    Memory& operator=(const Memory&) = delete;

    Use use() const { return use_; }

  protected:
    explicit Memory(Use use) : use_(use) {}
    virtual ~Memory() = default;

  private:
    friend class Hold;

    const Use use_;
    std::atomic<std::size_t> holders_{0};
};

/// Keeps memory as long as it lives, and so do its copies. What lies in the memory itself refers to
/// it without keeping it, as the memory could never go otherwise; copies of that do keep it.
class Hold {
  public:
    Hold() = default;
    explicit Hold(Memory* memory) : Hold(memory, true) {}
    /// For what lies in `memory`, and goes with it.
    static Hold within(Memory* memory) { return Hold(memory, false); }
    Hold(const Hold& other) : Hold(other.get(), true) {}
    Hold(Hold&& other) noexcept : tagged_(std::exchange(other.tagged_, nullptr)) {}
    Hold& operator=(Hold other) noexcept {
        std::swap(tagged_, other.tagged_);
        return *this;
    }
    ~Hold() {
        if (isCounted() && get()->holders_.fetch_sub(1, std::memory_order_acq_rel) == 1)
            delete get();
    }

    /// Null when it keeps nothing.
    Memory* get() const { return reinterpret_cast<Memory*>(tagged_ - isCounted()); }
    /// Whether this alone keeps memory that may be changed: what others have read in it before they
    /// let go of it has happened before this answers.
    bool mayChange() const {
        return isCounted() && get()->use() == Memory::Use::Changed &&
               get()->holders_.load(std::memory_order_acquire) == 1;
    }

  private:
    Hold(Memory* memory, bool isCounted) {
        if (!memory) return;
        tagged_ = reinterpret_cast<char*>(memory) + isCounted;
        if (isCounted) memory->holders_.fetch_add(1, std::memory_order_relaxed);
    }

    bool isCounted() const { return (reinterpret_cast<std::uintptr_t>(tagged_) & 1) != 0; }

    /// The memory's address, and one more where this is counted.
    char* tagged_ = nullptr;
};

}  // namespace platform
