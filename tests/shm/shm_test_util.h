/* Helpers for the shared-memory tests: unique names, fixed addresses that
 * are free in this process, patterns, and work run in child processes. */
#ifndef QORBU_TESTS_SHM_SHM_TEST_UTIL_H
#define QORBU_TESTS_SHM_SHM_TEST_UTIL_H

#include "shm/shm.h"
#include "support/test_support.h"

#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <dirent.h>
#include <functional>
#include <string>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

namespace qorbu::test {

inline uintptr_t pageBytes() { return static_cast<uintptr_t>(getpagesize()); }

/* A name unique to this process and call, unlinked when the test ends. */
struct NameGuard {
    explicit NameGuard(const char *tag) {
        static int counter = 0;
        name = "qorbu-test-" + std::to_string(getpid()) + "-" + tag + "-" + std::to_string(counter++);
    }
    ~NameGuard() { ShmUnlink(name.c_str()); }
    const char *c_str() const { return name.c_str(); }
    std::string path() const { return "/" + name; }
    std::string name;
};

/* Natively the first is free; under qemu-user the executable sits near 0x40000000. */
constexpr uintptr_t kHeaderCandidates[] = {0x40000000u, 0x60000000u, 0x70000000u, 0x30000000u};

/* Whether [addr, addr + length) holds no mapping, as /proc/self/maps shows
 * it (qemu-user shows the guest's view). */
inline bool rangeIsFree(uintptr_t addr, size_t length) {
    FILE *maps = fopen("/proc/self/maps", "r");
    if (maps == nullptr) return false;
    bool free = true;
    unsigned long long start = 0, end = 0;
    char line[512];
    while (free && fgets(line, sizeof line, maps) != nullptr) {
        if (sscanf(line, "%llx-%llx", &start, &end) == 2) free = end <= addr || start >= addr + length;
    }
    fclose(maps);
    return free;
}

/* The first candidate header address with `length` free bytes, or 0. */
inline uintptr_t freeHeaderAddress(size_t length) {
    for (uintptr_t candidate : kHeaderCandidates) {
        if (rangeIsFree(candidate, length)) return candidate;
    }
    return 0;
}

/* A segment whose header sits at a free fixed address, stored in *header. */
inline ShmHandle *createAtFreeAddress(const char *name, uint32_t size, uintptr_t *header) {
    *header = freeHeaderAddress(size + 2 * pageBytes());
    if (*header == 0) return nullptr;
    return ShmCreate(name, reinterpret_cast<void *>(*header + pageBytes()), size);
}

/* Whether the mapping that holds addr may be written, as /proc/self/maps shows it. */
inline bool mappedWritable(uintptr_t addr) {
    FILE *maps = fopen("/proc/self/maps", "r");
    if (maps == nullptr) return false;
    bool writable = false;
    unsigned long long start = 0, end = 0;
    char perms[8] = "";
    char line[512];
    while (fgets(line, sizeof line, maps) != nullptr) {
        if (sscanf(line, "%llx-%llx %7s", &start, &end, perms) == 3 && start <= addr && addr < end) {
            writable = perms[1] == 'w';
        }
    }
    fclose(maps);
    return writable;
}

inline int openDescriptorCount() {
    int count = 0;
    DIR *dir = opendir("/proc/self/fd");
    while (dir != nullptr && readdir(dir) != nullptr) count++;
    if (dir != nullptr) closedir(dir);
    return count;
}

/* Exit status of pid, or 128 + the signal that ended it. */
inline int waitStatus(pid_t pid) {
    int status = 0;
    while (waitpid(pid, &status, 0) < 0) {
        if (errno != EINTR) return -1;
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

/* Starts body in a child that an alarm ends after `seconds`. */
inline pid_t startChild(const std::function<int()> &body, unsigned seconds) {
    const pid_t pid = fork();
    if (pid == 0) {
        alarm(seconds);
        _exit(body());
    }
    return pid;
}

inline int runInChild(const std::function<int()> &body, unsigned seconds) {
    return waitStatus(startChild(body, seconds));
}

inline void fillPattern(void *block, uint32_t n, uint32_t tag) {
    for (uint32_t i = 0; i < n; i++)
        static_cast<unsigned char *>(block)[i] = static_cast<unsigned char>(tag + i * 7);
}

inline bool patternIntact(const void *block, uint32_t n, uint32_t tag) {
    for (uint32_t i = 0; i < n; i++) {
        if (static_cast<const unsigned char *>(block)[i] != static_cast<unsigned char>(tag + i * 7))
            return false;
    }
    return true;
}

/* The class word stored below a block, and the address a class word names. */
inline uintptr_t classWordAt(uintptr_t block) { return reinterpret_cast<const uintptr_t *>(block)[-1]; }
inline uintptr_t slotAddress(const ShmHeader *h, int k) {
    return reinterpret_cast<uintptr_t>(&h->freeList[k]);
}

/* A copy of the free-list heads, to prove that an operation changed nothing. */
struct ListHeads {
    explicit ListHeads(const ShmHeader *h) : header(h) { memcpy(heads, h->freeList, sizeof heads); }
    bool unchanged() const { return memcmp(heads, header->freeList, sizeof heads) == 0; }
    const ShmHeader *header;
    uintptr_t heads[27];
};

} // namespace qorbu::test

/* For GoogleTest files: a call returns 0 (or null) with errno err; a statement leaves errno at err. */
#define EXPECT_REFUSED(err, call)                                                                            \
    do {                                                                                                     \
        errno = 0;                                                                                           \
        const bool zero_ = (call) == 0;                                                                      \
        const int errno_ = errno;                                                                            \
        EXPECT_TRUE(zero_) << #call;                                                                         \
        EXPECT_EQ(errno_, err) << #call;                                                                     \
    } while (0)
#define EXPECT_ERRNO(err, statement)                                                                         \
    do {                                                                                                     \
        errno = 0;                                                                                           \
        statement;                                                                                           \
        const int errno_ = errno;                                                                            \
        EXPECT_EQ(errno_, err) << #statement;                                                                \
    } while (0)

#endif
