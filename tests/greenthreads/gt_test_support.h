// Helpers shared by the green-thread test binaries.
#ifndef QORBU_TESTS_GREENTHREADS_GT_TEST_SUPPORT_H
#define QORBU_TESTS_GREENTHREADS_GT_TEST_SUPPORT_H

#include <stdint.h>
#include <stdio.h>
#include <string.h>

#include <string>

namespace qorbu::test {

/* Builds with a sanitizer report a fault through the sanitizer's own
 * handler, which ends the process with an exit status, not the signal. */
constexpr bool kSanitized =
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
    true;
#else
    false;
#endif

/* Permissions ("rw-p", "---p", ...) of the mapping that holds addr, and
 * whether addr is where that mapping starts; empty when none holds it. */
struct MappingAt {
    std::string perms;
    bool startsHere = false;
};

inline MappingAt mapping_at(const void *addr)
{
    MappingAt found;
    FILE *maps = fopen("/proc/self/maps", "r");
    if (maps == nullptr)
        return found;
    const auto target = reinterpret_cast<uintptr_t>(addr);
    char line[512];
    while (fgets(line, sizeof line, maps) != nullptr) {
        unsigned long long low = 0, high = 0;
        char perms[8] = {};
        if (sscanf(line, "%llx-%llx %7s", &low, &high, perms) != 3)
            continue;
        if (target >= low && target < high) {
            found.perms = perms;
            found.startsHere = target == low;
            break;
        }
    }
    fclose(maps);
    return found;
}

/* qemu-user leaves inaccessible guest pages out of its /proc/self/maps. */
inline bool is_inaccessible(const MappingAt &mapping, bool emulated)
{
    return mapping.perms == "---p" || (emulated && mapping.perms.empty());
}

} // namespace qorbu::test

/* A fault that must end the process with SIGSEGV. */
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define EXPECT_SEGV_DEATH(statement) EXPECT_DEATH(statement, "SEGV|stack-overflow")
#else
#define EXPECT_SEGV_DEATH(statement) EXPECT_EXIT(statement, ::testing::KilledBySignal(SIGSEGV), "")
#endif

#endif
