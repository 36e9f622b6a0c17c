/* Buddy allocation of a segment's data area: 27 power-of-two size classes,
 * split on demand and merged back with free partners. */
#include "shm/shm_private.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>

namespace qorbu::shm {

int classFor(uint32_t n) {
    // A free block holds its link word, and its last word is the class word
    // of the block above it: on 64-bit targets an 8-byte block cannot hold
    // both, so requests start at class 1 there.
    const uint64_t needed = std::max<uint64_t>(uint64_t{n} + kClassWordSize, 2 * kClassWordSize);
    for (int k = 0; k < kClassCount; k++) {
        if (needed <= blockSize(k)) return k;
    }
    return -1;
}

namespace {

constexpr char kMismatchMessage[] = "ShmFree(): mismatched handle and pointer\n";
constexpr char kDoubleFreeMessage[] = "ShmFree(): double-free\n";

uintptr_t &nextOf(uintptr_t block) { return *reinterpret_cast<uintptr_t *>(block); }

uintptr_t popHead(ShmHeader *h, int k) {
    const uintptr_t block = h->freeList[k];
    h->freeList[k] = nextOf(block);
    return block;
}

int firstNonEmptyFrom(const ShmHeader *h, int k) {
    for (int j = k; j < kClassCount; j++) {
        if (h->freeList[j] != 0) return j;
    }
    return -1;
}

/* Takes the highest block of class j and splits it down to class k: the
 * upper halves become the only members of the (empty) lists in between. */
uintptr_t takeAndSplit(ShmHeader *h, int j, int k) {
    const uintptr_t block = popHead(h, j);
    for (int i = j - 1; i >= k; i--) {
        const uintptr_t upper = block + blockSize(i);
        nextOf(upper) = 0;
        h->freeList[i] = upper;
    }
    return block;
}

/* The class whose freeList slot the word names, or -1 for any other word. */
int classNamedBy(const ShmHeader *h, uintptr_t word) {
    const uintptr_t first = classWordFor(h, 0);
    if (word < first || (word - first) % sizeof(uintptr_t) != 0) return -1;
    const uintptr_t k = (word - first) / sizeof(uintptr_t);
    return k < static_cast<uintptr_t>(kClassCount) ? static_cast<int>(k) : -1;
}

/* Whether p can be a block that ShmAlloc handed out through this handle:
 * inside its data area, and with a class word that names a freeList slot
 * of its header and a block that fits the segment. Reads nothing outside
 * the handle's mapping. */
bool ownsBlock(const ShmHandle *handle, uintptr_t p) {
    const uintptr_t base = reinterpret_cast<uintptr_t>(handle->base);
    const uintptr_t page = pageSize();
    const uintptr_t end = base + handle->size;
    if (p < base + page || p >= end || p % kSmallestBlock != 0) return false;
    const uintptr_t word = *classWordOf(p);
    if ((word & ~(page - 1)) != base) return false;
    const int k = classNamedBy(handle->base, word);
    return k >= 0 && blockSize(k) <= end - p;
}

void reportMismatch() {
    const int saved = errno;
    fputs(kMismatchMessage, stderr);
    errno = saved;
}

[[noreturn]] void endOnDoubleFree(SegmentLock &lock) {
    // Other processes must still be able to use the segment.
    lock.release();
    fputs(kDoubleFreeMessage, stderr);
    exit(100);
}

/* Where p goes in list k: the link to rewrite and the neighbours. */
struct ListPosition {
    uintptr_t *link;       // the link that leads to the lower neighbour
    uintptr_t *upperLink;  // the link that leads to the upper neighbour
    uintptr_t upper;       // 0 when none
    uintptr_t lower;       // 0 when none
};

ListPosition findPosition(ShmHeader *h, int k, uintptr_t p) {
    ListPosition pos{&h->freeList[k], nullptr, 0, 0};
    while (*pos.link != 0 && *pos.link > p) {
        pos.upperLink = pos.link;
        pos.upper = *pos.link;
        pos.link = &nextOf(pos.upper);
    }
    pos.lower = *pos.link;
    return pos;
}

/* Inserts p in its class's list and merges it upward while its partner is
 * free; ends the process when p is already free. */
void insertAndMerge(ShmHeader *h, uintptr_t p, SegmentLock &lock) {
    for (;;) {
        const int k = classNamedBy(h, *classWordOf(p));
        const ListPosition pos = findPosition(h, k, p);
        if (pos.lower == p) endOnDoubleFree(lock);
        nextOf(p) = pos.lower;
        *pos.link = p;
        if (k == kLargestClass) return;
        const uintptr_t size = blockSize(k);
        if (p % (2 * size) != 0) {
            if (pos.lower == 0 || pos.lower != p - size) return;
            *pos.link = nextOf(pos.lower);
            *classWordOf(pos.lower) = classWordFor(h, k + 1);
            p = pos.lower;
        } else {
            if (pos.upper == 0 || pos.upper != p + size) return;
            *pos.upperLink = pos.lower;
            *classWordOf(p) = classWordFor(h, k + 1);
        }
    }
}

} // namespace

} // namespace qorbu::shm

using namespace qorbu::shm;

extern "C" {

QORBU_API void *ShmAlloc(ShmHandle *h, uint32_t n) {
    const int k = n < kAllocLimit ? classFor(n) : -1;
    if (k < 0) {
        errno = ENOMEM;
        return nullptr;
    }
    SegmentLock lock(h);
    if (int err = lock.error()) {
        errno = err;
        return nullptr;
    }
    lock.markBusy();
    ShmHeader *header = h->base;
    const int j = firstNonEmptyFrom(header, k);
    if (j < 0) {
        lock.release();
        errno = ENOMEM;
        return nullptr;
    }
    const uintptr_t block = takeAndSplit(header, j, k);
    lock.release();
    *classWordOf(block) = classWordFor(header, k);
    return reinterpret_cast<void *>(block);
}

QORBU_API void ShmFree(ShmHandle *h, void *p) {
    if (p == nullptr) return;
    const uintptr_t block = reinterpret_cast<uintptr_t>(p);
    if (!ownsBlock(h, block)) {
        reportMismatch();
        return;
    }
    SegmentLock lock(h);
    if (int err = lock.error()) {
        errno = err;
        return;
    }
    lock.markBusy();
    insertAndMerge(h->base, block, lock);
}

QORBU_API uint32_t ShmTotalFree(ShmHandle *h) {
    SegmentLock lock(h);
    if (int err = lock.error()) {
        errno = err;
        return 0;
    }
    uint32_t total = 0;
    for (int k = 0; k < kClassCount; k++) {
        for (uintptr_t e = h->base->freeList[k]; e != 0; e = nextOf(e)) {
            total += static_cast<uint32_t>(blockSize(k));
        }
    }
    return total;
}

QORBU_API void ShmPrintFree(FILE *stream, ShmHeader *header) {
    for (int k = 0; k < kClassCount; k++) {
        fprintf(stream, "0x%08x [%d] = { ", static_cast<unsigned>(blockSize(k)), k);
        for (uintptr_t e = header->freeList[k]; e != 0; e = nextOf(e)) {
            fprintf(stream, "%p%s ", reinterpret_cast<void *>(e), nextOf(e) != 0 ? "," : "");
        }
        fputs("}\n", stream);
    }
}

} // extern "C"
