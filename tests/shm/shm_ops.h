/* A plain model of the buddy lists, and the random operation run that the
 * seeded test and the fuzz target drive. */
#ifndef QORBU_TESTS_SHM_SHM_OPS_H
#define QORBU_TESTS_SHM_SHM_OPS_H

#include "shm/shm.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <map>
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
    /* The block ShmAlloc must return, 0 for ENOMEM. */
    uintptr_t alloc(uint32_t n) {
        int k = sizeof(uintptr_t) == 8 ? 1 : 0;
        while (k < kClasses && n + uint64_t{sizeof(uintptr_t)} > class_bytes(k)) k++;
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
    std::set<uintptr_t, std::greater<>> lists[kClasses];
    std::map<uintptr_t, int> live; // block -> class
};

/* Where the segment's lists (walked no further than the model's plus one) differ. */
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

/* Random operations, each checked. With `modelled` false other processes share
 * the segment: only patterns and errors are checked. A segment that the library
 * `placed` has its data area aligned to its size: freed, it is as fresh. */
class OperationRun {
  public:
    OperationRun(ShmHandle *h, bool placed, bool modelled = true)
        : h_(h), model_(h), placed_(placed), modelled_(modelled) {}

    /* `count` operations chosen by random numbers from rng, then every live block freed. */
    template <typename Rng>
    std::string run(Rng &rng, int count, uint32_t arg_mask = ~0u) {
        std::string broken;
        for (int op = 0; op < count && broken.empty(); op++) broken = step(rng() % 8, rng() & arg_mask);
        while (broken.empty() && !live_.empty()) broken = release(live_.size() - 1) ?: "";
        if (!broken.empty() || !modelled_) return broken;
        const uint32_t length = h_->size - static_cast<uint32_t>(page_bytes());
        if (placed_) model_ = BuddyModel(h_);
        broken = list_difference(h_->base, model_);
        return broken.empty() && ShmTotalFree(h_) != length ? "not every byte came back" : broken;
    }

  private:
    std::string step(uint32_t kind, uint32_t arg) {
        const char *broken = kind < 4 || live_.empty() ? alloc((arg >> 5) & ((1u << arg % 26) - 1))
                             : kind < 6                ? release(arg % live_.size())
                             : kind < 7                ? free_inside(live_[arg % live_.size()], arg / 32)
                                                       : alloc(arg); // mostly sizes that no class holds
        if (broken != nullptr || !modelled_) return broken != nullptr ? broken : "";
        if (h_->base->busy != 0) return "busy left set";
        if (pthread_mutex_trylock(&h_->base->mutex) != 0) return "the segment mutex was left locked";
        pthread_mutex_unlock(&h_->base->mutex);
        return list_difference(h_->base, model_);
    }

    struct Live {
        unsigned char *p;
        uint32_t n;
        unsigned char fill; // odd: a word of it never names a list
    };

    const char *alloc(uint32_t n) {
        const uintptr_t expected = modelled_ ? model_.alloc(n) : 0;
        errno = 0;
        auto *p = static_cast<unsigned char *>(ShmAlloc(h_, n));
        if (p == nullptr)
            return expected == 0 && errno == ENOMEM ? nullptr : "ShmAlloc failed unlike the model";
        if (modelled_ && reinterpret_cast<uintptr_t>(p) != expected) return "ShmAlloc differs from the model";
        const uintptr_t slot = reinterpret_cast<uintptr_t>(&h_->base->freeList[model_.live[expected]]);
        if (modelled_ && reinterpret_cast<uintptr_t *>(p)[-1] != slot)
            return "the class word names another list";
        live_.push_back({p, n, static_cast<unsigned char>(getpid() * 8 + live_.size() * 2 + 1)});
        memset(p, live_.back().fill, n);
        return nullptr;
    }

    const char *release(size_t i) {
        const Live l = live_[i];
        live_[i] = live_.back();
        live_.pop_back();
        if (std::any_of(l.p, l.p + l.n, [&](unsigned char b) { return b != l.fill; }))
            return "a block lost its pattern";
        if (modelled_) model_.free(reinterpret_cast<uintptr_t>(l.p));
        errno = 0;
        ShmFree(h_, l.p);
        return errno == 0 ? nullptr : "ShmFree set errno";
    }

    /* A pointer inside a block, its word below the caller's: refused, changing nothing. */
    const char *free_inside(const Live &l, uint32_t choice) {
        const uint32_t words = l.n / sizeof(uintptr_t);
        errno = 0;
        if (words >= 2) ShmFree(h_, l.p + sizeof(uintptr_t) * (1 + choice % (words - 1)));
        return errno == 0 ? nullptr : "ShmFree set errno for an inner pointer";
    }

    ShmHandle *h_;
    BuddyModel model_;
    bool placed_, modelled_;
    std::vector<Live> live_;
};

} // namespace qorbu::test

#endif
