/* Several processes on one segment: a random stress with patterns written
 * into every block, and processes killed while they hold the segment lock. */
#include "shm/shm.h"
#include "shm/shm_private.h"
#include "shm_model.h"
#include "shm_test_util.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <random>
#include <vector>

using namespace qorbu::test;

namespace {

constexpr unsigned kChildSeconds = 200;

enum WorkerStatus { kOk = 0, kOpenFailed = 10, kAllocFailed, kCorrupted, kFreeFailed };

/* Random allocations and frees (at most 64 blocks live) through the worker's
 * own read-write handle; every block's pattern is checked before its free. */
int worker(const char *name, unsigned seed, int operations) {
    ShmHandle *h = ShmOpen(name, O_RDWR);
    if (h == nullptr) return kOpenFailed;
    std::mt19937 rng(seed);
    struct Live {
        void *block;
        uint32_t n, tag;
    };
    std::vector<Live> live;
    for (int op = 0; op < operations; op++) {
        if (live.empty() || (live.size() < 64 && std::uniform_int_distribution<int>(0, 1)(rng))) {
            const int bits = std::uniform_int_distribution<int>(0, 14)(rng);
            const uint32_t n = std::uniform_int_distribution<uint32_t>(0, (1u << bits))(rng);
            void *block = ShmAlloc(h, n);
            if (block == nullptr) return kAllocFailed;
            live.push_back({block, n, seed * 131 + uint32_t(op)});
            fillPattern(block, n, live.back().tag);
        } else {
            const size_t i = std::uniform_int_distribution<size_t>(0, live.size() - 1)(rng);
            if (!patternIntact(live[i].block, live[i].n, live[i].tag)) return kCorrupted;
            errno = 0;
            ShmFree(h, live[i].block);
            if (errno != 0) return kFreeFailed;
            live[i] = live.back();
            live.pop_back();
        }
    }
    for (const Live &l : live) {
        if (!patternIntact(l.block, l.n, l.tag)) return kCorrupted;
        ShmFree(h, l.block);
    }
    ShmClose(h);
    return kOk;
}

void runWorkers(
    const char *name, int count, unsigned seed, int operations,
    const std::function<void()> &meanwhile = [] {}) {
    std::vector<pid_t> pids;
    for (int i = 0; i < count; i++) {
        pids.push_back(startChild([=] { return worker(name, seed + i, operations); }, kChildSeconds));
    }
    meanwhile();
    for (int i = 0; i < count; i++) EXPECT_EQ(waitStatus(pids[i]), kOk) << "worker " << i;
}

void expectFreshLists(ShmHandle *h) {
    EXPECT_TRUE(listsMatch(h->base, BuddyModel(reinterpret_cast<uintptr_t>(h->base), h->size)))
        << "the lists of a fresh segment";
    EXPECT_EQ(checkLists(h->base, {}), "");
    EXPECT_EQ(ShmTotalFree(h), h->size - pageBytes());
}

/* A process that holds the segment lock (inside an allocation or free when
 * `busy`), says so through a pipe and waits to be killed; -1 on failure. */
pid_t startLockHolder(const char *name, bool busy) {
    int ready[2];
    if (pipe(ready) != 0) return -1;
    const pid_t pid = startChild(
        [&] {
            ShmHandle *h = ShmOpen(name, O_RDWR);
            qorbu::shm::SegmentLock lock(h);
            if (lock.error() != 0) return 1;
            if (busy) lock.mark_busy();
            if (write(ready[1], "x", 1) == 1) pause();
            return 1;
        },
        kChildSeconds);
    close(ready[1]);
    char c = 0;
    const bool holding = read(ready[0], &c, 1) == 1;
    close(ready[0]);
    return holding ? pid : -1;
}

} // namespace

TEST(ShmStress, FourProcessesAllocateAndFreeAtRandom) {
    NameGuard name("stress");
    ShmHandle *h = ShmCreate(name.c_str(), nullptr, 16u << 20);
    ASSERT_NE(h, nullptr);
    runWorkers(name.c_str(), 4, 1000, scaled(20000, 2000));
    EXPECT_EQ(h->base->useFlock, 1u);
    EXPECT_EQ(h->base->busy, 0u);
    expectFreshLists(h);
    ShmClose(h);
}

TEST(ShmCrash, HolderKilledOutsideAnOperationLosesNothing) {
    if (kEmulated) GTEST_SKIP() << "qemu-user lacks robust mutexes (set_robust_list)";
    NameGuard name("crash-out");
    ShmHandle *h = ShmCreate(name.c_str(), nullptr, 4u << 20);
    ASSERT_NE(h, nullptr);
    const pid_t holder = startLockHolder(name.c_str(), false);
    ASSERT_GT(holder, 0);
    // The workers wait for the lock that the holder never releases itself.
    runWorkers(name.c_str(), 2, 2000, 3000, [holder] {
        usleep(200 * 1000);
        kill(holder, SIGKILL);
        waitStatus(holder);
    });
    EXPECT_EQ(pthread_mutex_trylock(&h->base->mutex), 0) << "the mutex was not made consistent";
    pthread_mutex_unlock(&h->base->mutex);
    expectFreshLists(h);
    ShmClose(h);
}

TEST(ShmCrash, HolderKilledInsideAnOperationLeavesTheSegmentRefusingNotHanging) {
    if (kEmulated) GTEST_SKIP() << "qemu-user lacks robust mutexes (set_robust_list)";
    NameGuard name("crash-in");
    ShmHandle *h = ShmCreate(name.c_str(), nullptr, 4u << 20);
    ASSERT_NE(h, nullptr);
    void *kept = ShmAlloc(h, 1000);
    ASSERT_NE(kept, nullptr);
    const ListHeads lists(h->base);
    const pid_t holder = startLockHolder(name.c_str(), true);
    ASSERT_GT(holder, 0);
    kill(holder, SIGKILL);
    waitStatus(holder);
    ASSERT_EQ(h->base->busy, 1u);

    // Every process now refuses at once (the alarm ends a hung child).
    EXPECT_EQ(runInChild(
                  [&] {
                      errno = 0;
                      if (ShmAlloc(h, 8) != nullptr || errno != EBUSY) return 1;
                      ShmFree(h, kept);
                      if (errno != EBUSY || ShmTotalFree(h) != 0 || errno != EBUSY) return 2;
                      return ShmOpen(name.c_str(), O_RDWR) == nullptr && errno == EBUSY ? 0 : 3;
                  },
                  60),
              0);
    EXPECT_REFUSED(EBUSY, ShmAlloc(h, 8));
    EXPECT_TRUE(lists.unchanged()) << "a block was lost";
    ShmClose(h);
}
