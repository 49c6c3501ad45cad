// Stands before the C library: linked into a program, or loaded before its libraries.

#include <fcntl.h>
#include <stdlib.h>
#include <sys/mman.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>

#include "bench/counting/Counters.h"

// The C library's own, which ours take the names of.
extern "C" {
void* __libc_malloc(size_t size);
void* __libc_calloc(size_t count, size_t size);
void* __libc_realloc(void* memory, size_t size);
void* __libc_memalign(size_t alignment, size_t size);
}

namespace bench {

constinit std::atomic<Counters*> countersInUse = nullptr;

namespace {

void count(std::atomic<std::uint64_t> Counters::*what) {
    if (Counters* counters = countersInUse.load(std::memory_order_relaxed))
        (counters->*what).fetch_add(1, std::memory_order_relaxed);
}

[[gnu::constructor]] void countFromTheBeginning() {
    const char* path = ::getenv(kCountersVariable);
    const int file = path ? ::open(path, O_RDWR | O_CLOEXEC) : -1;
    if (file < 0) return;
    void* shared = ::mmap(nullptr, sizeof(Counters), PROT_READ | PROT_WRITE, MAP_SHARED, file, 0);
    ::close(file);
    if (shared != MAP_FAILED) countersInUse = static_cast<Counters*>(shared);
}

}  // namespace

}  // namespace bench

using bench::count;
using bench::Counters;

extern "C" {

void* malloc(size_t size) {
    count(&Counters::allocations);
    return __libc_malloc(size);
}
void* calloc(size_t number, size_t size) {
    count(&Counters::allocations);
    return __libc_calloc(number, size);
}
void* realloc(void* memory, size_t size) {
    count(&Counters::allocations);
    return __libc_realloc(memory, size);
}
void* aligned_alloc(size_t alignment, size_t size) {
    count(&Counters::allocations);
    return __libc_memalign(alignment, size);
}
void* memalign(size_t alignment, size_t size) {
    count(&Counters::allocations);
    return __libc_memalign(alignment, size);
}
int posix_memalign(void** memory, size_t alignment, size_t size) {
    count(&Counters::allocations);
    void* made = __libc_memalign(alignment, size);
    if (!made) return ENOMEM;
    *memory = made;
    return 0;
}

int fsync(int file) {
    count(&Counters::syncs);
    return static_cast<int>(::syscall(SYS_fsync, file));
}
int fdatasync(int file) {
    count(&Counters::syncs);
    return static_cast<int>(::syscall(SYS_fdatasync, file));
}
int renameat(int from, const char* name, int to, const char* target) noexcept {
    count(&Counters::replacements);
    return static_cast<int>(::syscall(SYS_renameat2, from, name, to, target, 0));
}
}
