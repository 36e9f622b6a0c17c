/* Helpers for the shared-memory tests: unique names, fixed addresses that
 * are free in this process, and work run in child processes. */
#ifndef QORBU_TESTS_SHM_SHM_TEST_UTIL_H
#define QORBU_TESTS_SHM_SHM_TEST_UTIL_H

#include "shm/shm.h"
#include "support/test_support.h"

#include <cerrno>
#include <cstdio>
#include <cstdint>
#include <dirent.h>
#include <functional>
#include <signal.h>
#include <string>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

namespace qorbu::test {

inline uintptr_t pageBytes() { return static_cast<uintptr_t>(getpagesize()); }

/* Segment names unique to this process and call. */
inline std::string uniqueName(const char *tag) {
    static int counter = 0;
    return "qorbu-test-" + std::to_string(getpid()) + "-" + tag + "-" + std::to_string(counter++);
}

/* Unlinks the name when the test ends, whatever happened. */
class NameGuard {
  public:
    explicit NameGuard(const char *tag) : name_(uniqueName(tag)) {}
    ~NameGuard() { ShmUnlink(name_.c_str()); }
    NameGuard(const NameGuard &) = delete;
    NameGuard &operator=(const NameGuard &) = delete;
    const char *c_str() const { return name_.c_str(); }

  private:
    std::string name_;
};

/* Header addresses tried for segments at fixed addresses. Natively the
 * first is free; under qemu-user the executable sits near 0x40000000. */
constexpr uintptr_t kHeaderCandidates[] = {0x40000000u, 0x60000000u, 0x70000000u, 0x30000000u};

/* Whether [addr, addr + length) holds no mapping of this process. Read from
 * /proc/self/maps, which qemu-user also shows as the guest sees it. */
inline bool rangeIsFree(uintptr_t addr, size_t length) {
    FILE *maps = fopen("/proc/self/maps", "r");
    if (maps == nullptr) return false;
    bool free = true;
    unsigned long long start = 0, end = 0;
    char line[512];
    while (free && fgets(line, sizeof line, maps) != nullptr) {
        if (sscanf(line, "%llx-%llx", &start, &end) == 2) {
            free = end <= addr || start >= addr + length;
        }
    }
    fclose(maps);
    return free;
}

/* The first candidate header address whose segment of `length` bytes fits
 * in free address space, or 0. */
inline uintptr_t freeHeaderAddress(size_t length) {
    for (uintptr_t candidate : kHeaderCandidates) {
        if (rangeIsFree(candidate, length)) return candidate;
    }
    return 0;
}

/* A segment whose data area starts on a multiple of its own (power-of-two)
 * size, so that every block is aligned to its size and all partners pair
 * up: freeing everything then restores the lists of a fresh segment. */
inline ShmHandle *createAligned(const char *name, uint32_t dataBytes) {
    for (uintptr_t candidate : kHeaderCandidates) {
        const uintptr_t data = (candidate + dataBytes) & ~uintptr_t(dataBytes - 1);
        ShmHandle *h = ShmCreate(name, reinterpret_cast<void *>(data), dataBytes);
        if (h != nullptr || errno != EEXIST) return h;
    }
    return nullptr;
}

inline int openDescriptorCount() {
    int count = 0;
    if (DIR *dir = opendir("/proc/self/fd")) {
        while (readdir(dir) != nullptr) count++;
        closedir(dir);
    }
    return count;
}

inline int waitStatus(pid_t pid) {
    int status = 0;
    while (waitpid(pid, &status, 0) < 0) {
        if (errno != EINTR) return -1;
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

/* Runs body in a child process that the alarm ends after `seconds`; returns
 * its exit status, or 128 + the signal that ended it. */
inline int runInChild(const std::function<int()> &body, unsigned seconds) {
    const pid_t pid = fork();
    if (pid == 0) {
        alarm(seconds);
        _exit(body());
    }
    return waitStatus(pid);
}

/* The class word stored below a block. */
inline uintptr_t classWordAt(uintptr_t block) {
    return *reinterpret_cast<const uintptr_t *>(block - sizeof(uintptr_t));
}

inline uintptr_t slotAddress(const ShmHeader *h, int k) {
    return reinterpret_cast<uintptr_t>(&h->freeList[k]);
}

} // namespace qorbu::test

#endif
