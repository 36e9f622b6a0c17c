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

struct ShmMapping {
    dev_t dev;
    ino_t ino;
    uintptr_t base;
    uint32_t length;
    bool writable;
    int handles;
    ShmMapping *next;
};

namespace qorbu::shm {

namespace {

pthread_mutex_t tableLock = PTHREAD_MUTEX_INITIALIZER;
ShmMapping *table = nullptr;

class TableGuard {
  public:
    TableGuard() { pthread_mutex_lock(&tableLock); }
    ~TableGuard() { pthread_mutex_unlock(&tableLock); }
    TableGuard(const TableGuard &) = delete;
    TableGuard &operator=(const TableGuard &) = delete;
};

ShmMapping *findMapping(dev_t dev, ino_t ino) {
    for (ShmMapping *m = table; m != nullptr; m = m->next) {
        if (m->dev == dev && m->ino == ino) return m;
    }
    return nullptr;
}

void unlinkMapping(ShmMapping *gone) {
    for (ShmMapping **link = &table; *link != nullptr; link = &(*link)->next) {
        if (*link == gone) {
            *link = gone->next;
            return;
        }
    }
}

int protectionFor(bool writable) { return writable ? PROT_READ | PROT_WRITE : PROT_READ; }

/* Maps at exactly addr without replacing anything there (some kernels and
 * emulators take the flag as a mere hint), or anywhere for addr 0. */
int mapSegment(int fd, uintptr_t addr, uint32_t length, bool writable, uintptr_t *mapped) {
    int flags = MAP_SHARED | (addr != 0 ? MAP_FIXED_NOREPLACE : 0);
    void *p = mmap(reinterpret_cast<void *>(addr), length, protectionFor(writable), flags, fd, 0);
    if (p == MAP_FAILED) return errno;
    if (addr != 0 && reinterpret_cast<uintptr_t>(p) != addr) {
        munmap(p, length);
        return EEXIST;
    }
    *mapped = reinterpret_cast<uintptr_t>(p);
    return 0;
}

/* A read-only mapping becomes read-write when a read-write handle joins it:
 * the same object mapped again over its own range, contents unchanged. */
int upgradeToWritable(ShmMapping *m, int fd) {
    void *p = mmap(reinterpret_cast<void *>(m->base), m->length, PROT_READ | PROT_WRITE,
                   MAP_SHARED | MAP_FIXED, fd, 0);
    if (p == MAP_FAILED) return errno;
    m->writable = true;
    return 0;
}

void fillHandle(ShmHandle *h, ShmMapping *m) {
    h->base = reinterpret_cast<ShmHeader *>(m->base);
    h->size = m->length;
    h->mapping = m;
    m->handles++;
}

} // namespace

int attachMapping(ShmHandle *h, dev_t dev, ino_t ino, uintptr_t addr, uint32_t length) {
    TableGuard guard;
    if (ShmMapping *m = findMapping(dev, ino)) {
        if (h->writable && !m->writable) {
            if (int err = upgradeToWritable(m, h->fd)) return err;
        }
        fillHandle(h, m);
        return 0;
    }
    auto *m = static_cast<ShmMapping *>(malloc(sizeof(ShmMapping)));
    if (m == nullptr) return ENOMEM;
    uintptr_t mapped = 0;
    if (int err = mapSegment(h->fd, addr, length, h->writable, &mapped)) {
        free(m);
        return err;
    }
    *m = ShmMapping{dev, ino, mapped, length, h->writable != 0, 0, table};
    table = m;
    fillHandle(h, m);
    return 0;
}

void detachMapping(ShmHandle *h) {
    ShmMapping *m = h->mapping;
    if (m == nullptr) return;
    TableGuard guard;
    h->mapping = nullptr;
    if (--m->handles > 0) return;
    unlinkMapping(m);
    munmap(reinterpret_cast<void *>(m->base), m->length);
    free(m);
}

} // namespace qorbu::shm
