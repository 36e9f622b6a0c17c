/* Buddy allocation: size classes, the worked split and merge example,
 * refused requests, foreign pointers, double frees and the list dump. */
#include "shm/shm.h"
#include "shm_model.h"
#include "shm_test_util.h"

#include <fcntl.h>
#include <gtest/gtest.h>

using namespace qorbu::test;

namespace {

constexpr uint32_t kExampleSize = 20480;

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
    void expectFresh() {
        for (int k = 0; k < kClasses; k++) {
            EXPECT_EQ(h->base->freeList[k], k == 9 ? H + 0x5000 : k == 11 ? H + 0x1000 : 0) << k;
        }
        EXPECT_EQ(ShmTotalFree(h), kExampleSize);
    }
    /* ShmPrintFree's lines. */
    std::vector<std::string> dump() {
        char *text = nullptr;
        size_t length = 0;
        FILE *stream = open_memstream(&text, &length);
        ShmPrintFree(stream, h->base);
        fclose(stream);
        std::vector<std::string> lines;
        size_t start = 0;
        for (size_t end; (end = std::string_view(text, length).find('\n', start)) != std::string::npos; start = end + 1) {
            lines.emplace_back(text + start, end - start);
        }
        EXPECT_EQ(start, length) << "text after the last newline";
        free(text);
        return lines;
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

} // namespace

TEST_F(ExampleSegment, SplitsTheHighestBlockMergesBackAndRefusesWhenExhausted) {
    void *p = ShmAlloc(h, 100);
    const uintptr_t b = reinterpret_cast<uintptr_t>(p);
    EXPECT_EQ(b, H + 0x5000);
    const uintptr_t expected[] = {H + 0x5080, H + 0x5100, H + 0x5200, H + 0x5400, H + 0x5800};
    for (int k = 4; k <= 8; k++) {
        EXPECT_EQ(h->base->freeList[k], expected[k - 4]) << "class " << k;
        EXPECT_EQ(*reinterpret_cast<uintptr_t *>(expected[k - 4]), 0u) << "class " << k;
    }
    EXPECT_EQ(h->base->freeList[9], 0u);
    EXPECT_EQ(h->base->freeList[11], H + 0x1000);
    EXPECT_EQ(classWordAt(b), slotAddress(h->base, 4));
    if (sizeof(uintptr_t) == 4) { EXPECT_EQ(classWordAt(b), H + 0x38) << "class word at " << hex(b - 4); }
    EXPECT_EQ(ShmTotalFree(h), 20352u);
    ShmFree(h, p);
    expectFresh();
    EXPECT_EQ(classWordAt(b), slotAddress(h->base, 9));
    if (sizeof(uintptr_t) == 4) { EXPECT_EQ(classWordAt(b), H + 0x4C); }

    // The class-11 block's partner lies outside the segment: it never merges.
    void *big = ShmAlloc(h, 10000);
    ASSERT_EQ(reinterpret_cast<uintptr_t>(big), H + 0x1000);
    EXPECT_EQ(h->base->freeList[11], 0u);
    ASSERT_EQ(reinterpret_cast<uintptr_t>(ShmAlloc(h, 4000)), H + 0x5000);
    const ListHeads lists(h->base);
    EXPECT_REFUSED(ENOMEM, ShmAlloc(h, 1));
    EXPECT_TRUE(lists.unchanged());
    EXPECT_EQ(h->base->busy, 0u);
    EXPECT_EQ(ShmTotalFree(h), 0u);
    ShmFree(h, big);
    ShmFree(h, reinterpret_cast<void *>(H + 0x5000));
    expectFresh();
}

TEST_F(ExampleSegment, DumpPrintsOneLinePerClass) {
    std::vector<std::string> fresh = dump();
    ASSERT_EQ(fresh.size(), 27u);
    EXPECT_EQ(fresh[0], "0x00000008 [0] = { }");
    EXPECT_EQ(fresh[9], "0x00001000 [9] = { " + hex(H + 0x5000) + " }");
    EXPECT_EQ(fresh[11], "0x00004000 [11] = { " + hex(H + 0x1000) + " }");
    EXPECT_EQ(fresh[26], "0x20000000 [26] = { }");
    if (H == 0x40000000u) { EXPECT_EQ(fresh[9], "0x00001000 [9] = { 0x40005000 }"); }
    for (int k = 0; k < kClasses; k++) {
        char expected[64];
        snprintf(expected, sizeof expected, "0x%08x [%d] = { }", unsigned(classBytes(k)), k);
        if (k != 9 && k != 11) { EXPECT_EQ(fresh[k], expected); }
    }

    // Two entries in one list: highest first, separated by a comma.
    void *top = ShmAlloc(h, 4000);
    ASSERT_EQ(reinterpret_cast<uintptr_t>(top), H + 0x5000);
    ASSERT_EQ(reinterpret_cast<uintptr_t>(ShmAlloc(h, 4000)), H + 0x1000);
    ShmFree(h, top);
    std::vector<std::string> later = dump();
    ASSERT_EQ(later.size(), 27u);
    EXPECT_EQ(later[9], "0x00001000 [9] = { " + hex(H + 0x5000) + ", " + hex(H + 0x2000) + " }");
    EXPECT_EQ(later[10], "0x00002000 [10] = { " + hex(H + 0x3000) + " }");
}

TEST(ShmAlloc, SmallestClassHoldingTheRequestAndItsClassWord) {
    NameGuard name("classes");
    ShmHandle *h = ShmCreate(name.c_str(), nullptr, 1u << 16);
    ASSERT_NE(h, nullptr);
    auto classOf = [&](uint32_t n) {
        void *p = ShmAlloc(h, n);
        EXPECT_NE(p, nullptr) << n;
        if (p == nullptr) return -1;
        const int k = int((classWordAt(reinterpret_cast<uintptr_t>(p)) - slotAddress(h->base, 0)) / sizeof(uintptr_t));
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
    ShmClose(h);
}

TEST(ShmAlloc, OversizedRequestsFailBeforeTheLock) {
    NameGuard name("huge");
    ShmHandle *h = ShmCreate(name.c_str(), nullptr, 4 * pageBytes());
    ASSERT_NE(h, nullptr);
    auto *lastMetadataWord = reinterpret_cast<uintptr_t *>(ShmAddr(h)) - 1;
    *lastMetadataWord = 0x5a5a5a5a;
    const ListHeads lists(h->base);
    // With busy set, only a request refused before the lock reports ENOMEM.
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
        EXPECT_EQ(testing::internal::GetCapturedStderr(), "ShmFree(): mismatched handle and pointer\n") << c.what;
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
