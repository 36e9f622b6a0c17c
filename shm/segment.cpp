/* Creating, attaching, closing and unlinking segments, their validation and
 * publication, and the accessors. */
#include "shm/shm_private.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

namespace qorbu::shm {

std::atomic<uintptr_t> cachedPageSize{0};

uintptr_t readPageSize() {
    const auto page = static_cast<uintptr_t>(getpagesize());
    cachedPageSize.store(page, std::memory_order_relaxed);
    return page;
}

uint32_t segmentLength(uint32_t size) {
    const uint32_t page = static_cast<uint32_t>(pageSize());
    const uint32_t slack = 2 * page - 1;
    if (size == 0 || size > UINT32_MAX - slack) return 0;
    return (size + slack) & ~(page - 1);
}

int validateHeader(uintptr_t base, uint32_t size, uint64_t objectLength) {
    const uintptr_t page = pageSize();
    const bool sound = base != 0 && base % page == 0 && size % page == 0 && size >= 2 * page &&
                       size <= objectLength && base + (size - 1) > base;
    return sound ? 0 : EINVAL;
}

void divideDataArea(ShmHeader *h, uint32_t length) {
    uintptr_t position = h->base + pageSize();
    uintptr_t remaining = length - pageSize();
    int k = 0;
    while (k < kLargestClass && blockSize(k) < remaining) k++;
    for (; k >= 0; k--) {
        while (remaining >= blockSize(k)) {
            *reinterpret_cast<uintptr_t *>(position) = h->freeList[k];
            h->freeList[k] = position;
            position += blockSize(k);
            remaining -= blockSize(k);
        }
    }
}

namespace {

enum class Intent { Create, Attach };

struct OpenRequest {
    const char *name;
    int mode;
    uintptr_t addr;
    uint32_t size;
    Intent intent;
};

bool validRequest(const OpenRequest &r) {
    if (r.mode != O_RDONLY && r.mode != O_RDWR) return false;
    if (r.addr % kAddressAlignment != 0) return false;
    if (r.name == nullptr || r.name[0] == '\0' || strchr(r.name, '/') != nullptr || strchr(r.name, ':') != nullptr) {
        return false;
    }
    if (r.intent != Intent::Create) return true;
    // The header page goes below addr: it must exist and be page-aligned.
    if (r.addr != 0 && (r.addr <= pageSize() || r.addr % pageSize() != 0)) return false;
    return segmentLength(r.size) != 0;
}

/* "/" followed by the name, in memory from malloc. */
char *objectName(const char *name) {
    const size_t length = strlen(name);
    auto *object = static_cast<char *>(malloc(length + 2));
    if (object == nullptr) return nullptr;
    object[0] = '/';
    memcpy(object + 1, name, length + 1);
    return object;
}

/* Closes the descriptor and frees a handle that holds no mapping, keeping
 * the errno value of the failure. Returns null for the caller to return. */
ShmHandle *discard(ShmHandle *h, int err) {
    close(h->fd);
    free(h);
    errno = err;
    return nullptr;
}

/* Like ShmClose, keeping the errno value of the failure. */
ShmHandle *closeWithError(ShmHandle *h, int err) {
    ShmClose(h);
    errno = err;
    return nullptr;
}

/* The attach waits: a creator publishes within moments of creating the
 * object, so one that has not done so after kPublishWaitMillis died, or
 * the object is no segment. */
class Deadline {
  public:
    Deadline() { clock_gettime(CLOCK_MONOTONIC, &start_); }
    /* Sleeps one poll interval; false once the wait has lasted its limit. */
    bool waitAgain() const {
        struct timespec now;
        clock_gettime(CLOCK_MONOTONIC, &now);
        const long long elapsedNanos =
            (now.tv_sec - start_.tv_sec) * 1000000000LL + (now.tv_nsec - start_.tv_nsec);
        if (elapsedNanos >= kPublishWaitMillis * 1000000LL) return false;
        usleep(kPublishPollMicros);
        return true;
    }

  private:
    struct timespec start_;
};

/* Reading the first page of an object with no length yet would fault. A
 * creator sizes the object in one step to whole pages, header and data:
 * any other length is no segment. */
int waitForLength(int fd, struct stat *st, const Deadline &deadline) {
    for (;;) {
        if (fstat(fd, st) != 0) return errno;
        if (st->st_size != 0) break;
        if (!deadline.waitAgain()) return ETIMEDOUT;
    }
    const auto page = static_cast<off_t>(pageSize());
    const auto length = static_cast<unsigned long long>(st->st_size);
    return st->st_size % page == 0 && st->st_size >= 2 * page && length <= UINT32_MAX ? 0 : EINVAL;
}

/* Waits, through a read-only view of the first page, until the creator has
 * published the header; returns the recorded base and length. */
int readPublishedHeader(int fd, uintptr_t *base, uint32_t *size, const Deadline &deadline) {
    const size_t page = pageSize();
    void *first = mmap(nullptr, page, PROT_READ, MAP_SHARED, fd, 0);
    if (first == MAP_FAILED) return errno;
    const auto *header = static_cast<const ShmHeader *>(first);
    int err = 0;
    while ((*size = loadPublishedSize(header)) == 0 && err == 0) {
        if (!deadline.waitAgain()) err = ETIMEDOUT;
    }
    *base = header->base;
    munmap(first, page);
    return err;
}

/* Maps an existing segment at the base recorded in its header, after the
 * header has been published and found sound. */
int mapExisting(ShmHandle *h) {
    const Deadline deadline;
    struct stat st;
    if (int err = waitForLength(h->fd, &st, deadline)) return err;
    uintptr_t base = 0;
    uint32_t size = 0;
    if (int err = readPublishedHeader(h->fd, &base, &size, deadline)) return err;
    if (fstat(h->fd, &st) != 0) return errno;
    if (int err = validateHeader(base, size, static_cast<uint64_t>(st.st_size))) return err;
    return attachMapping(h, st.st_dev, st.st_ino, base, size);
}

/* A read-only handle cannot take the mutex: it waits a little for an
 * allocation or free in progress, and takes a busy word that stays set for
 * one left behind by a holder that died. */
bool busyClearsForReader(const ShmHeader *header) {
    for (int poll = 0; poll < kReadOnlyBusyPolls; poll++) {
        if (loadWord(header->busy) == 0) return true;
        usleep(kReadOnlyBusyPollMicros);
    }
    return loadWord(header->busy) == 0;
}

/* The last steps of every attach of an already published segment. */
ShmHandle *finishAttach(ShmHandle *h) {
    if (h->writable) storeWord(h->base->useFlock, 1);
    if (loadWord(h->base->busy) == 0) return h;
    if (!h->writable) return busyClearsForReader(h->base) ? h : closeWithError(h, EBUSY);
    SegmentLock lock(h);
    if (int err = lock.error()) return closeWithError(h, err);
    return h;
}

int initialiseFresh(ShmHandle *h, uint32_t length) {
    ShmHeader *header = h->base;
    for (uintptr_t &head : header->freeList) head = 0;
    header->base = reinterpret_cast<uintptr_t>(header);
    divideDataArea(header, length);
    if (int err = initSegmentMutex(&header->mutex)) return err;
    header->busy = 0;
    header->useFlock = 0;
    publishSize(header, length);
    return 0;
}

/* Sizes, maps and initialises the object when it has no length yet; *fresh
 * tells whether it did. A failure leaves the object empty again, for a
 * later ShmCreate to initialise. */
int initialiseIfEmpty(ShmHandle *h, const OpenRequest &r, bool *fresh) {
    struct stat st;
    if (fstat(h->fd, &st) != 0) return errno;
    *fresh = st.st_size == 0;
    if (!*fresh) return 0;
    // Mapped before it is sized, so that a refused address leaves it empty.
    const uint32_t length = segmentLength(r.size);
    const uintptr_t header = r.addr != 0 ? r.addr - pageSize() : 0;
    if (int err = attachMapping(h, st.st_dev, st.st_ino, header, length)) return err;
    const int err = ftruncate(h->fd, length) != 0 ? errno : initialiseFresh(h, length);
    if (err != 0) {
        detachMapping(h);
        ftruncate(h->fd, 0);
    }
    return err;
}

/* Creators that meet on one new name take the object's descriptor lock
 * before they look at its length and keep it until the header is
 * published: exactly one of them initialises, the others find it sized
 * and attach. */
int createOnce(ShmHandle *h, const OpenRequest &r, bool *fresh) {
    const Deadline deadline;
    while (flock(h->fd, LOCK_EX | LOCK_NB) != 0) {
        if (errno != EWOULDBLOCK && errno != EINTR) return errno;
        if (!deadline.waitAgain()) return ETIMEDOUT;
    }
    const int err = initialiseIfEmpty(h, r, fresh);
    flock(h->fd, LOCK_UN);
    return err;
}

ShmHandle *openSegment(const OpenRequest &r) {
    if (!validRequest(r)) {
        errno = EINVAL;
        return nullptr;
    }
    char *object = objectName(r.name);
    if (object == nullptr) return nullptr;
    auto *h = static_cast<ShmHandle *>(malloc(sizeof(ShmHandle)));
    if (h == nullptr) {
        free(object);
        return nullptr;
    }
    *h = ShmHandle{-1, nullptr, 0, r.mode == O_RDWR, nullptr};
    const int flags = r.mode | (r.intent == Intent::Create ? O_CREAT : 0);
    h->fd = shm_open(object, flags, r.intent == Intent::Create ? 0660 : 0);
    const int openError = errno;
    free(object);
    if (h->fd < 0) {
        free(h);
        errno = openError;
        return nullptr;
    }
    if (fcntl(h->fd, F_SETFD, FD_CLOEXEC) != 0) return discard(h, errno);

    bool fresh = false;
    if (r.intent == Intent::Create) {
        if (int err = createOnce(h, r, &fresh)) return discard(h, err);
    }
    if (fresh) return h;
    if (int err = mapExisting(h)) return discard(h, err);
    return finishAttach(h);
}

} // namespace

} // namespace qorbu::shm

using namespace qorbu::shm;

extern "C" {

QORBU_API ShmHandle *ShmCreate(const char *name, void *addr, uint32_t size) {
    return openSegment({name, O_RDWR, reinterpret_cast<uintptr_t>(addr), size, Intent::Create});
}

QORBU_API ShmHandle *ShmOpen(const char *name, int mode) {
    return openSegment({name, mode, 0, 0, Intent::Attach});
}

QORBU_API void ShmClose(ShmHandle *h) {
    if (h == nullptr) return;
    detachMapping(h);
    close(h->fd);
    free(h);
}

QORBU_API int ShmUnlink(const char *name) {
    if (name == nullptr) {
        errno = EINVAL;
        return -1;
    }
    char *object = objectName(name);
    if (object == nullptr) return -1;
    const int result = shm_unlink(object);
    const int err = errno;
    free(object);
    errno = err;
    return result;
}

QORBU_API void *ShmAddr(ShmHandle *h) {
    return reinterpret_cast<char *>(h->base) + pageSize();
}

QORBU_API void *ShmMetadata(ShmHandle *h, uint32_t len) {
    if (len > pageSize() - sizeof(ShmHeader)) {
        errno = ENOMEM;
        return nullptr;
    }
    return reinterpret_cast<char *>(h->base) + sizeof(ShmHeader);
}

QORBU_API int ShmOverhead(void) { return static_cast<int>(pageSize()); }

} // extern "C"
