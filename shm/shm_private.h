/* Internals shared by the shared-memory allocator's source files. */
#ifndef QORBU_SHM_SHM_PRIVATE_H
#define QORBU_SHM_SHM_PRIVATE_H

#include "shm/shm.h"

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <sys/types.h>

namespace qorbu::shm {

constexpr int kClassCount = 27;
constexpr int kLargestClass = kClassCount - 1;
constexpr uintptr_t kSmallestBlock = 8;
constexpr uintptr_t kAddressAlignment = 4096;  // data addresses given to ShmCreate
constexpr uint32_t kAllocLimit = 0x40000000u;   // ShmAlloc refuses n at or above this
constexpr unsigned kPublishPollSeconds = 1;
constexpr int kReadOnlyBusyPolls = 1000;        // a read-only attach waits this many ms for busy
constexpr unsigned kReadOnlyBusyPollMicros = 1000;
constexpr uintptr_t kClassWordSize = sizeof(uintptr_t);

constexpr uintptr_t blockSize(int k) { return kSmallestBlock << k; }

#if UINTPTR_MAX == 0xffffffffu
static_assert(offsetof(ShmHeader, base) == 0);
static_assert(offsetof(ShmHeader, size) == 4);
static_assert(offsetof(ShmHeader, mutex) == 8);
static_assert(sizeof(pthread_mutex_t) == 24);
static_assert(offsetof(ShmHeader, useFlock) == 32);
static_assert(offsetof(ShmHeader, busy) == 36);
static_assert(offsetof(ShmHeader, freeList) == 40);
static_assert(sizeof(ShmHeader) == 148);
#else
static_assert(offsetof(ShmHeader, base) == 0);
static_assert(offsetof(ShmHeader, size) == sizeof(uintptr_t));
static_assert(offsetof(ShmHeader, freeList) % sizeof(uintptr_t) == 0);
static_assert(sizeof(ShmHeader) == offsetof(ShmHeader, freeList) + kClassCount * sizeof(uintptr_t));
#endif

/* The page size, as every segment computation uses it. */
uintptr_t pageSize();

/* Publication: the creator's store of `size` comes after everything else,
 * an attacher's reads of the header after its read of `size`. */
inline uint32_t loadPublishedSize(const ShmHeader *h) {
    return std::atomic_ref<uint32_t>(const_cast<uint32_t &>(h->size)).load(std::memory_order_acquire);
}
inline void publishSize(ShmHeader *h, uint32_t size) {
    std::atomic_ref<uint32_t>(h->size).store(size, std::memory_order_release);
}
inline uint32_t loadWord(const uint32_t &word) {
    return std::atomic_ref<uint32_t>(const_cast<uint32_t &>(word)).load(std::memory_order_acquire);
}
inline void storeWord(uint32_t &word, uint32_t value) {
    std::atomic_ref<uint32_t>(word).store(value, std::memory_order_release);
}

/* --- the process's table of mapped segments (mapping.cpp) ------------------ */

/* Maps the segment (object `fd`, identified by device and inode) at `addr`
 * for `length` bytes, or reuses this process's existing mapping of it, and
 * fills the handle's base, size and mapping. addr 0 lets the system choose.
 * A range the process already uses is never replaced: EEXIST. Returns 0, or
 * an errno value with nothing acquired. */
int attachMapping(ShmHandle *h, dev_t dev, ino_t ino, uintptr_t addr, uint32_t length);

/* Drops the handle's reference; the last one unmaps the segment. */
void detachMapping(ShmHandle *h);

/* --- the segment lock (lock.cpp) ------------------------------------------ */

/* Initialises the in-segment mutex process-shared and robust (robust where
 * the system offers it). Returns 0 or an errno value. */
int initSegmentMutex(pthread_mutex_t *mutex);

/* The descriptor lock (when useFlock was 1 on entry), then the mutex, then
 * the busy test; released in reverse order when it goes out of scope. */
class SegmentLock {
  public:
    explicit SegmentLock(ShmHandle *h);
    ~SegmentLock() { release(); }
    SegmentLock(const SegmentLock &) = delete;
    SegmentLock &operator=(const SegmentLock &) = delete;

    /* 0 when the lock is held, otherwise the errno value of the failure. */
    int error() const { return error_; }
    /* Sets busy for an operation that changes the lists; cleared on release. */
    void markBusy();
    /* Clears busy (where set) and releases both locks now. */
    void release();

  private:
    bool lockDescriptor();
    bool lockMutex();
    void unlockDescriptor();

    ShmHandle *handle_;
    int error_ = 0;
    bool flockTaken_ = false;
    bool mutexTaken_ = false;
    bool busySet_ = false;
};

/* --- segments (segment.cpp) ------------------------------------------------ */

/* Whole segment length for a request of `size` data bytes; 0 when the 32-bit
 * computation would wrap. */
uint32_t segmentLength(uint32_t size);

/* EINVAL unless the published header describes a segment that can be trusted
 * in an object of `objectLength` bytes. */
int validateHeader(uintptr_t base, uint32_t size, uint64_t objectLength);

/* Greedy first division of the data area into free blocks, largest first. */
void divideDataArea(ShmHeader *h, uint32_t length);

/* --- buddy lists (buddy.cpp) ----------------------------------------------- */

/* Smallest class whose blocks hold n bytes plus the class word, or -1. */
int classFor(uint32_t n);

/* The class word below a block and what it names. */
inline uintptr_t *classWordOf(uintptr_t block) {
    return reinterpret_cast<uintptr_t *>(block - kClassWordSize);
}
inline uintptr_t classWordFor(const ShmHeader *h, int k) {
    return reinterpret_cast<uintptr_t>(&h->freeList[k]);
}

} // namespace qorbu::shm

#endif
