/* Segments: argument and header validation, layout of a fresh segment,
 * attaching (shared mappings, occupied ranges, publication waits), and the
 * useFlock and busy rules. */
#include "shm/shm.h"
#include "shm/shm_private.h"
#include "shm_model.h"
#include "shm_test_util.h"

#include <poll.h>
#include <cstring>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/file.h>

using namespace qorbu::test;

namespace {

constexpr uint32_t kExampleSize = 20480;

/* A handle made at a fixed header address free in this process. */
ShmHandle *createAtFreeAddress(const char *name, uint32_t size, uintptr_t *header) {
    *header = freeHeaderAddress(size + 2 * pageBytes());
    if (*header == 0) return nullptr;
    return ShmCreate(name, reinterpret_cast<void *>(*header + pageBytes()), size);
}

std::string objectPath(const char *name) { return std::string("/") + name; }

/* An object of `pages` pages whose header page holds base and size as given
 * (and a sound mutex and lists), as a broken or foreign creator leaves it. */
void writeRawHeader(const char *name, uint32_t pages, uintptr_t base, uint32_t size) {
    const int fd = shm_open(objectPath(name).c_str(), O_RDWR | O_CREAT, 0600);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(ftruncate(fd, pages * pageBytes()), 0);
    void *p = mmap(nullptr, pages * pageBytes(), PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
    ASSERT_NE(p, MAP_FAILED);
    auto *h = static_cast<ShmHeader *>(p);
    ASSERT_EQ(qorbu::shm::initSegmentMutex(&h->mutex), 0);
    h->base = base;
    qorbu::shm::publishSize(h, size);
    munmap(p, pages * pageBytes());
    close(fd);
}

} // namespace

TEST(ShmValidation, BadArgumentsFailWithEinvalAndAcquireNothing) {
    NameGuard name("args");
    const int fds = openDescriptorCount();
    struct Case {
        const char *what;
        std::function<ShmHandle *()> call;
    } cases[] = {
        {"O_WRONLY", [&] { return ShmOpen(name.c_str(), O_WRONLY); }},
        {"O_RDWR|O_CREAT", [&] { return ShmOpen(name.c_str(), O_RDWR | O_CREAT); }},
        {"address 0x40000800", [&] { return ShmCreate(name.c_str(), (void *)0x40000800, 4096); }},
        {"empty name (create)", [] { return ShmCreate("", nullptr, 4096); }},
        {"empty name (open)", [] { return ShmOpen("", O_RDONLY); }},
        {"slash (create)", [] { return ShmCreate("a/b", nullptr, 4096); }},
        {"slash (open)", [] { return ShmOpen("a/b", O_RDWR); }},
        {"colon (create)", [] { return ShmCreate("a:b", nullptr, 4096); }},
        {"colon (open)", [] { return ShmOpen("a:b", O_RDONLY); }},
        {"size 0", [&] { return ShmCreate(name.c_str(), nullptr, 0); }},
        {"size 2^32-1", [&] { return ShmCreate(name.c_str(), nullptr, UINT32_MAX); }},
        {"first wrapping size",
         [&] { return ShmCreate(name.c_str(), nullptr, UINT32_MAX - 2 * uint32_t(pageBytes()) + 2); }},
    };
    for (const Case &c : cases) {
        errno = 0;
        EXPECT_EQ(c.call(), nullptr) << c.what;
        EXPECT_EQ(errno, EINVAL) << c.what;
    }
    if (pageBytes() == 4096) {
        errno = 0;
        EXPECT_EQ(ShmCreate(name.c_str(), reinterpret_cast<void *>(0x1000), 1), nullptr);
        EXPECT_EQ(errno, EINVAL) << "a data address whose header would sit at 0";
    }
    EXPECT_EQ(openDescriptorCount(), fds);
    errno = 0;
    EXPECT_EQ(ShmOpen(name.c_str(), O_RDONLY), nullptr) << "a refused create made the object";
    EXPECT_EQ(errno, ENOENT);
}

TEST(ShmValidation, UntrustworthyHeadersFailWithEinvalAndAcquireNothing) {
    const uintptr_t page = pageBytes();
    const uintptr_t header = freeHeaderAddress(8 * page);
    ASSERT_NE(header, 0u);
    struct Case {
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
    for (const Case &c : cases) {
        NameGuard name("hdr");
        writeRawHeader(name.c_str(), 3, c.base, c.size);
        const int fds = openDescriptorCount();
        for (int mode : {O_RDONLY, O_RDWR}) {
            errno = 0;
            EXPECT_EQ(ShmOpen(name.c_str(), mode), nullptr) << c.what;
            EXPECT_EQ(errno, EINVAL) << c.what;
            errno = 0;
        }
        EXPECT_EQ(ShmCreate(name.c_str(), nullptr, 1), nullptr) << c.what;
        EXPECT_EQ(errno, EINVAL) << c.what;
        EXPECT_EQ(openDescriptorCount(), fds) << c.what;
        EXPECT_TRUE(rangeIsFree(header, 4 * page)) << c.what;
    }
}

TEST(ShmSegment, WorkedExampleLayout) {
    if (pageBytes() != 4096) GTEST_SKIP() << "the worked example assumes 4 KiB pages";
    NameGuard name("layout");
    uintptr_t H = 0;
    ShmHandle *h = createAtFreeAddress(name.c_str(), kExampleSize, &H);
    ASSERT_NE(h, nullptr) << strerror(errno);
    if (H != 0x40000000u) std::printf("header at %#lx: 0x40000000 is in use here\n", (unsigned long)H);
    EXPECT_EQ(reinterpret_cast<uintptr_t>(h->base), H);
    EXPECT_EQ(reinterpret_cast<uintptr_t>(ShmAddr(h)), H + 0x1000);
    EXPECT_EQ(ShmOverhead(), 4096);
    EXPECT_EQ(h->size, 24576u);
    const ShmHeader *hdr = h->base;
    EXPECT_EQ(hdr->base, H);
    EXPECT_EQ(hdr->size, 24576u);
    EXPECT_EQ(hdr->useFlock, 0u);
    EXPECT_EQ(hdr->busy, 0u);
    for (int k = 0; k < kClasses; k++) {
        const uintptr_t expected = k == 11 ? H + 0x1000 : k == 9 ? H + 0x5000 : 0;
        EXPECT_EQ(hdr->freeList[k], expected) << "class " << k;
    }
    EXPECT_EQ(*reinterpret_cast<uintptr_t *>(H + 0x1000), 0u);
    EXPECT_EQ(*reinterpret_cast<uintptr_t *>(H + 0x5000), 0u);
    EXPECT_EQ(ShmTotalFree(h), kExampleSize);

    const uint32_t metadataRoom = uint32_t(4096 - sizeof(ShmHeader));
    if (sizeof(uintptr_t) == 4) {
        EXPECT_EQ(metadataRoom, 3948u);
    }
    EXPECT_EQ(reinterpret_cast<uintptr_t>(ShmMetadata(h, metadataRoom)), H + sizeof(ShmHeader));
    errno = 0;
    EXPECT_EQ(ShmMetadata(h, metadataRoom + 1), nullptr);
    EXPECT_EQ(errno, ENOMEM);
    ShmClose(h);
    EXPECT_TRUE(rangeIsFree(H, 24576));
}

TEST(ShmSegment, SmallRequestsGiveTwoPagesAndOneBlock) {
    for (uint32_t size : {1u, uint32_t(pageBytes())}) {
        NameGuard name("small");
        ShmHandle *h = ShmCreate(name.c_str(), nullptr, size);
        ASSERT_NE(h, nullptr);
        EXPECT_EQ(h->size, 2 * pageBytes());
        EXPECT_EQ(reinterpret_cast<uintptr_t>(h->base) % pageBytes(), 0u);
        EXPECT_EQ(h->base->base, reinterpret_cast<uintptr_t>(h->base));
        EXPECT_EQ(reinterpret_cast<uintptr_t>(ShmAddr(h)), reinterpret_cast<uintptr_t>(h->base) + pageBytes());
        int nonEmpty = 0;
        for (int k = 0; k < kClasses; k++) nonEmpty += h->base->freeList[k] != 0;
        EXPECT_EQ(nonEmpty, 1);
        if (pageBytes() == 4096) {
            EXPECT_EQ(h->base->freeList[9], reinterpret_cast<uintptr_t>(ShmAddr(h)));
        }
        EXPECT_EQ(ShmTotalFree(h), pageBytes());
        ShmClose(h);
    }
}

TEST(ShmSegment, CreateOnPublishedSegmentAttachesAtItsRecordedBase) {
    NameGuard name("exist");
    uintptr_t H = 0;
    ShmHandle *first = createAtFreeAddress(name.c_str(), 8 * pageBytes(), &H);
    ASSERT_NE(first, nullptr);
    void *block = ShmAlloc(first, 100);
    ASSERT_NE(block, nullptr);
    ShmHeader before;
    memcpy(&before.freeList, first->base->freeList, sizeof before.freeList);
    ShmClose(first);
    ASSERT_TRUE(rangeIsFree(H, 9 * pageBytes()));

    const uintptr_t elsewhere = freeHeaderAddress(64 * pageBytes()) + 32 * pageBytes();
    ShmHandle *again = ShmCreate(name.c_str(), reinterpret_cast<void *>(elsewhere), 1);
    ASSERT_NE(again, nullptr);
    EXPECT_EQ(reinterpret_cast<uintptr_t>(again->base), H) << "mapped where its addresses hold";
    EXPECT_EQ(again->size, 9 * pageBytes()) << "the existing length, not the requested one";
    EXPECT_EQ(memcmp(before.freeList, again->base->freeList, sizeof before.freeList), 0);
    EXPECT_EQ(again->base->useFlock, 1u);
    ShmFree(again, block);
    EXPECT_EQ(ShmTotalFree(again), 8 * pageBytes());
    ShmClose(again);
}

TEST(ShmSegment, HandlesOfOneSegmentShareOneMapping) {
    NameGuard name("share");
    ShmHandle *creator = ShmCreate(name.c_str(), nullptr, 4 * pageBytes());
    ASSERT_NE(creator, nullptr);
    const uintptr_t base = reinterpret_cast<uintptr_t>(creator->base);
    ShmHandle *reader = ShmOpen(name.c_str(), O_RDONLY);
    ASSERT_NE(reader, nullptr);
    EXPECT_EQ(creator->base->useFlock, 0u) << "a read-only attach leaves useFlock alone";
    ShmHandle *writer = ShmOpen(name.c_str(), O_RDWR);
    ASSERT_NE(writer, nullptr);
    EXPECT_EQ(creator->base->useFlock, 1u);
    EXPECT_EQ(reinterpret_cast<uintptr_t>(reader->base), base);
    EXPECT_EQ(reinterpret_cast<uintptr_t>(writer->base), base);
    EXPECT_NE(reader->fd, creator->fd);
    EXPECT_NE(writer->fd, creator->fd);
    EXPECT_NE(writer->fd, reader->fd);

    void *block = ShmAlloc(writer, 64);
    ASSERT_NE(block, nullptr);
    ShmClose(creator);
    ShmFree(writer, block);
    EXPECT_EQ(ShmTotalFree(writer), 4 * pageBytes());
    ShmClose(writer);
    EXPECT_EQ(reader->base->size, 5 * pageBytes()) << "still mapped for the last handle";
    ShmClose(reader);
    EXPECT_TRUE(rangeIsFree(base, 5 * pageBytes()));
}

TEST(ShmSegment, ReadOnlyHandleServesReadsAndRefusesLockedOperations) {
    NameGuard name("ro");
    ShmHandle *creator = ShmCreate(name.c_str(), nullptr, 4 * pageBytes());
    ASSERT_NE(creator, nullptr);
    const uintptr_t base = reinterpret_cast<uintptr_t>(creator->base);
    ShmClose(creator);

    // The read-only handle maps first; the read-write one must still write.
    ShmHandle *reader = ShmOpen(name.c_str(), O_RDONLY);
    ASSERT_NE(reader, nullptr);
    EXPECT_EQ(reinterpret_cast<uintptr_t>(reader->base), base);
    ShmHandle *writer = ShmOpen(name.c_str(), O_RDWR);
    ASSERT_NE(writer, nullptr);
    void *block = ShmAlloc(writer, 10);
    ASSERT_NE(block, nullptr);
    const uint32_t freeBytes = ShmTotalFree(writer);

    errno = 0;
    EXPECT_EQ(ShmAlloc(reader, 10), nullptr);
    EXPECT_EQ(errno, EBADF);
    errno = 0;
    EXPECT_EQ(ShmTotalFree(reader), 0u);
    EXPECT_EQ(errno, EBADF);
    errno = 0;
    ShmFree(reader, block);
    EXPECT_EQ(errno, EBADF);
    EXPECT_EQ(ShmTotalFree(writer), freeBytes) << "the read-only free changed the lists";
    EXPECT_NE(ShmMetadata(reader, 16), nullptr);
    ShmFree(writer, block);
    ShmClose(writer);
    ShmClose(reader);
}

TEST(ShmSegment, NeverMapsOverMemoryInUse) {
    NameGuard name("occupied");
    uintptr_t H = 0;
    ShmHandle *h = createAtFreeAddress(name.c_str(), 4 * pageBytes(), &H);
    ASSERT_NE(h, nullptr);
    ShmClose(h);

    // Something else of this process now lives where the segment was.
    void *mine = mmap(reinterpret_cast<void *>(H + pageBytes()), pageBytes(), PROT_READ | PROT_WRITE,
                      MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    ASSERT_EQ(reinterpret_cast<uintptr_t>(mine), H + pageBytes()) << "hint not honoured here";
    memset(mine, 0x5a, pageBytes());
    const int fds = openDescriptorCount();
    for (int mode : {O_RDONLY, O_RDWR}) {
        errno = 0;
        EXPECT_EQ(ShmOpen(name.c_str(), mode), nullptr);
        EXPECT_EQ(errno, EEXIST);
    }
    NameGuard fresh("occupied-fresh");
    errno = 0;
    EXPECT_EQ(ShmCreate(fresh.c_str(), reinterpret_cast<void *>(H + 2 * pageBytes()), 1), nullptr);
    EXPECT_EQ(errno, EEXIST);
    EXPECT_EQ(openDescriptorCount(), fds);
    EXPECT_EQ(static_cast<unsigned char *>(mine)[0], 0x5a);
    EXPECT_EQ(static_cast<unsigned char *>(mine)[pageBytes() - 1], 0x5a);
    EXPECT_TRUE(rangeIsFree(H, pageBytes()));

    // The refused create left its object empty: another address still works.
    ShmHandle *later = ShmCreate(fresh.c_str(), nullptr, 1);
    ASSERT_NE(later, nullptr);
    EXPECT_EQ(ShmTotalFree(later), pageBytes());
    ShmClose(later);
    munmap(mine, pageBytes());
}

TEST(ShmSegment, OpenOfMissingNameFailsWithEnoent) {
    NameGuard name("missing");
    errno = 0;
    EXPECT_EQ(ShmOpen(name.c_str(), O_RDWR), nullptr);
    EXPECT_EQ(errno, ENOENT);
    EXPECT_EQ(ShmUnlink(name.c_str()), -1);
    EXPECT_EQ(errno, ENOENT);
}

/* The attacher starts before the object has a length; it must neither fault
 * on the first page nor return before the header is published. */
TEST(ShmPublication, AttacherWaitsForLengthThenPublication) {
    NameGuard name("pub-len");
    const int fd = shm_open(objectPath(name.c_str()).c_str(), O_RDWR | O_CREAT, 0600);
    ASSERT_GE(fd, 0);
    close(fd);
    const pid_t child = fork();
    if (child == 0) {
        alarm(120);
        ShmHandle *h = ShmOpen(name.c_str(), O_RDWR);
        if (h == nullptr) _exit(1);
        if (h->base->size == 0) _exit(2);
        _exit(ShmTotalFree(h) == 2 * pageBytes() ? 0 : 3);
    }
    sleep(2);
    ShmHandle *h = ShmCreate(name.c_str(), nullptr, 2 * pageBytes());
    ASSERT_NE(h, nullptr);
    EXPECT_EQ(waitStatus(child), 0);
    EXPECT_EQ(h->base->useFlock, 1u);
    ShmClose(h);
}

TEST(ShmPublication, AttacherWaitsForSizeOfASizedSegment) {
    NameGuard name("pub-size");
    const uintptr_t page = pageBytes();
    const int fd = shm_open(objectPath(name.c_str()).c_str(), O_RDWR | O_CREAT, 0600);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(ftruncate(fd, 3 * page), 0);
    const pid_t child = fork();
    if (child == 0) {
        alarm(120);
        ShmHandle *h = ShmOpen(name.c_str(), O_RDONLY);
        if (h == nullptr) _exit(1);
        const ShmHeader *hdr = h->base;
        if (hdr->base != reinterpret_cast<uintptr_t>(hdr) || hdr->size != 3 * page) _exit(2);
        uintptr_t total = 0;
        for (int k = 0; k < kClasses; k++) total += classBytes(k) * walkList(hdr, k).size();
        _exit(total == 2 * page ? 0 : 3);
    }
    // A slow creator: sized first, header written a while later.
    void *p = mmap(nullptr, 3 * page, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
    ASSERT_NE(p, MAP_FAILED);
    sleep(2);
    auto *hdr = static_cast<ShmHeader *>(p);
    hdr->base = reinterpret_cast<uintptr_t>(p);
    qorbu::shm::divideDataArea(hdr, uint32_t(3 * page));
    ASSERT_EQ(qorbu::shm::initSegmentMutex(&hdr->mutex), 0);
    qorbu::shm::publishSize(hdr, uint32_t(3 * page));
    EXPECT_EQ(waitStatus(child), 0);
    munmap(p, 3 * page);
    close(fd);
}

TEST(ShmBusy, SegmentLeftBusyRefusesLockedOperationsAndReadWriteAttach) {
    NameGuard name("busy");
    ShmHandle *h = ShmCreate(name.c_str(), nullptr, 16 * pageBytes());
    ASSERT_NE(h, nullptr);
    void *block = ShmAlloc(h, 200);
    ASSERT_NE(block, nullptr);
    uintptr_t lists[kClasses];
    memcpy(lists, h->base->freeList, sizeof lists);
    h->base->busy = 1;

    errno = 0;
    EXPECT_EQ(ShmAlloc(h, 8), nullptr);
    EXPECT_EQ(errno, EBUSY);
    errno = 0;
    ShmFree(h, block);
    EXPECT_EQ(errno, EBUSY);
    errno = 0;
    EXPECT_EQ(ShmTotalFree(h), 0u);
    EXPECT_EQ(errno, EBUSY);
    EXPECT_EQ(memcmp(lists, h->base->freeList, sizeof lists), 0);

    const int fds = openDescriptorCount();
    errno = 0;
    EXPECT_EQ(ShmOpen(name.c_str(), O_RDWR), nullptr);
    EXPECT_EQ(errno, EBUSY);
    errno = 0;
    EXPECT_EQ(ShmCreate(name.c_str(), nullptr, 1), nullptr);
    EXPECT_EQ(errno, EBUSY);
    errno = 0;
    EXPECT_EQ(ShmOpen(name.c_str(), O_RDONLY), nullptr) << "busy stays set: not transient";
    EXPECT_EQ(errno, EBUSY);
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
    const int other = shm_open(objectPath(name.c_str()).c_str(), O_RDONLY, 0);
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
    // A child allocates through the first handle and reports when it got
    // through; it must wait for the descriptor lock held above.
    int done[2];
    ASSERT_EQ(pipe(done), 0);
    const pid_t child = fork();
    if (child == 0) {
        alarm(120);
        const char result = ShmAlloc(h, 1) != nullptr ? 'y' : 'n';
        _exit(write(done[1], &result, 1) == 1 ? 0 : 1);
    }
    close(done[1]);
    pollfd waiting{done[0], POLLIN, 0};
    EXPECT_EQ(poll(&waiting, 1, 300), 0) << "allocated while another description held the descriptor lock";
    flock(other, LOCK_UN);
    char result = 0;
    EXPECT_EQ(read(done[0], &result, 1), 1);
    EXPECT_EQ(result, 'y');
    EXPECT_EQ(waitStatus(child), 0);
    close(done[0]);
    close(other);
    ShmClose(second);
    ShmClose(h);
}
