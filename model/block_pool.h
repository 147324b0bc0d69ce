#pragma once

// Fixed-size blocks for the records a run makes by the hundred thousand
// (regions, memory objects, range-list nodes). They are carved from large
// chunks, so a record costs its own size and no allocator header, and the
// records made one after another sit next to each other. A freed block goes
// to a free list of the thread that frees it and is handed out again from
// there; chunks are kept until the program ends.
//
// A class uses it through its own operator new and delete:
//   static void *operator new(std::size_t size) { return vs::BlockPool<T>::allocate(size); }
//   static void operator delete(void *p) { vs::BlockPool<T>::deallocate(p); }

#include <cstddef>
#include <mutex>
#include <new>
#include <vector>

namespace vs {

template <typename T>
class BlockPool {
public:
    static void *allocate(std::size_t size) {
        if (size != sizeof(T)) {
            return ::operator new(size); // a derived class: not ours to pool
        }
        Local &local = _local();
        if (local.free != nullptr) {
            Free *block = local.free;
            local.free = block->next;
            return block;
        }
        if (local.next == local.end) {
            char *chunk = static_cast<char *>(::operator new(kChunkBlocks * kBlock, std::align_val_t(kAlign)));
            _keep(chunk);
            local.next = chunk;
            local.end = chunk + kChunkBlocks * kBlock;
        }
        void *block = local.next;
        local.next += kBlock;
        return block;
    }

    static void deallocate(void *p, std::size_t size) {
        if (p == nullptr) {
            return;
        }
        if (size != sizeof(T)) {
            ::operator delete(p);
            return;
        }
        Local &local = _local();
        Free *block = static_cast<Free *>(p);
        block->next = local.free;
        local.free = block;
    }

private:
    struct Free {
        Free *next;
    };
    static constexpr std::size_t kAlign = alignof(T) > alignof(Free) ? alignof(T) : alignof(Free);
    static constexpr std::size_t kBlock = (sizeof(T) + kAlign - 1) / kAlign * kAlign;
    static constexpr std::size_t kChunkBlocks = (64 * 1024) / kBlock;

    struct Local {
        Free *free = nullptr;
        char *next = nullptr;
        char *end = nullptr;
    };

    static Local &_local() {
        thread_local Local local;
        return local;
    }

    // Every chunk stays reachable (and alive) for the rest of the run:
    // blocks freed by one thread may be in use through another's list.
    static void _keep(char *chunk) {
        static std::mutex lock;
        static std::vector<char *> *chunks = new std::vector<char *>;
        std::lock_guard<std::mutex> guard(lock);
        chunks->push_back(chunk);
    }
};

} // namespace vs
