/* The process's one mapping of each attached segment, shared by all of the
 * process's handles of that segment and unmapped by the last ShmClose. */
#include "shm/shm_private.h"

#include <cerrno>
#include <cstdlib>
#include <pthread.h>
#include <sys/mman.h>

#ifndef MAP_FIXED_NOREPLACE
#define MAP_FIXED_NOREPLACE 0x100000
#endif

namespace qorbu::shm {

namespace {

pthread_mutex_t table_lock = PTHREAD_MUTEX_INITIALIZER;
ShmMapping *table = nullptr;

class TableGuard {
  public:
    TableGuard() { pthread_mutex_lock(&table_lock); }
    ~TableGuard() { pthread_mutex_unlock(&table_lock); }
    TableGuard(const TableGuard &) = delete;
    TableGuard &operator=(const TableGuard &) = delete;
};

ShmMapping *find_mapping(dev_t dev, ino_t ino) {
    for (ShmMapping *m = table; m != nullptr; m = m->next) {
        if (m->dev == dev && m->ino == ino) return m;
    }
    return nullptr;
}

void unlink_mapping(ShmMapping *gone) {
    for (ShmMapping **link = &table; *link != nullptr; link = &(*link)->next) {
        if (*link == gone) {
            *link = gone->next;
            return;
        }
    }
}

int protection_for(bool writable) { return writable ? PROT_READ | PROT_WRITE : PROT_READ; }

/* Where the system may place a segment: a header address at which the data
 * area starts on a multiple of its length rounded up to a power of two (at
 * most the largest block), so that every block can merge with its partner.
 * A reservation of the room needed is made and kept in *reserved (0 when
 * even that fails: the system then picks any address). */
uintptr_t aligned_place(uint32_t length, uintptr_t *reserved, size_t *reserved_length) {
    const uintptr_t page = page_size();
    uintptr_t align = page;
    while (align < length - page && align < block_size(kLargestClass)) align <<= 1;
    *reserved_length = length + align;
    *reserved = 0;
    if (*reserved_length < length) return 0; // no room in a 32-bit address space
    void *p = mmap(nullptr, *reserved_length, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
    if (p == MAP_FAILED) return 0;
    *reserved = reinterpret_cast<uintptr_t>(p);
    return ((*reserved + page + align - 1) & ~(align - 1)) - page;
}

/* Maps at exactly addr without replacing anything there (some kernels and
 * emulators take the flag as a mere hint), or at a place of the library's
 * choosing for addr 0. */
int map_segment(int fd, uintptr_t addr, uint32_t length, bool writable, uintptr_t *mapped) {
    uintptr_t reserved = 0;
    size_t reserved_length = 0;
    int flags = MAP_SHARED;
    if (addr != 0) {
        flags |= MAP_FIXED_NOREPLACE;
    } else if ((addr = aligned_place(length, &reserved, &reserved_length)) != 0) {
        flags |= MAP_FIXED; // over this call's own reservation
    }
    void *p = mmap(reinterpret_cast<void *>(addr), length, protection_for(writable), flags, fd, 0);
    const int err = errno;
    if (reserved != 0) {
        // Give back the parts of the reservation that the segment does not cover.
        const uintptr_t end = addr + length, reserved_end = reserved + reserved_length;
        if (p == MAP_FAILED) {
            munmap(reinterpret_cast<void *>(reserved), reserved_length);
        } else {
            if (addr > reserved) munmap(reinterpret_cast<void *>(reserved), addr - reserved);
            if (reserved_end > end) munmap(reinterpret_cast<void *>(end), reserved_end - end);
        }
    }
    if (p == MAP_FAILED) return err;
    if (addr != 0 && reinterpret_cast<uintptr_t>(p) != addr) {
        munmap(p, length);
        return EEXIST;
    }
    *mapped = reinterpret_cast<uintptr_t>(p);
    return 0;
}

/* A read-only mapping becomes read-write when a read-write handle joins it:
 * the same object mapped again over its own range, contents unchanged. A
 * failed fixed mapping may have dropped the old one: a read-only view is
 * put back, so that the other handles keep a mapping. */
int upgrade_to_writable(ShmMapping *m, int fd) {
    void *where = reinterpret_cast<void *>(m->base);
    if (upgrade_map(where, m->length, PROT_READ | PROT_WRITE, MAP_SHARED | MAP_FIXED, fd, 0) != MAP_FAILED) {
        m->writable = true;
        return 0;
    }
    const int err = errno;
    mmap(where, m->length, PROT_READ, MAP_SHARED | MAP_FIXED, fd, 0);
    return err;
}

void fill_handle(ShmHandle *h, ShmMapping *m) {
    h->base = reinterpret_cast<ShmHeader *>(m->base);
    h->size = m->length;
    h->mapping = m;
    m->handles++;
    if (h->writable) m->writers++;
}

} // namespace

void *(*upgrade_map)(void *, size_t, int, int, int, off_t) = mmap;

int attach_mapping(ShmHandle *h, dev_t dev, ino_t ino, uintptr_t addr, uint32_t length) {
    TableGuard guard;
    if (ShmMapping *m = find_mapping(dev, ino)) {
        if (h->writable && !m->writable) {
            if (int err = upgrade_to_writable(m, h->fd)) return err;
        }
        fill_handle(h, m);
        return 0;
    }
    auto *m = static_cast<ShmMapping *>(malloc(sizeof(ShmMapping)));
    if (m == nullptr) return ENOMEM;
    uintptr_t mapped = 0;
    if (int err = map_segment(h->fd, addr, length, h->writable, &mapped)) {
        free(m);
        return err;
    }
    *m = ShmMapping{dev, ino, mapped, length, h->writable != 0, 0, 0, table, {}, {}};
    m->area = data_area_of(reinterpret_cast<void *>(mapped), length, page_size());
    for (int k = 0; k < kClassCount; k++) m->shapes[k] = ClassShape(m->area, k);
    table = m;
    fill_handle(h, m);
    return 0;
}

void detach_mapping(ShmHandle *h) {
    ShmMapping *m = h->mapping;
    if (m == nullptr) return;
    TableGuard guard;
    h->mapping = nullptr;
    if (h->writable) m->writers--;
    if (--m->handles > 0) {
        // The read-only handles left must not be able to write the segment.
        if (m->writers == 0 && m->writable &&
            mprotect(reinterpret_cast<void *>(m->base), m->length, PROT_READ) == 0) {
            m->writable = false;
        }
        return;
    }
    unlink_mapping(m);
    munmap(reinterpret_cast<void *>(m->base), m->length);
    free(m);
}

uint32_t mapped_length(const void *base) {
    TableGuard guard;
    for (ShmMapping *m = table; m != nullptr; m = m->next) {
        if (m->base == reinterpret_cast<uintptr_t>(base)) return m->length;
    }
    return 0;
}

} // namespace qorbu::shm
