/* Internals shared by the shared-memory allocator's source files. */
#ifndef QORBU_SHM_SHM_PRIVATE_H
#define QORBU_SHM_SHM_PRIVATE_H

#include "shm/shm.h"

#include <algorithm>
#include <atomic>
#include <bit>
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <sys/types.h>

namespace qorbu::shm {

constexpr int kClassCount = 27;
constexpr int kLargestClass = kClassCount - 1;
constexpr uintptr_t kSmallestBlock = 8;
constexpr uintptr_t kAddressAlignment = 4096; // data addresses given to ShmCreate
constexpr uint32_t kAllocLimit = 0x40000000u; // ShmAlloc refuses n at or above this
constexpr int kPublishWaitMillis = 3000;      // an attach gives up on an unpublished segment after this
constexpr unsigned kPublishPollMicros = 10000;
constexpr int kReadOnlyBusyPolls = 1000; // a read-only attach waits this many ms for busy
constexpr unsigned kReadOnlyBusyPollMicros = 1000;
constexpr uintptr_t kClassWordSize = sizeof(uintptr_t);
constexpr int kWordShift = sizeof(uintptr_t) == 8 ? 3 : 2; // log2 of sizeof(uintptr_t)
constexpr int kDamaged = EUCLEAN;                          // errno of an operation that met damaged lists

constexpr int kSmallestShift = 3; // log2 of kSmallestBlock
constexpr uintptr_t block_size(int k) { return kSmallestBlock << k; }
static_assert(kSmallestBlock == uintptr_t{1} << kSmallestShift);
static_assert(sizeof(uintptr_t) == uintptr_t{1} << kWordShift);

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

/* The page size, as every segment computation uses it: asked of the system
 * once per process (the allocator's hot path needs it on every call). */
extern std::atomic<uintptr_t> cached_page_size;
uintptr_t read_page_size();
inline uintptr_t page_size() {
    const uintptr_t page = cached_page_size.load(std::memory_order_relaxed);
    return page != 0 ? page : read_page_size();
}

/* Publication: the creator's store of `size` comes after everything else,
 * an attacher's reads of the header after its read of `size`. */
inline uint32_t load_published_size(const ShmHeader *h) {
    return std::atomic_ref<uint32_t>(const_cast<uint32_t &>(h->size)).load(std::memory_order_acquire);
}
inline void publish_size(ShmHeader *h, uint32_t size) {
    std::atomic_ref<uint32_t>(h->size).store(size, std::memory_order_release);
}
inline uint32_t load_word(const uint32_t &word) {
    return std::atomic_ref<uint32_t>(const_cast<uint32_t &>(word)).load(std::memory_order_acquire);
}
inline void store_word(uint32_t &word, uint32_t value) {
    std::atomic_ref<uint32_t>(word).store(value, std::memory_order_release);
}

/* --- the process's table of mapped segments (mapping.cpp) ------------------ */

/* Maps the segment (object `fd`, identified by device and inode) at `addr`
 * for `length` bytes, or reuses this process's existing mapping of it, and
 * fills the handle's base, size and mapping. addr 0 lets the system choose.
 * A range the process already uses is never replaced: EEXIST. Returns 0, or
 * an errno value with nothing acquired. */
int attach_mapping(ShmHandle *h, dev_t dev, ino_t ino, uintptr_t addr, uint32_t length);

/* Drops the handle's reference; the last one unmaps the segment, and the
 * last read-write one turns the mapping back to read-only. */
void detach_mapping(ShmHandle *h);

/* The length of this process's mapping whose header lies at `base`, or 0. */
uint32_t mapped_length(const void *base);

/* The mmap that turns a read-only mapping read-write in place (tests put a
 * failing one here). */
extern void *(*upgrade_map)(void *, size_t, int, int, int, off_t);

/* --- the segment lock (lock.cpp) ------------------------------------------ */

/* Initialises the in-segment mutex process-shared and robust (robust where
 * the system offers it). Returns 0 or an errno value. */
int init_segment_mutex(pthread_mutex_t *mutex);

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
    void mark_busy();
    /* Clears busy (where set) and releases both locks now. */
    void release();

  private:
    bool lock_descriptor();
    bool lock_mutex();
    void unlock_descriptor();

    ShmHandle *handle_;
    int error_ = 0;
    bool flock_taken_ = false;
    bool mutex_taken_ = false;
    bool busy_set_ = false;
};

/* --- segments (segment.cpp) ------------------------------------------------ */

/* Whole segment length for a request of `size` data bytes; 0 when the 32-bit
 * computation would wrap. */
uint32_t segment_length(uint32_t size);

/* EINVAL unless the published header describes a segment that can be trusted
 * in an object of `object_length` bytes. */
int validate_header(uintptr_t base, uint32_t size, uint64_t object_length);

/* Greedy first division of the data area into free blocks, largest first. */
void divide_data_area(ShmHeader *h, uint32_t length);

/* --- buddy lists (buddy.cpp) ----------------------------------------------- */

/* Smallest class whose blocks hold n bytes plus the class word, or -1. */
int class_for(uint32_t n);

/* The class word below a block and what it names. */
inline uintptr_t *class_word_of(uintptr_t block) {
    return reinterpret_cast<uintptr_t *>(block - kClassWordSize);
}
inline uintptr_t class_word_for(const ShmHeader *h, int k) {
    return reinterpret_cast<uintptr_t>(&h->freeList[k]);
}

/* The data area as this process maps it: every link is checked against it,
 * never against what the (possibly damaged) header says. */
struct DataArea {
    uintptr_t start;
    uintptr_t length;
    int page_shift; // log2 of the page size
};
inline DataArea data_area_of(const void *header, uint32_t mapping_length, uintptr_t page) {
    return {reinterpret_cast<uintptr_t>(header) + page, mapping_length - page, std::countr_zero(page)};
}

/* Where a sound block of class k may lie in a data area. Blocks are aligned
 * to their size (to the page for blocks above one page, which is all that
 * a data area at a page-aligned address guarantees), so positions are
 * counted in units of that alignment: an address's slot is its offset in
 * the data area in those units, rotated so that an address off the
 * alignment, or below the area, gets a slot above every bound. A block
 * lies wholly below `end` (a slot: the end of the area, or the start of the
 * block above it in its list) exactly when its slot is below below(end), so
 * one unsigned compare checks range, alignment and overlap together. */
class ClassShape {
  public:
    ClassShape() = default;
    ClassShape(const DataArea &area, int k)
        : start_(area.start), shift_(std::min(k + kSmallestShift, area.page_shift)),
          step_((block_size(k) >> shift_) - 1), top_(below(area.length >> shift_)) {}
    uintptr_t slot(uintptr_t address) const { return std::rotr(address - start_, shift_); }
    uintptr_t below(uintptr_t end) const { return end > step_ ? end - step_ : 0; }
    bool spans_pages() const { return step_ != 0; }
    /* The bound for a block anywhere in the data area. */
    uintptr_t top() const { return top_; }
    /* Whether a block of the class may lie at `address`. */
    bool fits(uintptr_t address) const { return slot(address) < top_; }

  private:
    uintptr_t start_;
    int shift_;      // log2 of the alignment
    uintptr_t step_; // the block's size in slots, less one
    uintptr_t top_;
};

/* The one walk over a free list. Every entry is checked before it is
 * followed: a sound block of the class that ends at or below the start of
 * the one before it (so the walk visits at most length / size entries, the
 * blocks of the class that the data area can hold). On damage the cursor
 * stops (entry() 0) with damaged() set. */
class ListCursor {
  public:
    ListCursor(ShmHeader *h, const DataArea &area, int k) : ListCursor(h, k, ClassShape(area, k)) {}
    ListCursor(ShmHeader *h, int k, const ClassShape &shape)
        : link_(&h->freeList[k]), shape_(shape), bound_(shape.top()) {
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
        // 0, the end of the list, lies below the data area: out of bounds too.
        const uintptr_t slot = shape_.slot(next);
        if (slot < bound_) [[likely]] {
            entry_ = next;
            bound_ = slot;
            if (shape_.spans_pages()) [[unlikely]]
                bound_ = shape_.below(slot);
        } else {
            entry_ = 0;
            damaged_ = next != 0;
        }
    }

    uintptr_t *link_;
    uintptr_t entry_ = 0;
    ClassShape shape_;
    uintptr_t bound_; // the next entry's slot lies below this
    bool damaged_ = false;
};

/* The class that the class word below p names, where p is an aligned
 * address in the data area (the word is read only then), or -1. Whether a
 * block of that class may lie at p is ClassShape::fits. */
inline int class_named_below(const ShmHeader *h, const DataArea &area, uintptr_t p) {
    if (std::rotr(p - area.start, kSmallestShift) >= area.length >> kSmallestShift) return -1;
    // The slot's index, or a huge number when the word is not a slot's address.
    const uintptr_t index = std::rotr(*class_word_of(p) - class_word_for(h, 0), kWordShift);
    return index < kClassCount ? static_cast<int>(index) : -1;
}

} // namespace qorbu::shm

/* The process's one mapping of a segment (mapping.cpp), shared by all of
 * its handles. The data area and the shape of every class in it are worked
 * out once, when the segment is mapped, for the allocator's hot path. */
struct ShmMapping {
    dev_t dev;
    ino_t ino;
    uintptr_t base;
    uint32_t length;
    bool writable;
    int handles;
    int writers; // read-write handles among them
    ShmMapping *next;
    qorbu::shm::DataArea area;
    qorbu::shm::ClassShape shapes[qorbu::shm::kClassCount];
};

namespace qorbu::shm {

inline const DataArea &area_of(const ShmHandle *h) { return h->mapping->area; }
inline const ClassShape &shape_of(const ShmHandle *h, int k) { return h->mapping->shapes[k]; }

} // namespace qorbu::shm

#endif
