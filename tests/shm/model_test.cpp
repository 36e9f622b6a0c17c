/* Random operation sequences against the reference model: after every
 * operation the lists equal the model's, stay strictly descending, keep no
 * free partners apart and tile the data area with the allocated blocks. */
#include "shm/shm.h"
#include "shm_model.h"
#include "shm_test_util.h"

#include <cstring>
#include <gtest/gtest.h>
#include <random>

using namespace qorbu::test;

namespace {

uint32_t randomSize(std::mt19937 &rng, uint32_t largest) {
    // Log-uniform: as many tiny as large requests.
    const int bits = std::uniform_int_distribution<int>(0, 31 - __builtin_clz(largest))(rng);
    return std::uniform_int_distribution<uint32_t>(0, (2u << bits) - 1)(rng) % (largest + 1);
}

void fill(uintptr_t block, uint32_t n, unsigned char seed) {
    memset(reinterpret_cast<void *>(block), seed, n);
}

bool intact(uintptr_t block, uint32_t n, unsigned char seed) {
    const auto *bytes = reinterpret_cast<const unsigned char *>(block);
    for (uint32_t i = 0; i < n; i++) {
        if (bytes[i] != seed) return false;
    }
    return true;
}

/* On an aligned segment (data area on a multiple of its power-of-two size)
 * freeing everything must restore the fresh lists. */
void runSequence(uint32_t dataBytes, unsigned seed, int operations, bool aligned) {
    NameGuard name("model");
    ShmHandle *h = aligned ? createAligned(name.c_str(), dataBytes) : ShmCreate(name.c_str(), nullptr, dataBytes);
    ASSERT_NE(h, nullptr);
    BuddyModel model(reinterpret_cast<uintptr_t>(h->base), h->size);
    ASSERT_TRUE(listsMatch(h->base, model)) << "fresh segment";
    std::mt19937 rng(seed);
    std::vector<std::pair<uintptr_t, uint32_t>> live;  // block, bytes written

    for (int op = 0; op < operations; op++) {
        const bool allocate = live.empty() || std::uniform_int_distribution<int>(0, 99)(rng) < 55;
        if (allocate) {
            const uint32_t n = randomSize(rng, dataBytes);
            const uintptr_t expected = model.alloc(n);
            errno = 0;
            const uintptr_t got = reinterpret_cast<uintptr_t>(ShmAlloc(h, n));
            ASSERT_EQ(got, expected) << "op " << op << " alloc " << n;
            if (got == 0) {
                ASSERT_EQ(errno, ENOMEM);
                continue;
            }
            ASSERT_EQ(classWordAt(got), slotAddress(h->base, model.classOf(got)));
            fill(got, n, static_cast<unsigned char>(got >> 3));
            live.emplace_back(got, n);
        } else {
            const size_t i = std::uniform_int_distribution<size_t>(0, live.size() - 1)(rng);
            const auto [block, n] = live[i];
            ASSERT_TRUE(intact(block, n, static_cast<unsigned char>(block >> 3))) << "op " << op;
            live[i] = live.back();
            live.pop_back();
            model.free(block);
            ShmFree(h, reinterpret_cast<void *>(block));
        }
        if (!listsMatch(h->base, model)) {
            for (int k = 0; k < kClasses; k++) {
                std::string a, b;
                for (uintptr_t e : walkList(h->base, k, 100)) a += std::to_string(e - reinterpret_cast<uintptr_t>(h->base)) + " ";
                for (uintptr_t e : model.list(k)) b += std::to_string(e - reinterpret_cast<uintptr_t>(h->base)) + " ";
                if (a != b) std::printf("class %d: shm { %s} model { %s}\n", k, a.c_str(), b.c_str());
            }
        }
        ASSERT_TRUE(listsMatch(h->base, model)) << "op " << op << (allocate ? " alloc" : " free");
        const std::string broken = checkLists(h->base, model.allocated());
        ASSERT_EQ(broken, "") << "op " << op;
    }
    for (const auto &[block, n] : live) {
        model.free(block);
        ShmFree(h, reinterpret_cast<void *>(block));
    }
    EXPECT_TRUE(listsMatch(h->base, model));
    EXPECT_EQ(checkLists(h->base, {}), "");
    const BuddyModel fresh(reinterpret_cast<uintptr_t>(h->base), h->size);
    if (aligned) {
        EXPECT_TRUE(listsMatch(h->base, fresh)) << "all freed: the lists of a fresh segment";
    }
    EXPECT_EQ(ShmTotalFree(h), h->size - pageBytes());
    ShmClose(h);
}

} // namespace

TEST(ShmModel, RandomSequencesOnSegmentsOfManyShapes) {
    const int operations = scaled(4000, 800);
    const uint32_t page = uint32_t(pageBytes());
    const uint32_t shapes[] = {page, 5 * page, 20480, 37 * page, (1u << 20) + 3 * page, (4u << 20) - page};
    unsigned seed = 1;
    for (uint32_t bytes : shapes) {
        SCOPED_TRACE("data bytes " + std::to_string(bytes));
        runSequence(bytes, seed++, operations, false);
        if (HasFatalFailure()) return;
    }
}

TEST(ShmModel, RandomSequencesOnAlignedSegmentsReturnToFreshLists) {
    const int operations = scaled(4000, 800);
    unsigned seed = 100;
    for (uint32_t bytes : {uint32_t(pageBytes()), 1u << 16, 1u << 20, 4u << 20}) {
        SCOPED_TRACE("data bytes " + std::to_string(bytes));
        runSequence(bytes, seed++, operations, true);
        if (HasFatalFailure()) return;
    }
}

TEST(ShmModel, ReferenceModelReproducesTheWorkedExample) {
    // Guards the model itself: the example's split, by hand.
    BuddyModel model(0x40000000u, 24576);
    ASSERT_EQ(model.list(11).size(), 1u);
    EXPECT_EQ(*model.list(11).begin(), 0x40001000u);
    EXPECT_EQ(model.alloc(100), 0x40005000u);
    EXPECT_EQ(*model.list(8).begin(), 0x40005800u);
    EXPECT_EQ(*model.list(4).begin(), 0x40005080u);
    model.free(0x40005000u);
    EXPECT_EQ(*model.list(9).begin(), 0x40005000u);
    EXPECT_TRUE(model.list(4).empty());
}
