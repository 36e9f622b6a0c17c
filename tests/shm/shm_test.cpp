/* The shared-memory allocator: refused calls, half-made and damaged
 * segments, double frees, the segment lock across processes, random
 * operations against the model, and processes killed holding the lock. */
#include "shm/shm_private.h"
#include "shm_ops.h"
#include "support/test_support.h"

#include <csignal>
#include <fcntl.h>
#include <functional>
#include <optional>
#include <random>
#include <sys/file.h>
#include <sys/mman.h>

using namespace qorbu::test;

namespace {

const uint32_t kPage = static_cast<uint32_t>(page_bytes());

/* A data address with its header page on `align` and `length` free bytes there. */
uintptr_t free_data_address(size_t length, uintptr_t align) {
    void *p = mmap(nullptr, length + align, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    munmap(p, length + align);
    return ((reinterpret_cast<uintptr_t>(p) + align - 1) & ~(align - 1)) + kPage;
}

/* Processes each running random operations through their own handle. */
std::vector<pid_t> start_workers(const char *name, int count, int operations) {
    std::vector<pid_t> pids;
    for (int i = 0; i < count; i++) {
        pids.push_back(start_child(
            [=] {
                OperationRun run(ShmOpen(name, O_RDWR), false);
                std::mt19937 rng(i);
                std::string broken;
                for (int op = 0; op < operations && broken.empty(); op++)
                    broken = run.step(rng(), rng() & 0x7ffff);
                return broken.empty() ? run.finish().empty() ? 0 : 2
                                      : (fprintf(stderr, "%s\n", broken.c_str()), 1);
            },
            200));
    }
    return pids;
}

/* A process that holds the segment lock (inside an allocation or free when
 * `busy`) until it is killed; -1 when it could not take it. */
pid_t start_lock_holder(const char *name, bool busy) {
    Pipe ready;
    const pid_t pid = start_child(
        [&] {
            qorbu::shm::SegmentLock lock(ShmOpen(name, O_RDWR));
            if (busy) lock.mark_busy();
            if (lock.error() == 0) ready.fill(), pause();
            return 1;
        },
        200);
    char c;
    return read(ready.r, &c, 1) == 1 ? pid : -1;
}

} // namespace

class Shm : public ::testing::Test {
  protected:
    Shm() { names_.reserve(16); }
    ~Shm() override {
        for (ShmHandle *h : handles_) ShmClose(h);
        for (const std::string &n : names_) ShmUnlink(n.c_str());
    }
    /* Names of this process, removed when the test ends. */
    const char *name(size_t i = 0) {
        while (names_.size() <= i)
            names_.push_back("qorbu-test-" + std::to_string(getpid() * 100 + names_.size()));
        return names_[i].c_str();
    }
    ShmHandle *keep(ShmHandle *h) { return h != nullptr ? handles_.emplace_back(h) : h; }
    ShmHandle *create(uint32_t size, uintptr_t data = 0, size_t i = 0) {
        return keep(ShmCreate(name(i), reinterpret_cast<void *>(data), size));
    }
    void close(ShmHandle *h) { std::erase(handles_, h), ShmClose(h); }
    std::vector<uintptr_t> heads(ShmHandle *h) { return {h->base->freeList, h->base->freeList + kClasses}; }

    std::vector<std::string> names_;
    std::vector<ShmHandle *> handles_;
};
using ShmDeathTest = Shm;

/* Every refused call returns 0 or null with errno set, acquires nothing and
 * changes nothing; requests that no class holds are refused before the lock. */
TEST_F(Shm, RefusedCallsChangeNothing) {
    ShmHandle *h = create(16 * kPage, 0, 1), *reader = keep(ShmOpen(name(1), O_RDONLY));
    ASSERT_TRUE(h && reader);
    EXPECT_EQ(h->base->useFlock, 0u) << "a read-only attach turned the descriptor lock on";
    void *block = ShmAlloc(h, 200);
    const char *n = name(), *busy = name(1);
    const uint32_t metadata = kPage - sizeof(ShmHeader);
    const struct {
        const char *what;
        bool busy;
        std::function<bool()> call; // whether it did what it was asked
        int err;
    } cases[] = {
        {"write-only mode", false, [&] { return ShmOpen(n, O_WRONLY); }, EINVAL},
        {"O_CREAT in the mode", false, [&] { return ShmOpen(n, O_RDWR | O_CREAT); }, EINVAL},
        {"address off 4096", false, [&] { return ShmCreate(n, (void *)0x40000800, 1); }, EINVAL},
        {"size 0", false, [&] { return ShmCreate(n, nullptr, 0); }, EINVAL},
        {"size whose length wraps", false, [&] { return ShmCreate(n, nullptr, ~0u - 2 * kPage + 2); },
         EINVAL},
        {"no such segment", false, [&] { return ShmOpen(n, O_RDONLY); }, ENOENT},
        {"metadata beyond the page", false, [&] { return ShmMetadata(h, metadata + 1); }, ENOMEM},
        {"1 GiB, busy", true, [&] { return ShmAlloc(h, 0x40000000u); }, ENOMEM},
        {"above the largest class, busy", true, [&] { return ShmAlloc(h, 0x20000001u - sizeof(void *)); },
         ENOMEM},
        {"alloc, busy", true, [&] { return ShmAlloc(h, 8); }, EBUSY},
        {"free, busy", true, [&] { return ShmFree(h, block), false; }, EBUSY},
        {"count, busy", true, [&] { return ShmTotalFree(h) != 0; }, EBUSY},
        {"read-write attach, busy", true, [&] { return ShmOpen(busy, O_RDWR); }, EBUSY},
        {"create meeting it, busy", true, [&] { return ShmCreate(busy, nullptr, 1); }, EBUSY},
        {"read-only attach, busy for good", true, [&] { return ShmOpen(busy, O_RDONLY); }, EBUSY},
        {"alloc, read-only", false, [&] { return ShmAlloc(reader, 8); }, EBADF},
        {"free, read-only", false, [&] { return ShmFree(reader, block), false; }, EBADF},
        {"count, read-only", false, [&] { return ShmTotalFree(reader) != 0; }, EBADF},
    };
    const std::vector<uintptr_t> lists = heads(h);
    const int fds = open_descriptor_count();
    for (const auto &c : cases) {
        h->base->busy = c.busy;
        EXPECT_EQ(OUTCOME(c.call()), (Outcome{0, c.err})) << c.what;
        EXPECT_EQ(std::exchange(h->base->busy, 0), c.busy) << c.what;
    }
    for (const char *bad : {"", "a/b", "a:b"}) {
        EXPECT_EQ(OUTCOME(ShmCreate(bad, nullptr, 1) || ShmOpen(bad, O_RDONLY)), (Outcome{0, EINVAL})) << bad;
    }
    EXPECT_EQ(open_descriptor_count(), fds);
    EXPECT_EQ(heads(h), lists);
    EXPECT_EQ(OUTCOME(ShmUnlink(n)), failure(ENOENT)) << "a refused call made the object";
    EXPECT_EQ(ShmMetadata(h, metadata), reinterpret_cast<char *>(h->base) + sizeof(ShmHeader));
    close(h);
    EXPECT_EQ(mapping_at(uintptr_t(reader->base)).perms, "r--s") << "read-only handles could write";
}

/* Objects a creator left half-made when it died, and headers that cannot be
 * trusted: every attach fails in bounded time, keeping nothing. The calls
 * run side by side, each in a child. */
TEST_F(Shm, HalfMadeAndUntrustworthyObjectsAreRefused) {
    const uintptr_t header = free_data_address(4 * kPage, kPage) - kPage;
    const struct {
        const char *what;
        off_t length;
        uintptr_t base;
        uint32_t size;
        int err;
    } objects[] = {
        {"never sized", 0, 0, 0, ETIMEDOUT},
        {"never published", 3 * kPage, 0, 0, ETIMEDOUT},
        {"100 bytes", 100, 0, 0, EINVAL},
        {"base off a page", 3 * kPage, header + 8, 3 * kPage, EINVAL},
        {"base 0", 3 * kPage, 0, 3 * kPage, EINVAL},
        {"size off a page", 3 * kPage, header, 3 * kPage + 8, EINVAL},
        {"a single page", 3 * kPage, header, kPage, EINVAL},
        {"size beyond the object", 3 * kPage, header, 4 * kPage, EINVAL},
    };
    std::vector<std::pair<std::string, pid_t>> children;
    for (size_t i = 0; i < std::size(objects); i++) {
        const auto &o = objects[i];
        const int fd = shm_open(("/" + std::string(name(i))).c_str(), O_RDWR | O_CREAT, 0600);
        ShmHeader raw{};
        raw.base = o.base, raw.size = o.size;
        ASSERT_EQ(ftruncate(fd, o.length), 0);
        ASSERT_TRUE(o.length < off_t(kPage) || pwrite(fd, &raw, sizeof raw, 0) == ssize_t(sizeof raw));
        ::close(fd);
        for (int call = o.length == 0; call < 3; call++) { // ShmCreate initialises an empty object
            const char *n = name(i);
            const pid_t pid = start_child(
                [=] {
                    const int fds = open_descriptor_count();
                    ShmHandle *h =
                        call == 0 ? ShmCreate(n, nullptr, 1) : ShmOpen(n, call == 1 ? O_RDONLY : O_RDWR);
                    return h != nullptr || errno != o.err ? 1 : open_descriptor_count() == fds ? 0 : 2;
                },
                30);
            children.emplace_back(std::string(o.what) + ", call " + std::to_string(call), pid);
        }
    }
    for (const auto &[what, pid] : children)
        EXPECT_EQ(wait_status(pid), 0) << what << " (1 result, 2 descriptors)";
    EXPECT_EQ(mapping_at(header).perms, "") << "a refused attach left a mapping";
}

/* Damaged lists, as a stray write leaves them: every operation that meets
 * the damage fails with EUCLEAN, and neither faults nor loops (a child that
 * an alarm ends), nor changes anything, nor keeps the lock. */
TEST_F(Shm, DamagedListsAreReportedNeverFollowed) {
    ShmHandle *h = create(1u << 16);
    ASSERT_NE(h, nullptr);
    const auto data = reinterpret_cast<uintptr_t>(ShmAddr(h));
    // List 9 (4 KiB blocks) becomes { data + 12 KiB, data }, with `kept` in between.
    void *first = ShmAlloc(h, 4000), *kept = ShmAlloc(h, 4000);
    ShmAlloc(h, 4000);
    ShmFree(h, first);
    ASSERT_EQ(h->base->freeList[9], data + 0x3000);
    uintptr_t *head = &h->base->freeList[9], *link = reinterpret_cast<uintptr_t *>(data + 0x3000);
    const struct {
        const char *what;
        uintptr_t *word, value;
    } cases[] = {
        {"head in the header page", head, reinterpret_cast<uintptr_t>(h->base) + 64},
        {"head off its class's alignment", head, data + 0x3008},
        {"head at the end of the data area", head, data + 0x10000},
        {"block linked to itself", link, data + 0x3000},
        {"link to a higher block", link, data + 0x8000},
        {"link below the data area", link, data - kPage},
    };
    FILE *sink = fopen("/dev/null", "w");
    for (const auto &c : cases) {
        const uintptr_t saved = std::exchange(*c.word, c.value);
        const std::vector<uintptr_t> lists = heads(h);
        EXPECT_EQ(run_in_child(
                      [&] {
                          const Outcome damaged{0, EUCLEAN};
                          if (OUTCOME(ShmTotalFree(h)) != damaged) return 1;
                          if (OUTCOME(ShmAlloc(h, 4000) != nullptr) != damaged) return 2;
                          if (OUTCOME((ShmFree(h, kept), 0)) != damaged) return 3;
                          return OUTCOME((ShmPrintFree(sink, h->base), 0)) == damaged ? 0 : 4;
                      },
                      10),
                  0)
            << c.what << ": 1 count, 2 alloc, 3 free, 4 dump; 142 looped, above 128 a signal";
        EXPECT_EQ(heads(h), lists) << c.what;
        EXPECT_EQ(std::exchange(*c.word, saved), c.value) << c.what;
        EXPECT_EQ(h->base->busy, 0u) << c.what;
        EXPECT_EQ(pthread_mutex_trylock(&h->base->mutex), 0) << c.what << ": the lock was kept";
        pthread_mutex_unlock(&h->base->mutex);
    }
    fclose(sink);
}

TEST_F(ShmDeathTest, DoubleFreeEndsWithStatus100AndLeavesTheSegmentUsable) {
    ShmHandle *h = create(1u << 16);
    ASSERT_NE(h, nullptr);
    char *a = static_cast<char *>(ShmAlloc(h, 100)), *b = static_cast<char *>(ShmAlloc(h, 100));
    char *c = static_cast<char *>(ShmAlloc(h, 200)), *d = static_cast<char *>(ShmAlloc(h, 1000));
    ASSERT_EQ(std::vector<long>({b - a, c - a, d - a}), std::vector<long>({128, 256, 1024}));
    constexpr char kDoubleFree[] = "^ShmFree\\(\\): double-free\n$";
    // a and b merge, and the merged block is known by its new class.
    EXPECT_EXIT((ShmFree(h, a), ShmFree(h, b), ShmFree(h, a)), testing::ExitedWithCode(100), kDoubleFree);
    // d's partner holds a, b and c: d merges with nothing. A second handle: the descriptor lock too.
    ShmHandle *second = keep(ShmOpen(name(), O_RDWR));
    EXPECT_EXIT((ShmFree(h, d), ShmFree(second, d)), testing::ExitedWithCode(100), kDoubleFree);
    // The children's frees happened in the segment, and their locks are free again.
    EXPECT_EQ(OUTCOME(ShmTotalFree(second)), (Outcome{(1 << 16) - 256, 0}));
    EXPECT_EQ(ShmAlloc(h, 1000), d);
}

/* The segment lock shuts other processes out and wakes them when released:
 * the in-segment mutex always, the descriptor lock once a second read-write
 * handle has attached. Children never woken end by alarm (142). */
TEST_F(Shm, LockShutsOutOtherProcessesAndWakesThem) {
    ShmHandle *h = create(16 * kPage);
    ASSERT_NE(h, nullptr);
    auto blocked_until = [&](const std::function<void()> &release) {
        const pid_t child = start_child([&] { return ShmAlloc(h, 8) != nullptr ? 0 : 1; }, 20);
        usleep(scaled(300, 1500) * 1000);
        const bool waiting = waitpid(child, nullptr, WNOHANG) == 0;
        release();
        return std::pair{waiting, wait_status(child)};
    };
    std::optional<qorbu::shm::SegmentLock> lock(std::in_place, h);
    EXPECT_EQ(blocked_until([&] { lock.reset(); }), (std::pair{true, 0})) << "mutex: (waited, status)";
    const int other = shm_open(("/" + std::string(name())).c_str(), O_RDONLY, 0);
    ASSERT_EQ(flock(other, LOCK_EX), 0);
    EXPECT_EQ(run_in_child([&] { return ShmAlloc(h, 8) != nullptr ? 0 : 1; }, 20), 0)
        << "flock with useFlock 0";
    ASSERT_NE(keep(ShmOpen(name(), O_RDWR)), nullptr);
    EXPECT_EQ(h->base->useFlock, 1u);
    EXPECT_EQ(blocked_until([&] { flock(other, LOCK_UN); }), (std::pair{true, 0}))
        << "flock: (waited, status)";
    ::close(other);
}

TEST_F(Shm, RandomOperationsFollowTheModel) {
    std::mt19937 rng(1);
    size_t shape = 0;
    for (uint32_t bytes : {kPage, 5 * kPage, 37 * kPage, (1u << 20) + 3 * kPage, 4u << 20}) {
        for (bool placed : {true, false}) { // else the data area lies a page above a 64 KiB boundary
            ShmHandle *h = create(bytes, placed ? 0 : free_data_address(bytes + 2 * kPage, 1 << 16), shape++);
            ASSERT_NE(h, nullptr);
            OperationRun run(h);
            std::string broken;
            for (int op = 0; op < scaled(3000, 600) && broken.empty(); op++) broken = run.step(rng(), rng());
            EXPECT_EQ(broken.empty() ? run.finish() : broken, "") << bytes << " bytes, placed " << placed;
            close(h);
        }
    }
}

TEST_F(Shm, FourProcessesAllocateAndFreeAtRandom) {
    ShmHandle *h = create(16u << 20);
    ASSERT_NE(h, nullptr);
    for (pid_t pid : start_workers(name(), 4, scaled(20000, 2000))) EXPECT_EQ(wait_status(pid), 0);
    EXPECT_EQ(h->base->busy, 0u);
    EXPECT_EQ(list_difference(h->base, BuddyModel(h)), "") << "all freed: the lists of a fresh segment";
}

/* Killed outside an operation, a holder costs nothing: the processes that
 * waited for the lock go on. Killed inside one, it leaves the segment
 * refusing every locked operation, at once. */
TEST_F(Shm, ProcessesKilledHoldingTheLock) {
    if (kEmulated) GTEST_SKIP() << "qemu-user lacks robust mutexes (set_robust_list)";
    ShmHandle *h = create(4u << 20);
    ASSERT_NE(h, nullptr);
    pid_t holder = start_lock_holder(name(), false);
    const std::vector<pid_t> workers = start_workers(name(), 2, 3000);
    usleep(200 * 1000);
    EXPECT_EQ(kill(holder, SIGKILL) == 0 ? wait_status(holder) : -1, 128 + SIGKILL);
    for (pid_t pid : workers) EXPECT_EQ(wait_status(pid), 0);
    EXPECT_EQ(list_difference(h->base, BuddyModel(h)), "");

    void *kept = ShmAlloc(h, 1000);
    const std::vector<uintptr_t> lists = heads(h);
    holder = start_lock_holder(name(), true);
    EXPECT_EQ(kill(holder, SIGKILL) == 0 ? wait_status(holder) : -1, 128 + SIGKILL);
    EXPECT_EQ(run_in_child(
                  [&] {
                      if (OUTCOME(ShmAlloc(h, 8) != nullptr) != Outcome{0, EBUSY}) return 1;
                      if (OUTCOME((ShmFree(h, kept), 0)) != Outcome{0, EBUSY}) return 2;
                      return OUTCOME(ShmOpen(name(), O_RDWR) != nullptr) == Outcome{0, EBUSY} ? 0 : 3;
                  },
                  20),
              0)
        << "142: hung";
    EXPECT_EQ(OUTCOME(ShmTotalFree(h)), (Outcome{0, EBUSY}));
    EXPECT_EQ(heads(h), lists);
}
