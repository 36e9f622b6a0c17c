/* Segments: argument and header validation, layout of a fresh segment,
 * attaching (shared mappings, occupied ranges, publication waits), and the
 * useFlock and busy rules. */
#include "shm/shm.h"
#include "shm/shm_private.h"
#include "shm_model.h"
#include "shm_test_util.h"

#include <chrono>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <set>
#include <sys/file.h>
#include <vector>

using namespace qorbu::test;

namespace {

/* An object of `pages` pages whose header page holds base and size as given
 * (and a sound mutex), as a broken or foreign creator leaves it. */
void writeRawHeader(const NameGuard &name, uint32_t pages, uintptr_t base, uint32_t size) {
    const int fd = shm_open(name.path().c_str(), O_RDWR | O_CREAT, 0600);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(ftruncate(fd, pages * pageBytes()), 0);
    void *p = mmap(nullptr, pages * pageBytes(), PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
    ASSERT_NE(p, MAP_FAILED);
    auto *h = static_cast<ShmHeader *>(p);
    ASSERT_EQ(qorbu::shm::init_segment_mutex(&h->mutex), 0);
    h->base = base;
    qorbu::shm::publish_size(h, size);
    munmap(p, pages * pageBytes());
    close(fd);
}

} // namespace

TEST(ShmValidation, BadArgumentsRefusedAndSmallSizesRoundedToTwoPages) {
    NameGuard name("args");
    const int fds = openDescriptorCount();
    const char *n = name.c_str();
    EXPECT_REFUSED(EINVAL, ShmOpen(n, O_WRONLY));
    EXPECT_REFUSED(EINVAL, ShmOpen(n, O_RDWR | O_CREAT));
    EXPECT_REFUSED(EINVAL, ShmCreate(n, (void *)0x40000800, 4096));
    for (const char *bad : {"", "a/b", "a:b"}) {
        EXPECT_REFUSED(EINVAL, ShmCreate(bad, nullptr, 4096));
        EXPECT_REFUSED(EINVAL, ShmOpen(bad, O_RDONLY));
    }
    EXPECT_REFUSED(EINVAL, ShmCreate(nullptr, nullptr, 4096));
    EXPECT_REFUSED(EINVAL, ShmOpen(nullptr, O_RDONLY));
    EXPECT_ERRNO(EINVAL, EXPECT_EQ(ShmUnlink(nullptr), -1));
    ShmClose(nullptr);
    EXPECT_REFUSED(EINVAL, ShmCreate(n, nullptr, 0));
    EXPECT_REFUSED(EINVAL, ShmCreate(n, nullptr, UINT32_MAX));
    EXPECT_REFUSED(EINVAL,
                   ShmCreate(n, nullptr, UINT32_MAX - 2 * uint32_t(pageBytes()) + 2)); // first to wrap
    if (pageBytes() == 4096) EXPECT_REFUSED(EINVAL, ShmCreate(n, (void *)0x1000, 1));  // header at 0
    EXPECT_EQ(openDescriptorCount(), fds);
    EXPECT_REFUSED(ENOENT, ShmOpen(n, O_RDONLY)); // no refused create made the object
    EXPECT_ERRNO(ENOENT, EXPECT_EQ(ShmUnlink(n), -1));

    for (uint32_t size : {1u, uint32_t(pageBytes())}) { // two pages, one block
        ShmHandle *h = ShmCreate(n, nullptr, size);
        ASSERT_NE(h, nullptr);
        EXPECT_EQ(h->size, 2 * pageBytes());
        EXPECT_TRUE(listsMatch(h->base, BuddyModel(reinterpret_cast<uintptr_t>(h->base), h->size)));
        EXPECT_EQ(ShmTotalFree(h), pageBytes());
        ShmClose(h);
        ShmUnlink(n);
    }
}

TEST(ShmValidation, UntrustworthyHeadersFailWithEinvalAndAcquireNothing) {
    const uintptr_t page = pageBytes();
    const uintptr_t header = freeHeaderAddress(8 * page);
    ASSERT_NE(header, 0u);
    const struct {
        const char *what;
        uintptr_t base;
        uint32_t size;
    } cases[] = {
        {"base not page-aligned", header + 8, uint32_t(3 * page)},
        {"base 0", 0, uint32_t(3 * page)},
        {"size not a page multiple", header, uint32_t(3 * page + 8)},
        {"a single page", header, uint32_t(page)},
        {"larger than the object", header, uint32_t(4 * page)},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.what);
        NameGuard name("hdr");
        writeRawHeader(name, 3, c.base, c.size);
        const int fds = openDescriptorCount();
        EXPECT_REFUSED(EINVAL, ShmOpen(name.c_str(), O_RDONLY));
        EXPECT_REFUSED(EINVAL, ShmOpen(name.c_str(), O_RDWR));
        EXPECT_REFUSED(EINVAL, ShmCreate(name.c_str(), nullptr, 1));
        EXPECT_EQ(openDescriptorCount(), fds);
        EXPECT_TRUE(rangeIsFree(header, 4 * page));
    }
}

/* Handles of one segment share one mapping, each with its own descriptor;
 * read-only ones serve reads and refuse locked operations. */
TEST(ShmSegment, HandlesShareOneMappingAndReadOnlyOnesRefuseLockedOperations) {
    NameGuard name("share");
    const uint32_t dataBytes = uint32_t(4 * pageBytes());
    ShmHandle *creator = ShmCreate(name.c_str(), nullptr, dataBytes);
    ASSERT_NE(creator, nullptr);
    const uintptr_t base = reinterpret_cast<uintptr_t>(creator->base);
    ShmClose(creator);
    // The read-only handle maps first; the read-write one must still write.
    ShmHandle *reader = ShmOpen(name.c_str(), O_RDONLY);
    ASSERT_NE(reader, nullptr);
    EXPECT_EQ(reader->base->useFlock, 0u) << "a read-only attach leaves useFlock alone";
    ShmHandle *writer = ShmOpen(name.c_str(), O_RDWR);
    ASSERT_NE(writer, nullptr);
    EXPECT_EQ(reader->base->useFlock, 1u);
    EXPECT_EQ(reinterpret_cast<uintptr_t>(reader->base), base);
    EXPECT_EQ(reinterpret_cast<uintptr_t>(writer->base), base);
    EXPECT_NE(writer->fd, reader->fd);

    void *block = ShmAlloc(writer, 64);
    ASSERT_NE(block, nullptr);
    const uint32_t freeBytes = ShmTotalFree(writer);
    EXPECT_REFUSED(EBADF, ShmAlloc(reader, 10));
    EXPECT_REFUSED(EBADF, ShmTotalFree(reader));
    EXPECT_ERRNO(EBADF, ShmFree(reader, block));
    EXPECT_EQ(ShmTotalFree(writer), freeBytes) << "the read-only free changed the lists";
    EXPECT_NE(ShmMetadata(reader, 16), nullptr);
    // The last read-write handle turns the mapping back to read-only.
    ShmHandle *second = ShmOpen(name.c_str(), O_RDWR);
    ASSERT_NE(second, nullptr);
    ShmClose(writer);
    EXPECT_TRUE(mappedWritable(base));
    ShmFree(second, block);
    ShmClose(second);
    EXPECT_FALSE(mappedWritable(base)) << "a read-only handle could write the segment";

    // An upgrade whose mapping fails (and drops the old one) leaves the reader its mapping.
    const int fds = openDescriptorCount();
    qorbu::shm::upgrade_map = [](void *addr, size_t length, int, int, int, off_t) -> void * {
        munmap(addr, length);
        errno = ENOMEM;
        return MAP_FAILED;
    };
    EXPECT_REFUSED(ENOMEM, ShmOpen(name.c_str(), O_RDWR));
    qorbu::shm::upgrade_map = mmap;
    EXPECT_EQ(openDescriptorCount(), fds);
    ASSERT_EQ(reinterpret_cast<uintptr_t>(reader->base), base);
    EXPECT_EQ(reader->base->base, base) << "the reader's mapping is gone";
    EXPECT_FALSE(mappedWritable(base));
    writer = ShmOpen(name.c_str(), O_RDWR);
    ASSERT_NE(writer, nullptr);
    EXPECT_EQ(ShmTotalFree(writer), dataBytes);
    ShmClose(reader); // the handle that mapped first
    ShmClose(writer);
    EXPECT_TRUE(rangeIsFree(base, dataBytes + pageBytes()));
}

/* Attaching never maps over memory in use, and a create that meets a
 * published segment maps it at the base recorded in its header. */
TEST(ShmSegment, AttachesOnlyAtTheRecordedBaseAndNeverOverMemoryInUse) {
    NameGuard name("exist"), fresh("fresh");
    const uintptr_t page = pageBytes();
    uintptr_t H = 0;
    ShmHandle *h = createAtFreeAddress(name.c_str(), 8 * page, &H);
    ASSERT_NE(h, nullptr);
    void *block = ShmAlloc(h, 100);
    ASSERT_NE(block, nullptr);
    uintptr_t heads[kClasses];
    memcpy(heads, h->base->freeList, sizeof heads);
    ShmClose(h);
    ASSERT_TRUE(rangeIsFree(H, 9 * page));

    // Something else of this process now lives where the segment was.
    auto *mine =
        static_cast<unsigned char *>(mmap(reinterpret_cast<void *>(H + page), page, PROT_READ | PROT_WRITE,
                                          MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
    ASSERT_EQ(reinterpret_cast<uintptr_t>(mine), H + page) << "hint not honoured here";
    memset(mine, 0x5a, page);
    const int fds = openDescriptorCount();
    EXPECT_REFUSED(EEXIST, ShmOpen(name.c_str(), O_RDONLY));
    EXPECT_REFUSED(EEXIST, ShmOpen(name.c_str(), O_RDWR));
    EXPECT_REFUSED(EEXIST, ShmCreate(fresh.c_str(), reinterpret_cast<void *>(H + 2 * page), 1));
    EXPECT_EQ(openDescriptorCount(), fds);
    EXPECT_EQ(mine[0], 0x5a);
    EXPECT_EQ(mine[page - 1], 0x5a);
    EXPECT_TRUE(rangeIsFree(H, page));
    munmap(mine, page);

    const uintptr_t elsewhere = freeHeaderAddress(64 * page) + 32 * page;
    h = ShmCreate(name.c_str(), reinterpret_cast<void *>(elsewhere), 1);
    ASSERT_NE(h, nullptr);
    EXPECT_EQ(reinterpret_cast<uintptr_t>(h->base), H) << "mapped where its addresses hold";
    EXPECT_EQ(h->size, 9 * page) << "the existing length, not the requested one";
    EXPECT_EQ(memcmp(heads, h->base->freeList, sizeof heads), 0);
    EXPECT_EQ(h->base->useFlock, 1u);
    ShmFree(h, block);
    EXPECT_EQ(ShmTotalFree(h), 8 * page);
    ShmClose(h);

    // The refused create left its object empty: another address still works.
    h = ShmCreate(fresh.c_str(), nullptr, 1);
    ASSERT_NE(h, nullptr);
    EXPECT_EQ(ShmTotalFree(h), page);
    ShmClose(h);
}

/* The attacher starts before the object has a length, and the creator
 * publishes a while after sizing it: the attacher must neither fault on the
 * first page nor return before the header is published. */
TEST(ShmPublication, AttacherWaitsForLengthThenPublication) {
    NameGuard name("pub");
    const uint32_t size = uint32_t(3 * pageBytes());
    const int fd = shm_open(name.path().c_str(), O_RDWR | O_CREAT, 0600);
    ASSERT_GE(fd, 0);
    const pid_t child = startChild(
        [&] {
            ShmHandle *h = ShmOpen(name.c_str(), O_RDWR);
            if (h == nullptr) return 1;
            if (h->base->base != reinterpret_cast<uintptr_t>(h->base) || h->base->size != size) return 2;
            return ShmTotalFree(h) == size - pageBytes() ? 0 : 3;
        },
        120);
    usleep(500 * 1000); // both pauses well within the attach's bound
    ASSERT_EQ(ftruncate(fd, size), 0);
    auto *hdr = static_cast<ShmHeader *>(mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0));
    ASSERT_NE(hdr, MAP_FAILED);
    usleep(500 * 1000);
    hdr->base = reinterpret_cast<uintptr_t>(hdr);
    qorbu::shm::divide_data_area(hdr, size);
    ASSERT_EQ(qorbu::shm::init_segment_mutex(&hdr->mutex), 0);
    qorbu::shm::publish_size(hdr, size);
    EXPECT_EQ(waitStatus(child), 0);
    EXPECT_EQ(hdr->useFlock, 1u);
    munmap(hdr, size);
    close(fd);
}

/* A creator that died before sizing or publishing, and an object that is no
 * segment: every attach gives up (ETIMEDOUT after the documented wait,
 * EINVAL at once) and keeps nothing. The calls run side by side in
 * children that an alarm ends. */
TEST(ShmPublication, HalfMadeAndJunkObjectsAreGivenUpOn) {
    using Clock = std::chrono::steady_clock;
    const off_t page = off_t(pageBytes());
    const struct {
        const char *what;
        off_t length;
        int err;
    } objects[] = {{"never sized", 0, ETIMEDOUT},
                   {"sized, never published", 3 * page, ETIMEDOUT},
                   {"100 bytes of junk", 100, EINVAL}};
    std::vector<NameGuard> names;
    names.reserve(std::size(objects)); // a NameGuard unlinks its name when it goes
    std::vector<std::pair<std::string, pid_t>> children;
    for (const auto &o : objects) {
        names.emplace_back("half");
        const int fd = shm_open(names.back().path().c_str(), O_RDWR | O_CREAT, 0600);
        ASSERT_GE(fd, 0);
        ASSERT_EQ(ftruncate(fd, o.length), 0);
        if (o.length == 100) {
            ASSERT_EQ(write(fd, std::string(100, 'x').data(), 100), 100);
        }
        close(fd);
        for (int call = 0; call < 3; call++) {
            if (call == 2 && o.length == 0) continue; // ShmCreate initialises an empty object
            const char *name = names.back().c_str();
            const pid_t pid = startChild(
                [=] {
                    const int fds = openDescriptorCount();
                    const auto start = Clock::now();
                    errno = 0;
                    ShmHandle *h = call == 0   ? ShmOpen(name, O_RDONLY)
                                   : call == 1 ? ShmOpen(name, O_RDWR)
                                               : ShmCreate(name, nullptr, 4096);
                    const int err = errno;
                    const auto waited =
                        std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - start);
                    if (h != nullptr || err != o.err) return 1;
                    if (openDescriptorCount() != fds) return 2;
                    if (o.err == ETIMEDOUT && waited.count() < qorbu::shm::kPublishWaitMillis) return 3;
                    return 0;
                },
                60);
            children.emplace_back(std::string(o.what) + ", call " + std::to_string(call), pid);
        }
    }
    for (const auto &[what, pid] : children) {
        EXPECT_EQ(waitStatus(pid), 0) << what << " (1 result, 2 descriptors, 3 gave up early; 142 hung)";
    }
    struct stat st;
    for (size_t i = 0; i < names.size(); i++) {
        const int fd = shm_open(names[i].path().c_str(), O_RDONLY, 0);
        ASSERT_GE(fd, 0);
        ASSERT_EQ(fstat(fd, &st), 0);
        EXPECT_EQ(st.st_size, objects[i].length) << "a refused attach changed the object";
        close(fd);
    }
}

/* Creators that meet on one new name: exactly one initialises it, the
 * others attach, so no block goes to two of them. */
TEST(ShmPublication, CreatorsRacingOnOneNameInitialiseItOnce) {
#ifdef __SANITIZE_THREAD__
    GTEST_SKIP()
        << "under ThreadSanitizer the attaching creators' first allocations fail; other builds run it";
#endif
    constexpr int kCreators = 4;
    for (int round = 0; round < scaled(20, 6); round++) {
        NameGuard name("race");
        int go[2], result[2];
        ASSERT_EQ(pipe(go), 0);
        ASSERT_EQ(pipe(result), 0);
        std::vector<pid_t> pids;
        for (int i = 0; i < kCreators; i++) {
            pids.push_back(startChild(
                [&] {
                    close(go[1]);
                    char c;
                    if (read(go[0], &c, 1) != 0) return 1; // all start at the end of the pipe
                    ShmHandle *h = ShmCreate(name.c_str(), nullptr, 1u << 16);
                    const auto block =
                        reinterpret_cast<uintptr_t>(h != nullptr ? ShmAlloc(h, 1000) : nullptr);
                    return block != 0 && write(result[1], &block, sizeof block) == sizeof block ? 0 : 2;
                },
                120));
        }
        close(go[0]);
        close(result[1]);
        close(go[1]);
        std::set<uintptr_t> blocks;
        for (uintptr_t block; read(result[0], &block, sizeof block) == sizeof block;) blocks.insert(block);
        close(result[0]);
        for (pid_t pid : pids) EXPECT_EQ(waitStatus(pid), 0);
        EXPECT_EQ(blocks.size(), size_t(kCreators)) << "round " << round << ": a block went to two creators";
        ShmHandle *h = ShmOpen(name.c_str(), O_RDWR);
        ASSERT_NE(h, nullptr);
        EXPECT_EQ(ShmTotalFree(h), (1u << 16) - kCreators * 1024u);
        ShmClose(h);
        if (HasFailure()) return;
    }
}

TEST(ShmBusy, SegmentLeftBusyRefusesLockedOperationsAndReadWriteAttach) {
    NameGuard name("busy");
    ShmHandle *h = ShmCreate(name.c_str(), nullptr, 16 * pageBytes());
    ASSERT_NE(h, nullptr);
    void *block = ShmAlloc(h, 200);
    ASSERT_NE(block, nullptr);
    const ListHeads lists(h->base);
    h->base->busy = 1;
    EXPECT_REFUSED(EBUSY, ShmAlloc(h, 8));
    EXPECT_ERRNO(EBUSY, ShmFree(h, block));
    EXPECT_REFUSED(EBUSY, ShmTotalFree(h));
    EXPECT_TRUE(lists.unchanged());

    const int fds = openDescriptorCount();
    EXPECT_REFUSED(EBUSY, ShmOpen(name.c_str(), O_RDWR));
    EXPECT_REFUSED(EBUSY, ShmCreate(name.c_str(), nullptr, 1));
    EXPECT_REFUSED(EBUSY, ShmOpen(name.c_str(), O_RDONLY)); // busy stays set: not transient
    EXPECT_EQ(openDescriptorCount(), fds);
    EXPECT_EQ(h->base->busy, 1u);

    h->base->busy = 0;
    ShmFree(h, block);
    EXPECT_EQ(ShmTotalFree(h), 16 * pageBytes());
    ShmClose(h);
}

TEST(ShmFlock, DescriptorLockTakenOnlyAfterASecondReadWriteAttach) {
    NameGuard name("flock");
    ShmHandle *h = ShmCreate(name.c_str(), nullptr, 16 * pageBytes());
    ASSERT_NE(h, nullptr);
    // Another open description of the object, holding its descriptor lock.
    const int other = shm_open(name.path().c_str(), O_RDONLY, 0);
    ASSERT_GE(other, 0);
    ASSERT_EQ(flock(other, LOCK_EX), 0);
    EXPECT_EQ(runInChild([&] { return ShmTotalFree(h) == 16 * pageBytes() ? 0 : 1; }, 60), 0)
        << "useFlock 0: the descriptor lock must not be taken";

    ShmHandle *second = ShmOpen(name.c_str(), O_RDONLY);
    ASSERT_NE(second, nullptr);
    EXPECT_EQ(h->base->useFlock, 0u);
    EXPECT_EQ(runInChild([&] { return ShmAlloc(h, 1) != nullptr ? 0 : 1; }, 60), 0)
        << "a read-only attach must not turn the descriptor lock on";
    ShmClose(second);

    second = ShmOpen(name.c_str(), O_RDWR);
    ASSERT_NE(second, nullptr);
    ASSERT_EQ(h->base->useFlock, 1u);
    // A child allocating through the first handle must wait for the lock held above.
    const pid_t child = startChild([&] { return ShmAlloc(h, 1) != nullptr ? 0 : 1; }, 120);
    usleep(300 * 1000);
    EXPECT_EQ(waitpid(child, nullptr, WNOHANG), 0)
        << "allocated while another description held the descriptor lock";
    flock(other, LOCK_UN);
    EXPECT_EQ(waitStatus(child), 0);
    close(other);
    ShmClose(second);
    ShmClose(h);
}
