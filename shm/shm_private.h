/* Internals shared by the shared-memory allocator's source files. */
#ifndef QORBU_SHM_SHM_PRIVATE_H
#define QORBU_SHM_SHM_PRIVATE_H

#include "shm/shm.h"

#include <atomic>
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <sys/types.h>

namespace qorbu::shm {

constexpr int kClassCount = 27;
constexpr int kLargestClass = kClassCount - 1;
constexpr uintptr_t kSmallestBlock = 8;
constexpr uintptr_t kAddressAlignment = 4096;  // data addresses given to ShmCreate
constexpr uint32_t kAllocLimit = 0x40000000u;   // ShmAlloc refuses n at or above this
constexpr int kPublishWaitMillis = 3000;        // an attach gives up on an unpublished segment after this
constexpr unsigned kPublishPollMicros = 10000;
constexpr int kReadOnlyBusyPolls = 1000;        // a read-only attach waits this many ms for busy
constexpr unsigned kReadOnlyBusyPollMicros = 1000;
constexpr uintptr_t kClassWordSize = sizeof(uintptr_t);
constexpr int kDamaged = EUCLEAN;              // errno of an operation that met damaged lists

constexpr uintptr_t blockSize(int k) { return kSmallestBlock << k; }
static_assert(kSmallestBlock == uintptr_t{1} << 3);

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

/* Drops the handle's reference; the last one unmaps the segment, and the
 * last read-write one turns the mapping back to read-only. */
void detachMapping(ShmHandle *h);

/* The length of this process's mapping whose header lies at `base`, or 0. */
uint32_t mappedLength(const void *base);

/* The mmap that turns a read-only mapping read-write in place (tests put a
 * failing one here). */
extern void *(*upgradeMap)(void *, size_t, int, int, int, off_t);

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

/* The data area as this process maps it: every link is checked against it,
 * never against what the (possibly damaged) header says. */
struct DataArea {
    uintptr_t start;
    uintptr_t length;
    uintptr_t page;
};
inline DataArea dataAreaOf(const void *header, uint32_t mappingLength, uintptr_t page) {
    return {reinterpret_cast<uintptr_t>(header) + page, mappingLength - page, page};
}

/* Whether a block of class k may lie at `block`: wholly inside the data
 * area and aligned to its size (to the page for blocks above one page,
 * which is all that a data area at a page-aligned address guarantees). */
inline bool blockFits(const DataArea &area, int k, uintptr_t block) {
    const uintptr_t size = blockSize(k);
    const uintptr_t align = size < area.page ? size : area.page;
    return size <= area.length && block - area.start <= area.length - size && (block & (align - 1)) == 0;
}

/* The one walk over a free list. Every entry is checked before it is
 * followed: a sound block of the class, strictly below the one before it,
 * and no more entries than the data area can hold. On damage the cursor
 * stops (entry() 0) with damaged() set. */
class ListCursor {
  public:
    ListCursor(ShmHeader *h, const DataArea &area, int k)
        : link_(&h->freeList[k]), start_(area.start),
          bound_(blockSize(k) <= area.length ? area.length - blockSize(k) + 1 : 0),
          mask_((blockSize(k) < area.page ? blockSize(k) : area.page) - 1),
          left_(area.length >> (k + 3)) {  // length / blockSize(k)
        check();
    }
    uintptr_t entry() const { return entry_; }
    /* The link that leads to entry(): the list head or the previous entry's first word. */
    uintptr_t *link() const { return link_; }
    bool damaged() const { return damaged_; }
    void advance() {
        link_ = reinterpret_cast<uintptr_t *>(entry_);
        check();
    }

  private:
    void check() {
        const uintptr_t next = *link_;
        const uintptr_t offset = next - start_;
        if (next == 0) {
            entry_ = 0;
        } else if (offset < bound_ && (next & mask_) == 0 && left_-- > 0) {
            entry_ = next;
            bound_ = offset; // strictly descending
        } else {
            entry_ = 0;
            damaged_ = true;
        }
    }

    uintptr_t *link_;
    uintptr_t entry_ = 0;
    uintptr_t start_;
    uintptr_t bound_;  // the next entry's offset in the data area lies below this
    uintptr_t mask_;
    uintptr_t left_;   // entries the data area can still hold
    bool damaged_ = false;
};

/* Whether p can be a block that ShmAlloc handed out in this data area: a
 * sound block of the class that the class word below it names. The class,
 * or -1. */
inline int blockClass(const ShmHeader *h, const DataArea &area, uintptr_t p) {
    if (p - area.start >= area.length || p % kSmallestBlock != 0) return -1;
    const uintptr_t slot = *classWordOf(p) - classWordFor(h, 0);
    if (slot >= kClassCount * sizeof(uintptr_t) || slot % sizeof(uintptr_t) != 0) return -1;
    const int k = static_cast<int>(slot / sizeof(uintptr_t));
    return blockFits(area, k, p) ? k : -1;
}

} // namespace qorbu::shm

#endif
