/* A plain reference model of the buddy lists, and the random operation run
 * that the seeded test and the fuzz target both drive: after every operation
 * the lists must be the model's, busy and the mutex free, and every freed
 * block must still hold the pattern written into it. */
#ifndef QORBU_TESTS_SHM_SHM_OPS_H
#define QORBU_TESTS_SHM_SHM_OPS_H

#include "shm/shm.h"

#include <algorithm>
#include <bit>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <map>
#include <pthread.h>
#include <set>
#include <string>
#include <unistd.h>
#include <vector>

namespace qorbu::test {

constexpr int kClasses = 27;
inline uintptr_t class_bytes(int k) { return uintptr_t{8} << k; }
inline uintptr_t page_bytes() { return static_cast<uintptr_t>(getpagesize()); }
inline uintptr_t partner(uintptr_t block, int k) {
    return block % (2 * class_bytes(k)) == 0 ? block + class_bytes(k) : block - class_bytes(k);
}

class BuddyModel {
  public:
    explicit BuddyModel(const ShmHandle *h) {
        const uintptr_t end = reinterpret_cast<uintptr_t>(h->base) + h->size;
        uintptr_t at = reinterpret_cast<uintptr_t>(h->base) + page_bytes();
        for (int k = kClasses - 1; k >= 0; k--) {
            for (; end - at >= class_bytes(k); at += class_bytes(k)) lists[k].insert(at);
        }
    }
    /* The block ShmAlloc must return, 0 for ENOMEM. A block keeps its link
     * word clear of the class word of the block above it. */
    uintptr_t alloc(uint32_t n) {
        int k = 0;
        while (k < kClasses &&
               (n + uint64_t{sizeof(uintptr_t)} > class_bytes(k) || class_bytes(k) < 2 * sizeof(uintptr_t)))
            k++;
        int j = k;
        while (j < kClasses && lists[j].empty()) j++;
        if (n >= 0x40000000u || j >= kClasses) return 0;
        const uintptr_t block = *lists[j].begin();
        lists[j].erase(lists[j].begin());
        while (--j >= k) lists[j].insert(block + class_bytes(j));
        live[block] = k;
        return block;
    }
    void free(uintptr_t block) {
        int k = live.at(block);
        live.erase(block);
        for (; k < kClasses - 1 && lists[k].erase(partner(block, k)) == 1; k++)
            block = std::min(block, partner(block, k));
        lists[k].insert(block);
    }
    uint32_t free_bytes() const {
        uint32_t total = 0;
        for (int k = 0; k < kClasses; k++) total += static_cast<uint32_t>(lists[k].size() * class_bytes(k));
        return total;
    }
    std::set<uintptr_t, std::greater<>> lists[kClasses];
    std::map<uintptr_t, int> live; // block -> class
};

/* Differences between the segment's lists (each walked no further than the
 * model's list plus one) and the model's. */
inline std::string list_difference(const ShmHeader *h, const BuddyModel &model) {
    for (int k = 0; k < kClasses; k++) {
        std::vector<uintptr_t> walked;
        for (uintptr_t e = h->freeList[k]; e != 0 && walked.size() <= model.lists[k].size();
             e = *reinterpret_cast<const uintptr_t *>(e))
            walked.push_back(e);
        if (!std::equal(walked.begin(), walked.end(), model.lists[k].begin(), model.lists[k].end()))
            return "list " + std::to_string(k) + " differs from the model's";
    }
    return "";
}

/* ShmFree with standard error caught; returns what it wrote there. */
inline std::string free_catching_stderr(ShmHandle *h, void *p) {
    char text[128] = "";
    FILE *saved = stderr;
    stderr = fmemopen(text, sizeof text - 1, "w");
    ShmFree(h, p);
    fclose(stderr);
    stderr = saved;
    return text;
}

class OperationRun {
  public:
    explicit OperationRun(ShmHandle *h) : h_(h), model_(h) {}

    /* One operation chosen by op, with arg as its size or choice; "" or what went wrong. */
    std::string step(uint32_t op, uint32_t arg) {
        std::string broken;
        switch (op % 8) {
        case 0:
        case 1:
        case 2:
        case 3: broken = alloc((arg >> 5) & ((1u << arg % 26) - 1)); break;
        case 4:
        case 5: broken = live_.empty() ? "" : release(arg % live_.size()); break;
        case 6: broken = free_interior(arg); break;
        default:
            if (ShmTotalFree(h_) != model_.free_bytes()) return "ShmTotalFree differs from the model";
            broken = alloc(arg); // mostly sizes no class holds
        }
        if (!broken.empty()) return broken;
        if (h_->base->busy != 0) return "busy left set";
        if (pthread_mutex_trylock(&h_->base->mutex) != 0) return "the segment mutex was left locked";
        pthread_mutex_unlock(&h_->base->mutex);
        return list_difference(h_->base, model_);
    }

    /* Frees every live block. Where the data area is aligned to its size
     * (segments the library places), the lists must then be a fresh segment's. */
    std::string finish() {
        while (!live_.empty()) {
            if (std::string broken = release(live_.size() - 1); !broken.empty()) return broken;
        }
        const uintptr_t data = reinterpret_cast<uintptr_t>(ShmAddr(h_)), length = h_->size - page_bytes();
        const uintptr_t span = std::min(std::bit_ceil(length), class_bytes(kClasses - 1));
        if (data % span == 0) model_ = BuddyModel(h_);
        if (std::string broken = list_difference(h_->base, model_); !broken.empty()) return broken;
        return ShmTotalFree(h_) == length ? "" : "not every byte came back";
    }

  private:
    struct Live {
        uintptr_t block;
        uint32_t n;
        unsigned char fill() const { return static_cast<unsigned char>(block >> 3 | 1); }
        bool intact() const {
            const auto *bytes = reinterpret_cast<const unsigned char *>(block);
            return std::all_of(bytes, bytes + n, [&](unsigned char b) { return b == fill(); });
        }
    };

    std::string alloc(uint32_t n) {
        const uintptr_t expected = model_.alloc(n);
        errno = 0;
        const auto got = reinterpret_cast<uintptr_t>(ShmAlloc(h_, n));
        if (got != expected)
            return "ShmAlloc(" + std::to_string(n) + ") returned another block than the model";
        if (got == 0)
            return errno == ENOMEM ? "" : "ShmAlloc(" + std::to_string(n) + ") failed without ENOMEM";
        if (reinterpret_cast<uintptr_t *>(got)[-1] !=
            reinterpret_cast<uintptr_t>(&h_->base->freeList[model_.live[got]]))
            return "the class word does not name the block's list";
        live_.push_back({got, n});
        memset(reinterpret_cast<void *>(got), live_.back().fill(), n);
        return "";
    }

    std::string release(size_t i) {
        const Live l = live_[i];
        live_[i] = live_.back();
        live_.pop_back();
        if (!l.intact()) return "a live block lost its pattern";
        model_.free(l.block);
        errno = 0;
        ShmFree(h_, reinterpret_cast<void *>(l.block));
        return errno == 0 ? "" : "ShmFree set errno " + std::to_string(errno);
    }

    /* A pointer inside a live block, its word below the caller's (odd)
     * pattern: no block, so ShmFree must refuse it and change nothing. */
    std::string free_interior(uint32_t arg) {
        if (live_.empty()) return "";
        const Live &l = live_[arg % live_.size()];
        if (l.n < 2 * sizeof(uintptr_t)) return "";
        const uintptr_t p = l.block + sizeof(uintptr_t) * (1 + arg / 32 % (l.n / sizeof(uintptr_t) - 1));
        if (free_catching_stderr(h_, reinterpret_cast<void *>(p)) !=
            "ShmFree(): mismatched handle and pointer\n")
            return "a pointer inside a block was not refused";
        return "";
    }

    ShmHandle *h_;
    BuddyModel model_;
    std::vector<Live> live_;
};

} // namespace qorbu::test

#endif
