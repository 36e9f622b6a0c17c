/* Guarded green-thread stacks: one anonymous mapping per thread, its lowest
 * page inaccessible so that an overflow faults instead of corrupting the
 * memory below. Stacks are executable only when the process itself runs
 * with an executable stack. */
#include <cstdio>
#include <link.h>
#include <sys/mman.h>

#include "greenthreads/greenthread_private.h"

#if defined(QORBU_HAVE_VALGRIND) && QORBU_HAVE_VALGRIND
#include <valgrind/valgrind.h>
#endif

namespace qorbu::gt {
namespace {

struct StackFlagScan {
    bool main_program = true; /* dl_iterate_phdr reports the program first */
    bool executable = false;
};

/* Mirrors the dynamic loader: an object that carries no PT_GNU_STACK header
 * asks for the historical executable stack, but only the program's own
 * absence matters (the vDSO and some loaders carry none). Any loaded object
 * whose header has PF_X makes the loader turn every stack executable. */
int scan_stack_flags(dl_phdr_info *info, size_t, void *data) {
    auto *scan = static_cast<StackFlagScan *>(data);
    bool has_stack_header = false;
    for (ElfW(Half) i = 0; i < info->dlpi_phnum; ++i) {
        const ElfW(Phdr) &header = info->dlpi_phdr[i];
        if (header.p_type != PT_GNU_STACK) continue;
        has_stack_header = true;
        if (header.p_flags & PF_X) scan->executable = true;
    }
    if (scan->main_program && !has_stack_header) scan->executable = true;
    scan->main_program = false;
    return scan->executable ? 1 : 0;
}

void register_with_valgrind([[maybe_unused]] char *low, [[maybe_unused]] char *high) {
#if defined(QORBU_HAVE_VALGRIND) && QORBU_HAVE_VALGRIND
    /* The id would only serve to deregister, and stacks live for ever. */
    (void)VALGRIND_STACK_REGISTER(low, high);
#endif
}

} // namespace

size_t stack_mapping_length(long page_bytes) {
    const size_t page = static_cast<size_t>(page_bytes);
    const size_t usable = (kStackSize + page - 1) / page * page;
    return usable + page;
}

bool process_wants_executable_stack() {
    StackFlagScan scan;
    dl_iterate_phdr(scan_stack_flags, &scan);
    return scan.executable;
}

void *stack_map() {
    const size_t length = stack_mapping_length(page_size);
    int protection = PROT_READ | PROT_WRITE;
    if (process_wants_executable_stack()) protection |= PROT_EXEC;
    void *base =
        mmap(nullptr, length, protection, MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE | MAP_STACK, -1, 0);
    if (base == MAP_FAILED) return nullptr;
    if (mprotect(base, static_cast<size_t>(page_size), PROT_NONE) != 0)
        fputs("mprotect() failed to protect stack guard page; continuing without\n", stderr);
    register_with_valgrind(static_cast<char *>(base) + page_size, static_cast<char *>(base) + length);
    return base;
}

void stack_unmap(void *base) { munmap(base, stack_mapping_length(page_size)); }

} // namespace qorbu::gt
