/* Buddy allocation of a segment's data area: 27 power-of-two size classes,
 * split on demand and merged back with free partners. */
#include "shm/shm_inspect_private.h"
#include "shm/shm_private.h"

#include <algorithm>
#include <bit>
#include <cerrno>
#include <cstdlib>

namespace qorbu::shm {

int class_for(uint32_t n) {
    // A free block holds its link word, and its last word is the class word
    // of the block above it: on 64-bit targets an 8-byte block cannot hold
    // both, so requests start at class 1 there.
    const uint64_t needed = std::max<uint64_t>(uint64_t{n} + kClassWordSize, 2 * kClassWordSize);
    const int k = std::bit_width(needed - 1) - kSmallestShift;
    return k < kClassCount ? k : -1;
}

namespace {

constexpr char kMismatchMessage[] = "ShmFree(): mismatched handle and pointer\n";
constexpr char kDoubleFreeMessage[] = "ShmFree(): double-free\n";

uintptr_t &next_of(uintptr_t block) { return *reinterpret_cast<uintptr_t *>(block); }

int first_non_empty_from(const ShmHeader *h, int k) {
    for (int j = k; j < kClassCount; j++) {
        if (h->freeList[j] != 0) return j;
    }
    return -1;
}

/* Takes the highest block of class j and splits it down to class k: the
 * upper halves become the only members of the (empty) lists in between.
 * 0 when list j is damaged; nothing has changed then. */
uintptr_t take_and_split(ShmHeader *h, int j, const ClassShape &shape, int k) {
    ListCursor cursor(h, j, shape);
    const uintptr_t block = cursor.entry();
    if (block != 0) cursor.advance();
    if (cursor.damaged()) return 0;
    h->freeList[j] = cursor.entry();
    for (int i = j - 1; i >= k; i--) {
        const uintptr_t upper = block + block_size(i);
        next_of(upper) = 0;
        h->freeList[i] = upper;
    }
    return block;
}

void report_mismatch() {
    const int saved = errno;
    fputs(kMismatchMessage, stderr);
    errno = saved;
}

[[noreturn]] void end_on_double_free(SegmentLock &lock) {
    // Other processes must still be able to use the segment.
    lock.release();
    fputs(kDoubleFreeMessage, stderr);
    exit(100);
}

/* Where p goes in list k: the link to rewrite and the neighbours. */
struct ListPosition {
    uintptr_t *link;       // the link that leads to the lower neighbour
    uintptr_t *upper_link; // the link that leads to the upper neighbour
    uintptr_t upper;       // 0 when none
    uintptr_t lower;       // 0 when none
    bool damaged;
};

// Inlined: ShmFree's walk is on the hot path.
[[gnu::always_inline]] inline ListPosition find_position(ShmHeader *h, int k, const ClassShape &shape,
                                                         uintptr_t p) {
    ListCursor cursor(h, k, shape);
    uintptr_t *upper_link = nullptr;
    while (cursor.entry() > p) {
        upper_link = cursor.link();
        cursor.advance();
    }
    // Past the head, the link that leads to the lower neighbour is the upper one's first word.
    const uintptr_t upper = upper_link != nullptr ? reinterpret_cast<uintptr_t>(cursor.link()) : 0;
    return {cursor.link(), upper_link, upper, cursor.entry(), cursor.damaged()};
}

/* Inserts p, of class k, in its list and merges it upward while its
 * partner is free; ends the process when p is already free. Each merge
 * writes the merged block's class word, which names the next class.
 * Returns 0, or kDamaged when a list on the way is damaged (p, or what it
 * merged into, is then in no list). */
int insert_and_merge(const ShmHandle *handle, uintptr_t p, int k, SegmentLock &lock) {
    ShmHeader *h = handle->base;
    for (;; k++) {
        const ListPosition pos = find_position(h, k, shape_of(handle, k), p);
        if (pos.damaged) return kDamaged;
        if (pos.lower == p) end_on_double_free(lock);
        next_of(p) = pos.lower;
        *pos.link = p;
        if (k == kLargestClass) return 0;
        const uintptr_t size = block_size(k);
        if ((p & (2 * size - 1)) != 0) {
            if (pos.lower == 0 || pos.lower != p - size) return 0;
            *pos.link = next_of(pos.lower);
            *class_word_of(pos.lower) = class_word_for(h, k + 1);
            p = pos.lower;
        } else {
            if (pos.upper == 0 || pos.upper != p + size) return 0;
            *pos.upper_link = pos.lower;
            *class_word_of(p) = class_word_for(h, k + 1);
        }
    }
}

} // namespace

} // namespace qorbu::shm

using namespace qorbu::shm;

extern "C" {

QORBU_API void *ShmAlloc(ShmHandle *h, uint32_t n) {
    const int k = n < kAllocLimit ? class_for(n) : -1;
    if (k < 0) {
        errno = ENOMEM;
        return nullptr;
    }
    SegmentLock lock(h);
    if (int err = lock.error()) {
        errno = err;
        return nullptr;
    }
    lock.mark_busy();
    ShmHeader *header = h->base;
    const int j = first_non_empty_from(header, k);
    const uintptr_t block = j < 0 ? 0 : take_and_split(header, j, shape_of(h, j), k);
    lock.release();
    if (block == 0) {
        errno = j < 0 ? ENOMEM : kDamaged;
        return nullptr;
    }
    *class_word_of(block) = class_word_for(header, k);
    return reinterpret_cast<void *>(block);
}

QORBU_API void ShmFree(ShmHandle *h, void *p) {
    if (p == nullptr) return;
    const uintptr_t block = reinterpret_cast<uintptr_t>(p);
    const int k = class_named_below(h->base, area_of(h), block);
    if (k < 0 || !shape_of(h, k).fits(block)) {
        report_mismatch();
        return;
    }
    const uintptr_t word = *class_word_of(block);
    SegmentLock lock(h);
    if (int err = lock.error()) {
        errno = err;
        return;
    }
    // Another thread may have overwritten the class word meanwhile.
    if (*class_word_of(block) != word) {
        lock.release();
        report_mismatch();
        return;
    }
    lock.mark_busy();
    if (int err = insert_and_merge(h, block, k, lock)) {
        lock.release();
        errno = err;
    }
}

QORBU_API uint32_t ShmTotalFree(ShmHandle *h) {
    SegmentLock lock(h);
    if (int err = lock.error()) {
        errno = err;
        return 0;
    }
    uint32_t total = 0;
    for (int k = 0; k < kClassCount; k++) {
        ListCursor cursor(h->base, k, shape_of(h, k));
        for (; cursor.entry() != 0; cursor.advance()) total += static_cast<uint32_t>(block_size(k));
        if (cursor.damaged()) {
            lock.release();
            errno = kDamaged;
            return 0;
        }
    }
    return total;
}

QORBU_API void ShmPrintFree(FILE *stream, ShmHeader *header) {
    // The lists are checked against the process's own mapping of the segment.
    const uint32_t length = mapped_length(header);
    const uintptr_t page = page_size();
    bool damaged = length == 0;
    for (int k = 0; k < kClassCount; k++) {
        fprintf(stream, "0x%08x [%d] = { ", static_cast<unsigned>(block_size(k)), k);
        if (length != 0) {
            ListCursor cursor(header, data_area_of(header, length, page), k);
            while (cursor.entry() != 0) {
                const uintptr_t e = cursor.entry();
                cursor.advance();
                fprintf(stream, "%p%s ", reinterpret_cast<void *>(e), cursor.entry() != 0 ? "," : "");
            }
            damaged = damaged || cursor.damaged();
        }
        fputs("}\n", stream);
    }
    if (damaged) errno = kDamaged;
}

__attribute__((visibility("hidden"))) int qorbu_shm_summarise(const ShmHandle *h, ShmFreeSummary *summary) {
    *summary = ShmFreeSummary{0, 0, 0};
    for (int k = 0; k < kClassCount; k++) {
        ListCursor cursor(h->base, k, shape_of(h, k));
        for (; cursor.entry() != 0; cursor.advance()) {
            summary->free_bytes += static_cast<uint32_t>(block_size(k));
            summary->blocks++;
            summary->largest = static_cast<uint32_t>(block_size(k));
        }
        if (cursor.damaged()) return kDamaged;
    }
    return 0;
}

__attribute__((visibility("hidden"))) ShmBlockState qorbu_shm_block_state(const ShmHandle *h, const void *p) {
    const uintptr_t block = reinterpret_cast<uintptr_t>(p);
    const int k = class_named_below(h->base, area_of(h), block);
    if (k < 0 || !shape_of(h, k).fits(block)) return SHM_BLOCK_FOREIGN;
    const ListPosition pos = find_position(h->base, k, shape_of(h, k), block);
    if (pos.damaged) return SHM_BLOCK_DAMAGED;
    return pos.lower == block ? SHM_BLOCK_FREE : SHM_BLOCK_ALLOCATED;
}

} // extern "C"
