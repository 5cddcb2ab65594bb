#pragma once

#include <cstddef>
#include <memory>
#include <new>
#include <sys/mman.h>

// An allocator for large, short-lived arrays that asks the kernel to back
// them with huge pages. Touching fresh memory costs a page fault a page;
// where faults are dear (as under some hypervisors) a few million small
// pages take longer than the work done on them, and a huge page takes the
// fault of 512. Blocks below a huge page come from the ordinary heap; a
// kernel without transparent huge pages gives small pages, as before.
template<typename T>
class HTHugePageAllocator {
public:
    using value_type = T;

    HTHugePageAllocator() = default;
    template<typename U>
    HTHugePageAllocator(const HTHugePageAllocator<U>&) noexcept
    {
    }

    T* allocate(size_t count)
    {
        const size_t bytes = count * sizeof(T);
        if (bytes < kHugePage) return std::allocator<T>().allocate(count);
        void* block = ::mmap(nullptr, mappedSize(bytes), PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
        if (block == MAP_FAILED) throw std::bad_alloc();
        // Advice only: without it the block is still whole memory.
        (void)::madvise(block, mappedSize(bytes), MADV_HUGEPAGE);
        return static_cast<T*>(block);
    }

    void deallocate(T* block, size_t count) noexcept
    {
        const size_t bytes = count * sizeof(T);
        if (bytes < kHugePage)
            std::allocator<T>().deallocate(block, count);
        else
            ::munmap(block, mappedSize(bytes));
    }

    template<typename U>
    bool operator==(const HTHugePageAllocator<U>&) const noexcept
    {
        return true;
    }

private:
    static constexpr size_t kHugePage = size_t{2} << 20;
    static size_t mappedSize(size_t bytes) { return (bytes + kHugePage - 1) / kHugePage * kHugePage; }
};
