/* Random operation sequences against the reference model: after every
 * operation the lists equal the model's, stay strictly descending, keep no
 * free partners apart and tile the data area with the allocated blocks. */
#include "shm/shm.h"
#include "shm_model.h"
#include "shm_test_util.h"

#include <gtest/gtest.h>
#include <random>

using namespace qorbu::test;

namespace {

/* On an aligned segment freeing everything must restore the fresh lists. */
void runSequence(uint32_t dataBytes, unsigned seed, int operations, bool aligned) {
    NameGuard name("model");
    ShmHandle *h = aligned ? createAligned(name.c_str(), dataBytes) : ShmCreate(name.c_str(), nullptr, dataBytes);
    ASSERT_NE(h, nullptr);
    BuddyModel model(reinterpret_cast<uintptr_t>(h->base), h->size);
    ASSERT_TRUE(listsMatch(h->base, model)) << "fresh segment";
    std::mt19937 rng(seed);
    std::vector<std::pair<uintptr_t, uint32_t>> live; // block, bytes written
    for (int op = 0; op < operations; op++) {
        SCOPED_TRACE("op " + std::to_string(op));
        if (live.empty() || std::uniform_int_distribution<int>(0, 99)(rng) < 55) {
            // Log-uniform sizes: as many tiny as large requests.
            const int bits = std::uniform_int_distribution<int>(0, 31 - __builtin_clz(dataBytes))(rng);
            const uint32_t n = std::uniform_int_distribution<uint32_t>(0, (2u << bits) - 1)(rng) % (dataBytes + 1);
            const uintptr_t expected = model.alloc(n);
            errno = 0;
            const uintptr_t got = reinterpret_cast<uintptr_t>(ShmAlloc(h, n));
            ASSERT_EQ(got, expected) << "alloc " << n;
            if (got == 0) {
                ASSERT_EQ(errno, ENOMEM);
                continue;
            }
            ASSERT_EQ(classWordAt(got), slotAddress(h->base, model.classOf(got)));
            fillPattern(reinterpret_cast<void *>(got), n, uint32_t(got >> 3));
            live.emplace_back(got, n);
        } else {
            const size_t i = std::uniform_int_distribution<size_t>(0, live.size() - 1)(rng);
            const auto [block, n] = live[i];
            ASSERT_TRUE(patternIntact(reinterpret_cast<void *>(block), n, uint32_t(block >> 3)));
            live[i] = live.back();
            live.pop_back();
            model.free(block);
            ShmFree(h, reinterpret_cast<void *>(block));
        }
        ASSERT_TRUE(listsMatch(h->base, model));
        ASSERT_EQ(checkLists(h->base, model.allocated()), "");
    }
    for (const auto &[block, n] : live) {
        model.free(block);
        ShmFree(h, reinterpret_cast<void *>(block));
    }
    EXPECT_TRUE(listsMatch(h->base, model));
    EXPECT_EQ(checkLists(h->base, {}), "");
    if (aligned) {
        EXPECT_TRUE(listsMatch(h->base, BuddyModel(reinterpret_cast<uintptr_t>(h->base), h->size)))
            << "all freed: the lists of a fresh segment";
    }
    EXPECT_EQ(ShmTotalFree(h), h->size - pageBytes());
    ShmClose(h);
}

} // namespace

TEST(ShmModel, RandomSequencesOnSegmentsOfManyShapes) {
    const uint32_t page = uint32_t(pageBytes());
    const struct {
        uint32_t bytes;
        bool aligned;
    } shapes[] = {{page, false},       {5 * page, false},       {20480, false},       {37 * page, false},
                  {(1u << 20) + 3 * page, false}, {(4u << 20) - page, false}, {page, true},
                  {1u << 16, true},    {1u << 20, true},        {4u << 20, true}};
    unsigned seed = 1;
    for (const auto &s : shapes) {
        SCOPED_TRACE("data bytes " + std::to_string(s.bytes) + (s.aligned ? ", aligned" : ""));
        runSequence(s.bytes, seed++, scaled(4000, 800), s.aligned);
        if (HasFatalFailure()) return;
    }
}
