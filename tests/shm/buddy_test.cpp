/* Buddy allocation: the worked example (layout, split, merge, list dump),
 * size classes, refused requests, foreign pointers, double frees, and random
 * operation sequences against the reference model: after every operation
 * the lists equal the model's, stay strictly descending, keep no free
 * partners apart and tile the data area with the allocated blocks. */
#include "shm/shm.h"
#include "shm/shm_private.h"
#include "shm_model.h"
#include "shm_test_util.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <map>
#include <optional>
#include <random>
#include <thread>

using namespace qorbu::test;

namespace {

constexpr uint32_t kExampleSize = 20480;
using Lists = std::map<int, std::vector<uintptr_t>>; // class -> entries, highest first

/* The 20480-byte example segment at a fixed header address free here. */
class ExampleSegment : public ::testing::Test {
  protected:
    void SetUp() override {
        if (pageBytes() != 4096) GTEST_SKIP() << "the worked example assumes 4 KiB pages";
        h = createAtFreeAddress(name.c_str(), kExampleSize, &H);
        ASSERT_NE(h, nullptr) << strerror(errno);
        if (H != 0x40000000u) std::printf("header at %#lx: 0x40000000 is in use here\n", (unsigned long)H);
    }
    void TearDown() override {
        if (h != nullptr) ShmClose(h);
    }
    Lists fresh() const { return {{9, {H + 0x5000}}, {11, {H + 0x1000}}}; }
    void expectLists(Lists lists) {
        for (int k = 0; k < kClasses; k++) EXPECT_EQ(walkList(h->base, k, 8), lists[k]) << "class " << k;
    }
    void expectFresh() {
        expectLists(fresh());
        EXPECT_EQ(ShmTotalFree(h), kExampleSize);
    }
    std::string dump() {
        char *text = nullptr;
        size_t length = 0;
        FILE *stream = open_memstream(&text, &length);
        ShmPrintFree(stream, h->base);
        fclose(stream);
        std::string result(text, length);
        free(text);
        return result;
    }

    NameGuard name{"example"};
    uintptr_t H = 0;
    ShmHandle *h = nullptr;
};

std::string hex(uintptr_t address) {
    char text[32];
    snprintf(text, sizeof text, "%p", reinterpret_cast<void *>(address));
    return text;
}

/* ShmPrintFree's text for these lists (every other list empty). */
std::string expectedDump(Lists lists) {
    std::string text;
    for (int k = 0; k < kClasses; k++) {
        char line[32];
        snprintf(line, sizeof line, "0x%08x [%d] = {", unsigned(classBytes(k)), k);
        text += line;
        for (size_t i = 0; i < lists[k].size(); i++) text += (i == 0 ? " " : ", ") + hex(lists[k][i]);
        text += " }\n";
    }
    return text;
}

/* At a caller's page-aligned address, or where the library places it; there
 * the data area is aligned to its size, and freeing everything must restore
 * the fresh lists. */
void runSequence(uint32_t dataBytes, unsigned seed, int operations, bool placedByLibrary) {
    NameGuard name("model");
    uintptr_t fixedHeader = 0;
    ShmHandle *h = placedByLibrary ? ShmCreate(name.c_str(), nullptr, dataBytes)
                                   : createAtFreeAddress(name.c_str(), dataBytes, &fixedHeader);
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
            const uint32_t n =
                std::uniform_int_distribution<uint32_t>(0, (2u << bits) - 1)(rng) % (dataBytes + 1);
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
    if (placedByLibrary) {
        EXPECT_TRUE(listsMatch(h->base, BuddyModel(reinterpret_cast<uintptr_t>(h->base), h->size)))
            << "all freed: the lists of a fresh segment";
    }
    EXPECT_EQ(ShmTotalFree(h), h->size - pageBytes());
    ShmClose(h);
}

} // namespace

TEST_F(ExampleSegment, LayoutAndDump) {
    EXPECT_EQ(reinterpret_cast<uintptr_t>(h->base), H);
    EXPECT_EQ(reinterpret_cast<uintptr_t>(ShmAddr(h)), H + 0x1000);
    EXPECT_EQ(ShmOverhead(), 4096);
    EXPECT_EQ(h->size, 24576u);
    EXPECT_EQ(h->base->base, H);
    EXPECT_EQ(h->base->size, 24576u);
    EXPECT_EQ(h->base->useFlock, 0u);
    EXPECT_EQ(h->base->busy, 0u);
    expectFresh();
    const std::string dumped = dump();
    EXPECT_EQ(dumped, expectedDump(fresh()));
    EXPECT_EQ(dumped.substr(0, 21), "0x00000008 [0] = { }\n");
    EXPECT_NE(dumped.find("\n0x20000000 [26] = { }\n"), std::string::npos);
    if (H == 0x40000000u) {
        EXPECT_NE(dumped.find("\n0x00001000 [9] = { 0x40005000 }\n"), std::string::npos);
    }

    const uint32_t metadataRoom = uint32_t(4096 - sizeof(ShmHeader));
    if (sizeof(uintptr_t) == 4) {
        EXPECT_EQ(metadataRoom, 3948u);
    }
    EXPECT_EQ(reinterpret_cast<uintptr_t>(ShmMetadata(h, metadataRoom)), H + sizeof(ShmHeader));
    EXPECT_REFUSED(ENOMEM, ShmMetadata(h, metadataRoom + 1));
    ShmClose(h);
    h = nullptr;
    EXPECT_TRUE(rangeIsFree(H, 24576));
}

TEST_F(ExampleSegment, SplitsTheHighestBlockMergesBackAndRefusesWhenExhausted) {
    void *p = ShmAlloc(h, 100);
    const uintptr_t b = reinterpret_cast<uintptr_t>(p);
    EXPECT_EQ(b, H + 0x5000);
    expectLists({{4, {H + 0x5080}},
                 {5, {H + 0x5100}},
                 {6, {H + 0x5200}},
                 {7, {H + 0x5400}},
                 {8, {H + 0x5800}},
                 {11, {H + 0x1000}}});
    EXPECT_EQ(classWordAt(b), slotAddress(h->base, 4));
    if (sizeof(uintptr_t) == 4) {
        EXPECT_EQ(classWordAt(b), H + 0x38) << "class word at " << hex(b - 4);
    }
    EXPECT_EQ(ShmTotalFree(h), 20352u);
    ShmFree(h, p);
    expectFresh();
    EXPECT_EQ(classWordAt(b), slotAddress(h->base, 9));
    if (sizeof(uintptr_t) == 4) {
        EXPECT_EQ(classWordAt(b), H + 0x4C);
    }

    void *big = ShmAlloc(h, 10000);
    ASSERT_EQ(reinterpret_cast<uintptr_t>(big), H + 0x1000);
    ASSERT_EQ(reinterpret_cast<uintptr_t>(ShmAlloc(h, 4000)), H + 0x5000);
    const ListHeads lists(h->base);
    EXPECT_REFUSED(ENOMEM, ShmAlloc(h, 1));
    EXPECT_TRUE(lists.unchanged());
    EXPECT_EQ(h->base->busy, 0u);
    EXPECT_EQ(ShmTotalFree(h), 0u);
    ShmFree(h, big);
    ShmFree(h, reinterpret_cast<void *>(H + 0x5000));
    expectFresh(); // the class-11 block's partner lies outside the segment

    // Two entries in one list, highest first (also in the dump).
    void *top = ShmAlloc(h, 4000);
    ASSERT_EQ(reinterpret_cast<uintptr_t>(top), H + 0x5000);
    ASSERT_EQ(reinterpret_cast<uintptr_t>(ShmAlloc(h, 4000)), H + 0x1000);
    ShmFree(h, top);
    const Lists two = {{9, {H + 0x5000, H + 0x2000}}, {10, {H + 0x3000}}};
    expectLists(two);
    EXPECT_EQ(dump(), expectedDump(two));
}

TEST(ShmAlloc, SizeClassesAndOversizedRequestsRefusedBeforeTheLock) {
    NameGuard name("classes");
    ShmHandle *h = ShmCreate(name.c_str(), nullptr, 1u << 16);
    ASSERT_NE(h, nullptr);
    auto classOf = [&](uint32_t n) {
        void *p = ShmAlloc(h, n);
        EXPECT_NE(p, nullptr) << n;
        if (p == nullptr) return -1;
        const int k =
            int((classWordAt(reinterpret_cast<uintptr_t>(p)) - slotAddress(h->base, 0)) / sizeof(uintptr_t));
        ShmFree(h, p);
        return k;
    };
    const int smallest = sizeof(uintptr_t) == 4 ? 0 : 1;
    EXPECT_EQ(classOf(0), smallest);
    EXPECT_EQ(classOf(sizeof(uintptr_t)), smallest);
    for (int k = smallest; k < 10; k++) { // on 32 bits: 4 -> 0, 5 -> 1, ... 4092 -> 9, 4093 -> 10
        const uint32_t fits = uint32_t(classBytes(k) - sizeof(uintptr_t));
        EXPECT_EQ(classOf(fits), k) << fits;
        EXPECT_EQ(classOf(fits + 1), k + 1) << fits + 1;
    }
    EXPECT_EQ(ShmTotalFree(h), 1u << 16);

    // Oversized requests fail before the lock: with busy set, only they report ENOMEM.
    auto *lastMetadataWord = reinterpret_cast<uintptr_t *>(ShmAddr(h)) - 1;
    *lastMetadataWord = 0x5a5a5a5a;
    const ListHeads lists(h->base);
    h->base->busy = 1;
    const uint32_t tooBig = uint32_t(0x20000000u - sizeof(uintptr_t) + 1);
    for (uint32_t n : {0x40000000u, 0xFFFFFFFFu, tooBig}) EXPECT_REFUSED(ENOMEM, ShmAlloc(h, n));
    EXPECT_REFUSED(EBUSY, ShmAlloc(h, tooBig - 1)); // the largest class goes through the lock
    h->base->busy = 0;
    EXPECT_REFUSED(ENOMEM, ShmAlloc(h, tooBig - 1));
    EXPECT_TRUE(lists.unchanged());
    EXPECT_EQ(*lastMetadataWord, uintptr_t{0x5a5a5a5a});
    ShmClose(h);
}

TEST(ShmFree, NullAndForeignPointersChangeNothing) {
    NameGuard mineName("mine"), otherName("other");
    ShmHandle *mine = ShmCreate(mineName.c_str(), nullptr, 64 * pageBytes());
    ShmHandle *other = ShmCreate(otherName.c_str(), nullptr, 64 * pageBytes());
    ASSERT_NE(mine, nullptr);
    ASSERT_NE(other, nullptr);
    auto *big = static_cast<unsigned char *>(ShmAlloc(mine, 4000));
    ASSERT_NE(big, nullptr);
    memset(big, 0xa5, 4000);
    void *foreign = ShmAlloc(other, 100);
    ASSERT_NE(foreign, nullptr);

    // Class words in the right header page that name no list slot, and one
    // whose block would run past the end of the segment.
    auto forge = [&](size_t offset, uintptr_t word) {
        *reinterpret_cast<uintptr_t *>(big + offset - sizeof(uintptr_t)) = word;
        return static_cast<void *>(big + offset);
    };
    int onStack = 0;
    const struct {
        const char *what;
        void *p;
    } cases[] = {
        {"block of another segment", foreign},
        {"inside a block", big + 64},
        {"word naming size", forge(256, reinterpret_cast<uintptr_t>(mine->base) + offsetof(ShmHeader, size))},
        {"past the last slot", forge(512, slotAddress(mine->base, 26) + sizeof(uintptr_t))},
        {"between slots", forge(768, slotAddress(mine->base, 3) + 1)},
        {"block past the end", forge(1024, slotAddress(mine->base, 20))},
        {"stack address", &onStack},
        {"header page", mine->base},
    };
    const ListHeads lists(mine->base);
    const uint32_t freeBytes = ShmTotalFree(mine);
    for (const auto &c : cases) {
        testing::internal::CaptureStderr();
        errno = 4321;
        ShmFree(mine, c.p);
        EXPECT_EQ(errno, 4321) << c.what;
        EXPECT_EQ(testing::internal::GetCapturedStderr(), "ShmFree(): mismatched handle and pointer\n")
            << c.what;
        EXPECT_TRUE(lists.unchanged()) << c.what;
        EXPECT_EQ(mine->base->busy, 0u) << c.what;
    }
    testing::internal::CaptureStderr();
    ShmFree(mine, nullptr);
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
    EXPECT_EQ(ShmTotalFree(mine), freeBytes);
    ShmFree(other, foreign);
    EXPECT_EQ(ShmTotalFree(other), 64 * pageBytes());
    ShmClose(other);
    ShmClose(mine);
}

using ShmFreeDeathTest = ExampleSegment;

// a and b are partners, and c is the partner of the block they merge into,
// so the merge stops there: the merged block must be known by its new class.
TEST_F(ShmFreeDeathTest, DoubleFreeOfABlockThatMergedUpIsCaught) {
    char *a = static_cast<char *>(ShmAlloc(h, 100));
    char *b = static_cast<char *>(ShmAlloc(h, 100));
    char *c = static_cast<char *>(ShmAlloc(h, 200));
    ASSERT_TRUE(a && b && c);
    ASSERT_EQ(b - a, 128);
    ASSERT_EQ(c - a, 256);
    EXPECT_EXIT(
        {
            ShmFree(h, a);
            ShmFree(h, b);
            ShmFree(h, a);
        },
        testing::ExitedWithCode(100), "^ShmFree\\(\\): double-free\n$");
}

TEST_F(ShmFreeDeathTest, DoubleFreeEndsWithStatus100AndLeavesTheSegmentUsable) {
    // A second read-write handle, so the descriptor lock is in play too.
    ShmHandle *second = ShmOpen(name.c_str(), O_RDWR);
    ASSERT_NE(second, nullptr);
    void *p = ShmAlloc(h, 100);
    ASSERT_NE(p, nullptr);
    EXPECT_EXIT(
        {
            ShmFree(h, p);
            ShmFree(second, p);
        },
        testing::ExitedWithCode(100), "^ShmFree\\(\\): double-free\n$");
    // The child's first free happened in the shared segment.
    EXPECT_EQ(h->base->busy, 0u);
    EXPECT_EQ(pthread_mutex_trylock(&h->base->mutex), 0) << "the mutex was left locked";
    pthread_mutex_unlock(&h->base->mutex);
    expectFresh();
    EXPECT_NE(ShmAlloc(second, 100), nullptr);
    ShmClose(second);
}

TEST(ShmModel, RandomSequencesOnSegmentsOfManyShapes) {
    const uint32_t page = uint32_t(pageBytes());
    unsigned seed = 1;
    for (uint32_t bytes : {page, 5 * page, 20480u, 37 * page, (1u << 20) + 3 * page, (4u << 20) - page}) {
        SCOPED_TRACE("data bytes " + std::to_string(bytes));
        runSequence(bytes, seed++, scaled(4000, 800), false);
        if (HasFatalFailure()) return;
    }
    for (uint32_t bytes : {page, 37 * page, 1u << 16, 1u << 20, 4u << 20}) {
        SCOPED_TRACE("placed by the library, data bytes " + std::to_string(bytes));
        runSequence(bytes, seed++, scaled(4000, 800), true);
        if (HasFatalFailure()) return;
    }
}

/* Where the library places a segment, its data area is aligned to its size
 * rounded up to a power of two, so that every block merges back. */
TEST(ShmAlloc, SegmentsPlacedByTheLibraryMergeBackIntoTheirLargestBlocks) {
    NameGuard name("placed");
    for (uint32_t bytes : {1u << 16, 37 * uint32_t(pageBytes())}) {
        ShmHandle *h = ShmCreate(name.c_str(), nullptr, bytes);
        ASSERT_NE(h, nullptr);
        uint32_t align = 1;
        while (align < bytes) align <<= 1;
        EXPECT_EQ(reinterpret_cast<uintptr_t>(ShmAddr(h)) % align, 0u) << bytes;
        std::vector<void *> blocks;
        for (void *p; (p = ShmAlloc(h, 4000)) != nullptr;) blocks.push_back(p);
        EXPECT_EQ(blocks.size(), bytes / 4096);
        for (void *p : blocks) ShmFree(h, p);
        void *largest = ShmAlloc(h, (1u << (31 - __builtin_clz(bytes))) - 100);
        EXPECT_NE(largest, nullptr) << bytes << ": the freed blocks did not merge back";
        ShmFree(h, largest);
        EXPECT_EQ(ShmTotalFree(h), bytes);
        ShmClose(h);
        ShmUnlink(name.c_str());
    }
}

/* ShmFree checks the class word before the lock; a word overwritten while
 * it waits for the lock must be caught again under it. */
TEST(ShmFree, ClassWordOverwrittenWhileWaitingForTheLockChangesNothing) {
#ifdef __SANITIZE_THREAD__
    GTEST_SKIP()
        << "the word is overwritten while another thread reads it on purpose: the race ThreadSanitizer reports";
#endif
    NameGuard name("reread");
    ShmHandle *h = ShmCreate(name.c_str(), nullptr, 1u << 16);
    ASSERT_NE(h, nullptr);
    void *p = ShmAlloc(h, 100);
    ASSERT_NE(p, nullptr);
    const ListHeads lists(h->base);
    auto *word = reinterpret_cast<uintptr_t *>(p) - 1;
    const uintptr_t sound = *word;
    std::optional<qorbu::shm::SegmentLock> lock(std::in_place, h);
    ASSERT_EQ(lock->error(), 0);
    testing::internal::CaptureStderr();
    std::thread freer([&] { ShmFree(h, p); });
    usleep(300 * 1000); // the free waits for the lock by now (else it sees the word below anyway)
    *word = reinterpret_cast<uintptr_t>(&h->base->size); // in the header page, naming no list
    lock.reset();
    freer.join();
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "ShmFree(): mismatched handle and pointer\n");
    EXPECT_TRUE(lists.unchanged());
    EXPECT_EQ(h->base->busy, 0u);
    EXPECT_EQ(h->base->useFlock, 0u);
    *word = sound;
    ShmFree(h, p);
    EXPECT_EQ(ShmTotalFree(h), 1u << 16);
    ShmClose(h);
}

/* Damaged lists, as a stray write or a dying process leaves them: every
 * operation that meets the damage fails with EUCLEAN, changes nothing,
 * leaves busy and the lock free, and neither faults nor loops (each case
 * runs in a child that an alarm ends). */
TEST(ShmDamage, DamagedListsAreReportedNeverFollowed) {
    const uintptr_t page = pageBytes();
    NameGuard name("damage");
    ShmHandle *h = ShmCreate(name.c_str(), nullptr, 1u << 16);
    ASSERT_NE(h, nullptr);
    const uintptr_t data = reinterpret_cast<uintptr_t>(ShmAddr(h)), end = data + (1u << 16);
    // List 9 (4 KiB) becomes { data + 12 KiB, data }; `kept` is allocated in between.
    void *first = ShmAlloc(h, 4000), *kept = ShmAlloc(h, 4000), *third = ShmAlloc(h, 4000);
    ASSERT_EQ(reinterpret_cast<uintptr_t>(first), data);
    ShmFree(h, first);
    ASSERT_EQ(walkList(h->base, 9, 4), (std::vector<uintptr_t>{data + 0x3000, data}));
    ASSERT_EQ(walkList(h->base, 11, 4), (std::vector<uintptr_t>{data + 0x4000}));
    uintptr_t *head = &h->base->freeList[9], *link = reinterpret_cast<uintptr_t *>(data + 0x3000);
    const struct {
        const char *what;
        uintptr_t *word;
        uintptr_t value;
        bool walksOnly = false; // list 11, which only the whole-segment walks visit
    } cases[] = {
        {"head in the header page", head, reinterpret_cast<uintptr_t>(h->base) + 64},
        {"head not aligned to its class", head, data + 0x3000 + 8},
        {"head at the end of the data area", head, end},
        {"head far outside the mapping", head, ~uintptr_t(page - 1)},
        {"block linked to itself", link, data + 0x3000},
        {"link to a higher block", link, data + 0x8000},
        {"link below the data area", link, data - page},
        // Page-aligned and below, but overlapping the 16 KiB block above it.
        {"link to an overlapping block", reinterpret_cast<uintptr_t *>(data + 0x4000), data + 0x1000, true},
    };
    FILE *sink = fopen("/dev/null", "w");
    ASSERT_NE(sink, nullptr);
    for (const auto &c : cases) {
        SCOPED_TRACE(c.what);
        const uintptr_t saved = *c.word;
        *c.word = c.value;
        const ListHeads lists(h->base);
        const int status = runInChild(
            [&] {
                errno = 0;
                if (ShmTotalFree(h) != 0 || errno != EUCLEAN) return 1;
                if (!c.walksOnly) {
                    errno = 0;
                    if (ShmAlloc(h, 4000) != nullptr || errno != EUCLEAN) return 2;
                    errno = 0;
                    ShmFree(h, kept);
                    if (errno != EUCLEAN) return 3;
                }
                errno = 0;
                ShmPrintFree(sink, h->base);
                return errno == EUCLEAN ? 0 : 4;
            },
            60);
        EXPECT_EQ(status, 0) << "1 count, 2 alloc, 3 free, 4 dump; above 128 a signal";
        EXPECT_TRUE(lists.unchanged());
        EXPECT_EQ(*c.word, c.value);
        EXPECT_EQ(h->base->busy, 0u);
        EXPECT_EQ(pthread_mutex_trylock(&h->base->mutex), 0) << "the lock was left held";
        pthread_mutex_unlock(&h->base->mutex);
        *c.word = saved;
    }
    fclose(sink);
    ShmFree(h, kept);
    ShmFree(h, third);
    EXPECT_EQ(ShmTotalFree(h), 1u << 16) << "the segment works again once repaired";
    ShmClose(h);
}
