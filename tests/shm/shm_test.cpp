/* The shared-memory allocator: refusals, half-made and damaged segments, double frees,
 * the lock across processes, random operations against the model, killed lock holders. */
#include "shm/shm_private.h"
#include "shm_ops.h"
#include "support/test_support.h"

#include <csignal>
#include <deque>
#include <functional>
#include <optional>
#include <random>
#include <sys/file.h>
#include <sys/mman.h>

using namespace qorbu::test;

const uint32_t kPage = static_cast<uint32_t>(page_bytes());

/* A data address with its header page on `align` and `length` free bytes there. */
static uintptr_t free_data_address(size_t length, uintptr_t align) {
    void *p = mmap(nullptr, length + align, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    munmap(p, length + align);
    return ((reinterpret_cast<uintptr_t>(p) + align - 1) & ~(align - 1)) + kPage;
}

class Shm : public ::testing::Test {
  protected:
    // A test left waiting for a lock for ever fails after a minute, saying so.
    Shm() {
        signal(SIGALRM, [](int) {
            (void)!write(2, "hung: ended by its alarm\n", 25);
            _exit(128 + SIGALRM);
        });
        alarm(60);
    }
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

    std::deque<std::string> names_; // c_str() stays valid as it grows
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
    const char *n = name(), *in_use = name(1);
    // What was refused, with busy set or not, the call (true: it was done), the errno.
    const std::tuple<const char *, bool, std::function<bool()>, int> cases[] = {
        {"write-only mode", false, [&] { return ShmOpen(n, O_WRONLY); }, EINVAL},
        {"O_CREAT in the mode", false, [&] { return ShmOpen(n, O_RDWR | O_CREAT); }, EINVAL},
        {"address off 4096", false, [&] { return ShmCreate(n, (void *)0x40000800, 1); }, EINVAL},
        {"size 0", false, [&] { return ShmCreate(n, nullptr, 0); }, EINVAL},
        {"length wraps", false, [&] { return ShmCreate(n, nullptr, ~0u - 2 * kPage + 2); }, EINVAL},
        {"no such segment", false, [&] { return ShmOpen(n, O_RDONLY); }, ENOENT},
        {"metadata > page", false, [&] { return ShmMetadata(h, kPage - sizeof(ShmHeader) + 1); }, ENOMEM},
        {"1 GiB, busy", true, [&] { return ShmAlloc(h, 0x40000000u); }, ENOMEM},
        {"class 27, busy", true, [&] { return ShmAlloc(h, 0x20000001u - sizeof(void *)); }, ENOMEM},
        {"alloc, busy", true, [&] { return ShmAlloc(h, 8); }, EBUSY},
        {"free, busy", true, [&] { return ShmFree(h, block), false; }, EBUSY},
        {"count, busy", true, [&] { return ShmTotalFree(h) != 0; }, EBUSY},
        {"read-write attach, busy", true, [&] { return ShmOpen(in_use, O_RDWR); }, EBUSY},
        {"create meeting it, busy", true, [&] { return ShmCreate(in_use, nullptr, 1); }, EBUSY},
        {"read-only attach, busy for good", true, [&] { return ShmOpen(in_use, O_RDONLY); }, EBUSY},
        {"alloc, read-only", false, [&] { return ShmAlloc(reader, 8); }, EBADF},
        {"free, read-only", false, [&] { return ShmFree(reader, block), false; }, EBADF},
        {"count, read-only", false, [&] { return ShmTotalFree(reader) != 0; }, EBADF},
    };
    const std::vector<uintptr_t> lists = heads(h);
    const int fds = open_descriptor_count();
    for (const auto &[what, busy, call, err] : cases) {
        h->base->busy = busy;
        EXPECT_EQ(OUTCOME(call()), (Outcome{0, err})) << what;
        EXPECT_EQ(std::exchange(h->base->busy, 0), busy) << what;
    }
    for (const char *bad : {"", "a/b", "a:b"}) {
        EXPECT_EQ(OUTCOME(ShmCreate(bad, nullptr, 1) || ShmOpen(bad, O_RDONLY)), (Outcome{0, EINVAL})) << bad;
    }
    EXPECT_EQ(open_descriptor_count(), fds);
    EXPECT_EQ(heads(h), lists);
    EXPECT_EQ(OUTCOME(ShmUnlink(n)), failure(ENOENT)) << "a refused call made the object";
    close(h);
    EXPECT_EQ(perms_at(uintptr_t(reader->base)), "r--s") << "read-only handles could write";
}

/* Objects a creator left half-made when it died, and headers that cannot be
 * trusted: every attach fails in bounded time, keeping nothing. The calls
 * run side by side, each in a child. */
TEST_F(Shm, HalfMadeAndUntrustworthyObjectsAreRefused) {
    const uintptr_t header = free_data_address(4 * kPage, kPage) - kPage;
    // The object's length, the base and size in its header, the errno.
    const std::tuple<const char *, off_t, uintptr_t, uint32_t, int> objects[] = {
        {"never sized", 0, 0, 0, ETIMEDOUT},
        {"never published", 3 * kPage, 0, 0, ETIMEDOUT},
        {"100 bytes", 100, 0, 0, EINVAL},
        {"base off a page", 3 * kPage, header + 8, 3 * kPage, EINVAL},
        {"size off a page", 3 * kPage, header, 3 * kPage + 8, EINVAL},
        {"size beyond the object", 3 * kPage, header, 4 * kPage, EINVAL},
    };
    std::vector<std::pair<std::string, pid_t>> children;
    size_t i = 0;
    for (const auto &[what, length, base, size, err] : objects) {
        const char *n = name(i++);
        const int fd = shm_open(("/" + std::string(n)).c_str(), O_RDWR | O_CREAT, 0600);
        ShmHeader raw{};
        raw.base = base, raw.size = size;
        ASSERT_EQ(ftruncate(fd, length), 0);
        ASSERT_TRUE(length < off_t(kPage) || pwrite(fd, &raw, sizeof raw, 0) == ssize_t(sizeof raw));
        ::close(fd);
        for (int call = length == 0; call < 3; call++) { // ShmCreate initialises an empty object
            const int fds = open_descriptor_count(), expected = err;
            auto attach = [=] {
                auto *h = call == 0 ? ShmCreate(n, nullptr, 1) : ShmOpen(n, call == 1 ? O_RDONLY : O_RDWR);
                return h != nullptr || errno != expected ? 1 : open_descriptor_count() == fds ? 0 : 2;
            };
            children.emplace_back(std::string(what) + ", call " + std::to_string(call),
                                  start_child(attach, 30));
        }
    }
    for (const auto &[what, pid] : children)
        EXPECT_EQ(wait_status(pid), 0) << what << " (1 result, 2 descriptors)";
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
    const std::tuple<const char *, uintptr_t *, uintptr_t> cases[] = {
        {"head in the header page", head, reinterpret_cast<uintptr_t>(h->base) + 64},
        {"head off its class's alignment", head, data + 0x3008},
        {"head at the end of the data area", head, data + 0x10000},
        {"block linked to itself", link, data + 0x3000},
        {"link to a higher block", link, data + 0x8000},
    };
    FILE *sink = fopen("/dev/null", "w");
    auto all_refused = [&] {
        const Outcome damaged{0, EUCLEAN};
        if (OUTCOME(ShmTotalFree(h)) != damaged) return 1;
        if (OUTCOME(ShmAlloc(h, 4000) != nullptr) != damaged) return 2;
        if (OUTCOME((ShmFree(h, kept), 0)) != damaged) return 3;
        return OUTCOME((ShmPrintFree(sink, h->base), 0)) == damaged ? 0 : 4;
    };
    for (const auto &[what, word, value] : cases) {
        const uintptr_t saved = std::exchange(*word, value);
        const std::vector<uintptr_t> lists = heads(h);
        EXPECT_EQ(run_in_child(all_refused, 10), 0)
            << what << ": 1 count, 2 alloc, 3 free, 4 dump; 142 looped";
        EXPECT_EQ(heads(h), lists) << what;
        EXPECT_EQ(std::exchange(*word, saved), value) << what;
        EXPECT_EQ(std::pair(h->base->busy, pthread_mutex_trylock(&h->base->mutex)), std::pair(0u, 0)) << what;
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
    ASSERT_NE(keep(ShmOpen(name(), O_RDWR)), nullptr);
    const int other = shm_open(("/" + std::string(name())).c_str(), O_RDONLY, 0);
    ASSERT_EQ(flock(other, LOCK_EX), 0);
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
            ASSERT_EQ(OperationRun(h, placed).run(rng, scaled(3000, 600)), "")
                << bytes << " bytes, placed " << placed;
            close(h);
        }
    }
}

/* Four processes allocate and free at random while a fifth is killed
 * holding the lock: they go on. Killed inside an operation, a holder leaves
 * the segment refusing every locked operation, at once. */
TEST_F(Shm, ProcessesShareASegmentAndSurviveOneKilledHoldingTheLock) {
    ShmHandle *h = create(16u << 20);
    ASSERT_NE(h, nullptr);
    auto killed_holding_lock = [&](bool busy) {
        return start_child(
            [&] {
                qorbu::shm::SegmentLock lock(ShmOpen(name(), O_RDWR));
                if (busy) lock.mark_busy();
                return lock.error() == 0 ? usleep(200 * 1000), raise(SIGKILL) : 1;
            },
            30);
    };
    const pid_t holder = kEmulated ? 0 : killed_holding_lock(false); // qemu-user: no robust mutexes
    std::vector<pid_t> workers;
    for (unsigned i = 0; i < 4; i++) {
        workers.push_back(start_child(
            [&, i] {
                std::mt19937 rng(i);
                const std::string broken =
                    OperationRun(ShmOpen(name(), O_RDWR), true, false).run(rng, scaled(20000, 2000), 0x7ffff);
                return broken.empty() ? 0 : (fputs(broken.c_str(), stderr), 1);
            },
            30));
    }
    EXPECT_TRUE(holder == 0 || wait_status(holder) == 128 + SIGKILL);
    for (pid_t pid : workers) EXPECT_EQ(wait_status(pid), 0) << "142: waited for the lock for ever";
    EXPECT_EQ(list_difference(h->base, BuddyModel(h)), "") << "all freed: the lists of a fresh segment";
    if (kEmulated) GTEST_SKIP() << "qemu-user lacks robust mutexes: no holder killed";

    void *kept = ShmAlloc(h, 1000);
    const std::vector<uintptr_t> lists = heads(h);
    EXPECT_EQ(wait_status(killed_holding_lock(true)), 128 + SIGKILL);
    EXPECT_EQ(OUTCOME(ShmAlloc(h, 8) != nullptr), (Outcome{0, EBUSY}));
    EXPECT_EQ(OUTCOME((ShmFree(h, kept), 0)), (Outcome{0, EBUSY}));
    EXPECT_EQ(OUTCOME(ShmOpen(name(), O_RDWR) != nullptr), (Outcome{0, EBUSY}));
    EXPECT_EQ(OUTCOME(ShmTotalFree(h)), (Outcome{0, EBUSY}));
    EXPECT_EQ(heads(h), lists);
}
