/* A plain reference model of the buddy lists and an independent checker of
 * a segment's free lists, shared by the allocator's tests and fuzz target. */
#ifndef QORBU_TESTS_SHM_SHM_MODEL_H
#define QORBU_TESTS_SHM_SHM_MODEL_H

#include "shm/shm.h"

#include <algorithm>
#include <cstdint>
#include <functional>
#include <map>
#include <set>
#include <string>
#include <unistd.h>
#include <vector>

namespace qorbu::test {

constexpr int kClasses = 27;

inline uintptr_t classBytes(int k) { return uintptr_t{8} << k; }

/* The smallest class holding n bytes and the class word below, and whose
 * free blocks keep their link apart from the next block's class word. */
inline int modelClassFor(uint32_t n) {
    for (int k = 0; n < 0x40000000u && k < kClasses; k++) {
        if (uint64_t{n} + sizeof(uintptr_t) <= classBytes(k) && 2 * sizeof(uintptr_t) <= classBytes(k))
            return k;
    }
    return -1;
}

inline uintptr_t partnerOf(uintptr_t block, int k) {
    return block % (2 * classBytes(k)) == 0 ? block + classBytes(k) : block - classBytes(k);
}

/* Free lists as sets (highest address first) and allocated blocks by address. */
class BuddyModel {
  public:
    BuddyModel(uintptr_t header, uint32_t length) {
        uintptr_t position = header + static_cast<uintptr_t>(getpagesize());
        for (int k = kClasses - 1; k >= 0; k--) {
            for (; header + length - position >= classBytes(k); position += classBytes(k))
                lists_[k].insert(position);
        }
    }

    /* What ShmAlloc must return for n (0 for ENOMEM). */
    uintptr_t alloc(uint32_t n) {
        const int k = modelClassFor(n);
        int j = k;
        while (k >= 0 && j < kClasses && lists_[j].empty()) j++;
        if (k < 0 || j == kClasses) return 0;
        const uintptr_t block = *lists_[j].begin();
        lists_[j].erase(lists_[j].begin());
        for (int i = j - 1; i >= k; i--) lists_[i].insert(block + classBytes(i));
        allocated_[block] = k;
        return block;
    }

    void free(uintptr_t block) {
        int k = allocated_.at(block);
        allocated_.erase(block);
        for (; k < kClasses - 1 && lists_[k].erase(partnerOf(block, k)) == 1; k++) {
            block = std::min(block, partnerOf(block, k));
        }
        lists_[k].insert(block);
    }

    const std::set<uintptr_t, std::greater<>> &list(int k) const { return lists_[k]; }
    const std::map<uintptr_t, int> &allocated() const { return allocated_; }
    int classOf(uintptr_t block) const { return allocated_.at(block); }

  private:
    std::set<uintptr_t, std::greater<>> lists_[kClasses];
    std::map<uintptr_t, int> allocated_;
};

/* Walks list k of a header, at most `limit` entries (a cycle stops there). */
inline std::vector<uintptr_t> walkList(const ShmHeader *h, int k, size_t limit = 1u << 20) {
    std::vector<uintptr_t> entries;
    for (uintptr_t e = h->freeList[k]; e != 0 && entries.size() < limit;
         e = *reinterpret_cast<const uintptr_t *>(e)) {
        entries.push_back(e);
    }
    return entries;
}

/* Checks the lists without trusting the allocator's code: every list
 * strictly descending and inside the data area, no two free partners left
 * unmerged, and free plus allocated blocks tiling the data area exactly.
 * Returns an empty string, or what is wrong. */
inline std::string checkLists(const ShmHeader *h, const std::map<uintptr_t, int> &allocated) {
    const uintptr_t dataStart = h->base + static_cast<uintptr_t>(getpagesize());
    const uintptr_t end = h->base + h->size;
    std::vector<std::pair<uintptr_t, uintptr_t>> pieces; // start, length
    std::set<std::pair<int, uintptr_t>> free;
    for (int k = 0; k < kClasses; k++) {
        const std::vector<uintptr_t> entries = walkList(h, k, (end - dataStart) / 8 + 1);
        for (size_t i = 0; i < entries.size(); i++) {
            const uintptr_t e = entries[i];
            if (i > 0 && entries[i - 1] <= e) return "list " + std::to_string(k) + " not descending";
            if (e < dataStart || e > end || end - e < classBytes(k)) {
                return "list " + std::to_string(k) + " leaves the data area";
            }
            pieces.emplace_back(e, classBytes(k));
            free.emplace(k, e);
        }
    }
    // A block not aligned to its own size (the data area starts on a page)
    // can name a partner that does not name it back; two free blocks that
    // name each other must have merged.
    for (const auto &[k, e] : free) {
        if (k < kClasses - 1 && free.count({k, partnerOf(e, k)}) != 0 && partnerOf(partnerOf(e, k), k) == e) {
            return "unmerged partners in list " + std::to_string(k);
        }
    }
    for (const auto &[block, k] : allocated) pieces.emplace_back(block, classBytes(k));
    std::sort(pieces.begin(), pieces.end());
    uintptr_t expected = dataStart;
    for (const auto &[start, length] : pieces) {
        if (start != expected) return "blocks overlap or leave a gap";
        expected = start + length;
    }
    return expected == end ? "" : "blocks do not reach the end of the data area";
}

/* Whether the segment's lists are exactly those of the model. */
inline bool listsMatch(const ShmHeader *h, const BuddyModel &model) {
    for (int k = 0; k < kClasses; k++) {
        const auto &expected = model.list(k);
        const std::vector<uintptr_t> entries(expected.begin(), expected.end());
        if (walkList(h, k, expected.size() + 1) != entries) return false;
    }
    return true;
}

} // namespace qorbu::test

#endif
