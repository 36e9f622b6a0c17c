/* Creating, attaching, closing and unlinking segments, their validation and
 * publication, and the accessors. */
#include "shm/shm_private.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

namespace qorbu::shm {

std::atomic<uintptr_t> cached_page_size{0};

uintptr_t read_page_size() {
    const auto page = static_cast<uintptr_t>(getpagesize());
    cached_page_size.store(page, std::memory_order_relaxed);
    return page;
}

uint32_t segment_length(uint32_t size) {
    const uint32_t page = static_cast<uint32_t>(page_size());
    const uint32_t slack = 2 * page - 1;
    if (size == 0 || size > UINT32_MAX - slack) return 0;
    return (size + slack) & ~(page - 1);
}

int validate_header(uintptr_t base, uint32_t size, uint64_t object_length) {
    const uintptr_t page = page_size();
    const bool sound = base != 0 && base % page == 0 && size % page == 0 && size >= 2 * page &&
                       size <= object_length && base + (size - 1) > base;
    return sound ? 0 : EINVAL;
}

void divide_data_area(ShmHeader *h, uint32_t length) {
    uintptr_t position = h->base + page_size();
    uintptr_t remaining = length - page_size();
    int k = 0;
    while (k < kLargestClass && block_size(k) < remaining) k++;
    for (; k >= 0; k--) {
        while (remaining >= block_size(k)) {
            *reinterpret_cast<uintptr_t *>(position) = h->freeList[k];
            h->freeList[k] = position;
            position += block_size(k);
            remaining -= block_size(k);
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

bool valid_request(const OpenRequest &r) {
    if (r.mode != O_RDONLY && r.mode != O_RDWR) return false;
    if (r.addr % kAddressAlignment != 0) return false;
    if (r.name == nullptr || r.name[0] == '\0' || strchr(r.name, '/') != nullptr ||
        strchr(r.name, ':') != nullptr) {
        return false;
    }
    if (r.intent != Intent::Create) return true;
    // The header page goes below addr: it must exist and be page-aligned.
    if (r.addr != 0 && (r.addr <= page_size() || r.addr % page_size() != 0)) return false;
    return segment_length(r.size) != 0;
}

/* "/" followed by the name, in memory from malloc. */
char *object_name(const char *name) {
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
ShmHandle *close_with_error(ShmHandle *h, int err) {
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
    bool wait_again() const {
        struct timespec now;
        clock_gettime(CLOCK_MONOTONIC, &now);
        const long long elapsed_nanos =
            (now.tv_sec - start_.tv_sec) * 1000000000LL + (now.tv_nsec - start_.tv_nsec);
        if (elapsed_nanos >= kPublishWaitMillis * 1000000LL) return false;
        usleep(kPublishPollMicros);
        return true;
    }

  private:
    struct timespec start_;
};

/* Reading the first page of an object with no length yet would fault. A
 * creator sizes the object in one step to whole pages, header and data:
 * any other length is no segment. */
int wait_for_length(int fd, struct stat *st, const Deadline &deadline) {
    for (;;) {
        if (fstat(fd, st) != 0) return errno;
        if (st->st_size != 0) break;
        if (!deadline.wait_again()) return ETIMEDOUT;
    }
    const auto page = static_cast<off_t>(page_size());
    const auto length = static_cast<unsigned long long>(st->st_size);
    return st->st_size % page == 0 && st->st_size >= 2 * page && length <= UINT32_MAX ? 0 : EINVAL;
}

/* Waits, through a read-only view of the first page, until the creator has
 * published the header; returns the recorded base and length. */
int read_published_header(int fd, uintptr_t *base, uint32_t *size, const Deadline &deadline) {
    const size_t page = page_size();
    void *first = mmap(nullptr, page, PROT_READ, MAP_SHARED, fd, 0);
    if (first == MAP_FAILED) return errno;
    const auto *header = static_cast<const ShmHeader *>(first);
    int err = 0;
    while ((*size = load_published_size(header)) == 0 && err == 0) {
        if (!deadline.wait_again()) err = ETIMEDOUT;
    }
    *base = header->base;
    munmap(first, page);
    return err;
}

/* Maps an existing segment at the base recorded in its header, after the
 * header has been published and found sound. */
int map_existing(ShmHandle *h) {
    const Deadline deadline;
    struct stat st;
    if (int err = wait_for_length(h->fd, &st, deadline)) return err;
    uintptr_t base = 0;
    uint32_t size = 0;
    if (int err = read_published_header(h->fd, &base, &size, deadline)) return err;
    if (fstat(h->fd, &st) != 0) return errno;
    if (int err = validate_header(base, size, static_cast<uint64_t>(st.st_size))) return err;
    return attach_mapping(h, st.st_dev, st.st_ino, base, size);
}

/* A read-only handle cannot take the mutex: it waits a little for an
 * allocation or free in progress, and takes a busy word that stays set for
 * one left behind by a holder that died. */
bool busy_clears_for_reader(const ShmHeader *header) {
    for (int poll = 0; poll < kReadOnlyBusyPolls; poll++) {
        if (load_word(header->busy) == 0) return true;
        usleep(kReadOnlyBusyPollMicros);
    }
    return load_word(header->busy) == 0;
}

/* The last steps of every attach of an already published segment. */
ShmHandle *finish_attach(ShmHandle *h) {
    if (h->writable) store_word(h->base->useFlock, 1);
    if (load_word(h->base->busy) == 0) return h;
    if (!h->writable) return busy_clears_for_reader(h->base) ? h : close_with_error(h, EBUSY);
    SegmentLock lock(h);
    if (int err = lock.error()) return close_with_error(h, err);
    return h;
}

int initialise_fresh(ShmHandle *h, uint32_t length) {
    ShmHeader *header = h->base;
    for (uintptr_t &head : header->freeList) head = 0;
    header->base = reinterpret_cast<uintptr_t>(header);
    divide_data_area(header, length);
    if (int err = init_segment_mutex(&header->mutex)) return err;
    header->busy = 0;
    header->useFlock = 0;
    publish_size(header, length);
    return 0;
}

/* Sizes, maps and initialises the object when it has no length yet; *fresh
 * tells whether it did. A failure leaves the object empty again, for a
 * later ShmCreate to initialise. */
int initialise_if_empty(ShmHandle *h, const OpenRequest &r, bool *fresh) {
    struct stat st;
    if (fstat(h->fd, &st) != 0) return errno;
    *fresh = st.st_size == 0;
    if (!*fresh) return 0;
    // Mapped before it is sized, so that a refused address leaves it empty.
    const uint32_t length = segment_length(r.size);
    const uintptr_t header = r.addr != 0 ? r.addr - page_size() : 0;
    if (int err = attach_mapping(h, st.st_dev, st.st_ino, header, length)) return err;
    const int err = ftruncate(h->fd, length) != 0 ? errno : initialise_fresh(h, length);
    if (err != 0) {
        detach_mapping(h);
        ftruncate(h->fd, 0);
    }
    return err;
}

/* Creators that meet on one new name take the object's descriptor lock
 * before they look at its length and keep it until the header is
 * published: exactly one of them initialises, the others find it sized
 * and attach. */
int create_once(ShmHandle *h, const OpenRequest &r, bool *fresh) {
    const Deadline deadline;
    while (flock(h->fd, LOCK_EX | LOCK_NB) != 0) {
        if (errno != EWOULDBLOCK && errno != EINTR) return errno;
        if (!deadline.wait_again()) return ETIMEDOUT;
    }
    const int err = initialise_if_empty(h, r, fresh);
    flock(h->fd, LOCK_UN);
    return err;
}

ShmHandle *open_segment(const OpenRequest &r) {
    if (!valid_request(r)) {
        errno = EINVAL;
        return nullptr;
    }
    char *object = object_name(r.name);
    if (object == nullptr) return nullptr;
    auto *h = static_cast<ShmHandle *>(malloc(sizeof(ShmHandle)));
    if (h == nullptr) {
        free(object);
        return nullptr;
    }
    *h = ShmHandle{-1, nullptr, 0, r.mode == O_RDWR, nullptr};
    const int flags = r.mode | (r.intent == Intent::Create ? O_CREAT : 0);
    h->fd = shm_open(object, flags, r.intent == Intent::Create ? 0660 : 0);
    const int open_error = errno;
    free(object);
    if (h->fd < 0) {
        free(h);
        errno = open_error;
        return nullptr;
    }
    if (fcntl(h->fd, F_SETFD, FD_CLOEXEC) != 0) return discard(h, errno);

    bool fresh = false;
    if (r.intent == Intent::Create) {
        if (int err = create_once(h, r, &fresh)) return discard(h, err);
    }
    if (fresh) return h;
    if (int err = map_existing(h)) return discard(h, err);
    return finish_attach(h);
}

} // namespace

} // namespace qorbu::shm

using namespace qorbu::shm;

extern "C" {

QORBU_API ShmHandle *ShmCreate(const char *name, void *addr, uint32_t size) {
    return open_segment({name, O_RDWR, reinterpret_cast<uintptr_t>(addr), size, Intent::Create});
}

QORBU_API ShmHandle *ShmOpen(const char *name, int mode) {
    return open_segment({name, mode, 0, 0, Intent::Attach});
}

QORBU_API void ShmClose(ShmHandle *h) {
    if (h == nullptr) return;
    detach_mapping(h);
    close(h->fd);
    free(h);
}

QORBU_API int ShmUnlink(const char *name) {
    if (name == nullptr) {
        errno = EINVAL;
        return -1;
    }
    char *object = object_name(name);
    if (object == nullptr) return -1;
    const int result = shm_unlink(object);
    const int err = errno;
    free(object);
    errno = err;
    return result;
}

QORBU_API void *ShmAddr(ShmHandle *h) { return reinterpret_cast<char *>(h->base) + page_size(); }

QORBU_API void *ShmMetadata(ShmHandle *h, uint32_t len) {
    if (len > page_size() - sizeof(ShmHeader)) {
        errno = ENOMEM;
        return nullptr;
    }
    return reinterpret_cast<char *>(h->base) + sizeof(ShmHeader);
}

QORBU_API int ShmOverhead(void) { return static_cast<int>(page_size()); }

} // extern "C"
