/* Several processes on one segment: a random stress with patterns written
 * into every block, and processes killed while they hold the segment lock. */
#include "shm/shm.h"
#include "shm/shm_private.h"
#include "shm_model.h"
#include "shm_test_util.h"

#include <cstring>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <random>
#include <vector>

using namespace qorbu::test;

namespace {

constexpr int kWorkers = 4;
constexpr int kLiveBlocks = 64;
constexpr unsigned kChildSeconds = 200;

/* Exit statuses of a worker. */
enum WorkerStatus { kOk = 0, kOpenFailed = 10, kAllocFailed, kCorrupted, kFreeFailed };

void fill(void *block, uint32_t n, uint32_t tag) {
    auto *bytes = static_cast<unsigned char *>(block);
    for (uint32_t i = 0; i < n; i++) bytes[i] = static_cast<unsigned char>(tag + i * 7);
}

bool intact(const void *block, uint32_t n, uint32_t tag) {
    const auto *bytes = static_cast<const unsigned char *>(block);
    for (uint32_t i = 0; i < n; i++) {
        if (bytes[i] != static_cast<unsigned char>(tag + i * 7)) return false;
    }
    return true;
}

/* Random allocations and frees through the worker's own read-write handle;
 * every block carries a pattern that is checked before it is freed. */
int worker(const char *name, unsigned seed, int operations) {
    ShmHandle *h = ShmOpen(name, O_RDWR);
    if (h == nullptr) return kOpenFailed;
    std::mt19937 rng(seed);
    struct Live {
        void *block;
        uint32_t n;
        uint32_t tag;
    };
    std::vector<Live> live;
    for (int op = 0; op < operations; op++) {
        const bool allocate =
            live.empty() || (live.size() < kLiveBlocks && std::uniform_int_distribution<int>(0, 1)(rng));
        if (allocate) {
            const int bits = std::uniform_int_distribution<int>(0, 14)(rng);
            const uint32_t n = std::uniform_int_distribution<uint32_t>(0, (1u << bits))(rng);
            void *block = ShmAlloc(h, n);
            if (block == nullptr) return kAllocFailed;
            const uint32_t tag = seed * 131 + uint32_t(op);
            fill(block, n, tag);
            live.push_back({block, n, tag});
        } else {
            const size_t i = std::uniform_int_distribution<size_t>(0, live.size() - 1)(rng);
            if (!intact(live[i].block, live[i].n, live[i].tag)) return kCorrupted;
            errno = 0;
            ShmFree(h, live[i].block);
            if (errno != 0) return kFreeFailed;
            live[i] = live.back();
            live.pop_back();
        }
    }
    for (const Live &l : live) {
        if (!intact(l.block, l.n, l.tag)) return kCorrupted;
        ShmFree(h, l.block);
    }
    ShmClose(h);
    return kOk;
}

pid_t startWorker(const char *name, unsigned seed, int operations) {
    const pid_t pid = fork();
    if (pid == 0) {
        alarm(kChildSeconds);
        _exit(worker(name, seed, operations));
    }
    return pid;
}

int exitStatusOf(pid_t pid) { return waitStatus(pid); }

void expectFreshLists(ShmHandle *h) {
    const BuddyModel fresh(reinterpret_cast<uintptr_t>(h->base), h->size);
    EXPECT_TRUE(listsMatch(h->base, fresh)) << "the lists of a fresh segment";
    EXPECT_EQ(checkLists(h->base, {}), "");
    EXPECT_EQ(ShmTotalFree(h), h->size - pageBytes());
}

/* A process that holds the segment lock (inside an allocation or free when
 * `busy`), says so through the pipe and waits to be killed. */
pid_t startLockHolder(const char *name, bool busy) {
    int ready[2];
    if (pipe(ready) != 0) return -1;
    const pid_t pid = fork();
    if (pid == 0) {
        alarm(kChildSeconds);
        close(ready[0]);
        ShmHandle *h = ShmOpen(name, O_RDWR);
        if (h == nullptr) _exit(kOpenFailed);
        qorbu::shm::SegmentLock lock(h);
        if (lock.error() != 0) _exit(kAllocFailed);
        if (busy) lock.markBusy();
        if (write(ready[1], "x", 1) != 1) _exit(kOpenFailed);
        for (;;) pause();
    }
    close(ready[1]);
    char c = 0;
    const bool holding = read(ready[0], &c, 1) == 1;
    close(ready[0]);
    return holding ? pid : -1;
}

void killAndReap(pid_t pid) {
    kill(pid, SIGKILL);
    int status = 0;
    waitpid(pid, &status, 0);
}

} // namespace

TEST(ShmStress, FourProcessesAllocateAndFreeAtRandom) {
    NameGuard name("stress");
    ShmHandle *h = createAligned(name.c_str(), 16u << 20);
    ASSERT_NE(h, nullptr);
    const int operations = scaled(20000, 2000);
    pid_t workers[kWorkers];
    for (int i = 0; i < kWorkers; i++) workers[i] = startWorker(name.c_str(), 1000 + i, operations);
    for (int i = 0; i < kWorkers; i++) EXPECT_EQ(exitStatusOf(workers[i]), kOk) << "worker " << i;
    EXPECT_EQ(h->base->useFlock, 1u);
    EXPECT_EQ(h->base->busy, 0u);
    expectFreshLists(h);
    ShmClose(h);
}

TEST(ShmCrash, HolderKilledOutsideAnOperationLosesNothing) {
    if (kEmulated) GTEST_SKIP() << "qemu-user lacks robust mutexes (set_robust_list)";
    NameGuard name("crash-out");
    ShmHandle *h = createAligned(name.c_str(), 4u << 20);
    ASSERT_NE(h, nullptr);
    const pid_t holder = startLockHolder(name.c_str(), false);
    ASSERT_GT(holder, 0);
    // These wait for the lock that the holder will never release itself.
    pid_t workers[2];
    for (int i = 0; i < 2; i++) workers[i] = startWorker(name.c_str(), 2000 + i, 3000);
    usleep(200 * 1000);
    killAndReap(holder);
    for (int i = 0; i < 2; i++) EXPECT_EQ(exitStatusOf(workers[i]), kOk) << "worker " << i;
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
    uintptr_t lists[kClasses];
    memcpy(lists, h->base->freeList, sizeof lists);
    const pid_t holder = startLockHolder(name.c_str(), true);
    ASSERT_GT(holder, 0);
    killAndReap(holder);
    ASSERT_EQ(h->base->busy, 1u);

    // Every process now refuses at once (the alarm ends a hung child).
    const int refusals = runInChild(
        [&] {
            errno = 0;
            if (ShmAlloc(h, 8) != nullptr || errno != EBUSY) return 1;
            errno = 0;
            ShmFree(h, kept);
            if (errno != EBUSY) return 2;
            if (ShmTotalFree(h) != 0 || errno != EBUSY) return 3;
            if (ShmOpen(name.c_str(), O_RDWR) != nullptr || errno != EBUSY) return 4;
            return 0;
        },
        60);
    EXPECT_EQ(refusals, 0);
    errno = 0;
    EXPECT_EQ(ShmAlloc(h, 8), nullptr);
    EXPECT_EQ(errno, EBUSY);
    EXPECT_EQ(memcmp(lists, h->base->freeList, sizeof lists), 0) << "a block was lost";
    ShmClose(h);
}
