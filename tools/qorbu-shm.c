/* qorbu-shm: create, inspect and remove libqorbu shared segments.
 *
 * The tool is linked with the library's own objects, so that it checks the
 * free lists with the allocator's walk (shm/shm_inspect_private.h) instead
 * of a copy of its own.
 *
 * Commands that only read (info, dump) attach read-only: a read-write
 * attach switches the segment to the descriptor lock for good, and an
 * inspection must leave the segment as it found it. Before attaching, the
 * header is peeked through a mapping of the tool's own choosing, so that a
 * segment that is not published yet, or whose address range this process
 * already uses, gives an error instead of a wait or a clobbered mapping. */
#define _GNU_SOURCE
#include <errno.h>
#include <fcntl.h>
#include <inttypes.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include "shm/shm.h"
#include "shm/shm_inspect_private.h"

enum ExitCode {
    EXIT_OK = 0,
    EXIT_FAILED = 1,      /* the operation failed (no space, system error, damaged segment) */
    EXIT_USAGE = 2,       /* bad command line: unknown command, bad name, size or address */
    EXIT_NO_SEGMENT = 3,  /* no segment of that name */
    EXIT_BUSY = 4,        /* the segment is busy or not published yet */
    EXIT_EXISTS = 5,      /* create: a segment of that name exists already */
    EXIT_DOUBLE_FREE = 6, /* free: the block is free already */
};

enum { kMaxNameLength = 250 };

/* attach() found the segment busy and left the message to its caller. */
enum { kBusyUnreported = -1 };

static const char kUsage[] =
    "usage: qorbu-shm COMMAND [ARGUMENTS]\n"
    "\n"
    "  create NAME SIZE [ADDR]  create segment NAME with SIZE data bytes; ADDR is\n"
    "                           the data area's address (a multiple of 4096; the\n"
    "                           header lies one page below), default: any address\n"
    "  info NAME                base, size, free bytes, largest free block, useFlock,\n"
    "                           busy (read-only attach)\n"
    "  dump NAME                the free lists, one line per size class\n"
    "                           (read-only attach)\n"
    "  alloc NAME SIZE          allocate a block of SIZE bytes, print its address\n"
    "                           (attaches read-write: the segment uses the\n"
    "                           descriptor lock from then on)\n"
    "  free NAME ADDR           free the block at ADDR (read-write attach)\n"
    "  unlink NAME              remove the name; mappings stay valid until closed\n"
    "  --help                   this text\n"
    "\n"
    "Numbers may be decimal or 0x-hex; sizes may end in k or m (KiB, MiB).\n"
    "Exit status: 0 success, 1 operation failed, 2 bad command line,\n"
    "3 no such segment, 4 segment busy or unpublished, 5 segment exists,\n"
    "6 block already free.\n";

/* ---- messages and arguments ---------------------------------------------- */

__attribute__((format(printf, 2, 3))) static int fail(int code, const char *format, ...) {
    va_list args;
    va_start(args, format);
    fputs("qorbu-shm: ", stderr);
    vfprintf(stderr, format, args);
    fputc('\n', stderr);
    va_end(args);
    return code;
}

static int valid_name(const char *name) {
    size_t len = strlen(name);
    return len > 0 && len <= kMaxNameLength && !strchr(name, '/') && !strchr(name, ':');
}

static int check_name(const char *name) {
    if (valid_name(name)) return EXIT_OK;
    return fail(EXIT_USAGE, "invalid segment name '%s': it must be 1 to %d characters without '/' or ':'",
                name, kMaxNameLength);
}

/* Decimal or 0x-hex, with an optional k or m suffix when allowed. */
static int parse_number(const char *text, int allow_suffix, unsigned long long max,
                        unsigned long long *value) {
    char *end;
    errno = 0;
    unsigned long long parsed = strtoull(text, &end, 0);
    if (errno != 0 || end == text || text[0] == '-') return -1;
    unsigned long long scale = 1;
    if (allow_suffix && (*end == 'k' || *end == 'K'))
        scale = 1024, ++end;
    else if (allow_suffix && (*end == 'm' || *end == 'M'))
        scale = 1024 * 1024, ++end;
    if (*end != '\0' || parsed > max / scale) return -1;
    *value = parsed * scale;
    return 0;
}

static const char *error_text(int err) { return strerror(err); }

/* ---- peeking at the header ------------------------------------------------ */

typedef struct Peek {
    uintptr_t base;
    uint32_t size;
    uint32_t useFlock;
    uint32_t busy;
} Peek;

static int object_name(const char *name, char *object, size_t size) {
    return snprintf(object, size, "/%s", name) < (int)size ? 0 : -1;
}

static int not_published(const char *name, const char *why) {
    return fail(EXIT_BUSY, "segment '%s' is not published yet (%s; 'qorbu-shm unlink %s' removes it)", name,
                why, name);
}

static int peek_header(const char *name, Peek *peek) {
    char object[kMaxNameLength + 2];
    object_name(name, object, sizeof object);
    int fd = shm_open(object, O_RDONLY | O_CLOEXEC, 0);
    if (fd < 0) {
        if (errno == ENOENT) return fail(EXIT_NO_SEGMENT, "no segment named '%s'", name);
        return fail(EXIT_FAILED, "cannot open segment '%s': %s", name, error_text(errno));
    }
    struct stat st;
    const long page = sysconf(_SC_PAGESIZE);
    if (fstat(fd, &st) != 0) {
        close(fd);
        return fail(EXIT_FAILED, "cannot open segment '%s': %s", name, error_text(errno));
    }
    if (st.st_size == 0) {
        close(fd);
        return not_published(name, "its creator has not sized it, or died first");
    }
    /* A creator sizes the object to whole pages, header and data, at once. */
    if (st.st_size % page != 0 || st.st_size < 2 * page || (unsigned long long)st.st_size > UINT32_MAX) {
        close(fd);
        return fail(EXIT_FAILED, "segment '%s' is damaged: an object of %lld bytes is no segment", name,
                    (long long)st.st_size);
    }
    const ShmHeader *header = mmap(NULL, (size_t)page, PROT_READ, MAP_SHARED, fd, 0);
    close(fd);
    if (header == MAP_FAILED)
        return fail(EXIT_FAILED, "cannot map segment '%s': %s", name, error_text(errno));
    peek->base = header->base;
    peek->size = __atomic_load_n(&header->size, __ATOMIC_ACQUIRE);
    peek->useFlock = header->useFlock;
    peek->busy = header->busy;
    munmap((void *)header, (size_t)page);
    if (peek->size == 0) return not_published(name, "its creator is still initialising it, or died first");
    if (peek->base == 0 || peek->base % (uintptr_t)page != 0 || peek->size % (uint32_t)page != 0 ||
        peek->size < 2 * (uint32_t)page || (off_t)peek->size > st.st_size)
        return fail(EXIT_FAILED, "segment '%s' has a damaged header (base %#" PRIxPTR ", size %" PRIu32 ")",
                    name, peek->base, peek->size);
    return EXIT_OK;
}

static int busy_error(const char *name) {
    return fail(EXIT_BUSY, "segment '%s' is busy: an allocation or free is running or was interrupted", name);
}

static void print_header_fields(const char *name, const Peek *peek) {
    printf("name      %s\n", name);
    printf("base      %#" PRIxPTR "\n", peek->base);
    printf("data      %#" PRIxPTR "\n", peek->base + (uintptr_t)ShmOverhead());
    printf("size      %" PRIu32 "\n", peek->size);
    printf("useFlock  %" PRIu32 "\n", peek->useFlock);
    printf("busy      %" PRIu32 "\n", peek->busy);
}

/* Read-only handles cannot take the segment's lock, so a busy segment is
 * refused at once instead of being waited for; read-write attaches leave
 * that decision to the library. */
static int attach(const char *name, int mode, ShmHandle **handle, Peek *peek_out) {
    Peek peek;
    int status = peek_header(name, &peek);
    if (status != EXIT_OK) return status;
    if (peek_out) *peek_out = peek;
    if (mode == O_RDONLY && peek.busy) return peek_out ? kBusyUnreported : busy_error(name);
    *handle = ShmOpen(name, mode);
    if (*handle) return EXIT_OK;
    if (errno == EEXIST) /* the library never maps over memory in use */
        return fail(EXIT_FAILED,
                    "cannot attach segment '%s': its range %#" PRIxPTR "..%#" PRIxPTR
                    " is in use in this process",
                    name, peek.base, peek.base + peek.size);
    if (errno == ENOENT) return fail(EXIT_NO_SEGMENT, "no segment named '%s'", name);
    if (errno == EBUSY) return busy_error(name);
    return fail(EXIT_FAILED, "cannot attach segment '%s': %s", name, error_text(errno));
}

static ShmHeader *header_of(ShmHandle *handle) {
    return (ShmHeader *)((char *)ShmAddr(handle) - ShmOverhead());
}

static int damaged_error(const char *name) {
    return fail(EXIT_FAILED, "segment '%s' has a damaged free list", name);
}

/* ---- commands ------------------------------------------------------------- */

static int cmd_create(int argc, char **argv) {
    if (argc < 2 || argc > 3) return fail(EXIT_USAGE, "usage: qorbu-shm create NAME SIZE [ADDR]");
    unsigned long long size, address = 0;
    int status = check_name(argv[0]);
    if (status != EXIT_OK) return status;
    if (parse_number(argv[1], 1, 0xffffffffu - 2u * (unsigned long long)ShmOverhead(), &size) != 0 ||
        size == 0)
        return fail(EXIT_USAGE, "invalid size '%s': give the data bytes, from 1 to about 4 GiB", argv[1]);
    if (argc == 3 && (parse_number(argv[2], 0, UINTPTR_MAX, &address) != 0 || address % 4096 != 0 ||
                      address < (unsigned long long)ShmOverhead()))
        return fail(EXIT_USAGE, "invalid address '%s': give the data area's address, a multiple of 4096",
                    argv[2]);

    /* The tool claims the name itself, so that it can remove the object
     * again when the library refuses to make a segment of it. */
    char object[kMaxNameLength + 2];
    object_name(argv[0], object, sizeof object);
    int claimed = shm_open(object, O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0660);
    if (claimed < 0 && errno == EEXIST) return fail(EXIT_EXISTS, "segment '%s' exists already", argv[0]);
    if (claimed < 0) return fail(EXIT_FAILED, "cannot create segment '%s': %s", argv[0], error_text(errno));
    close(claimed);
    ShmHandle *handle = ShmCreate(argv[0], (void *)(uintptr_t)address, (uint32_t)size);
    if (!handle) {
        const int err = errno;
        ShmUnlink(argv[0]);
        if (err == EEXIST) /* the library never maps over memory in use */
            return fail(EXIT_FAILED,
                        "cannot create segment '%s' at %#llx: the range is in use in this process", argv[0],
                        address);
        return fail(EXIT_FAILED, "cannot create segment '%s': %s", argv[0], error_text(err));
    }
    const ShmHeader *header = header_of(handle);
    printf("created %s: header %#" PRIxPTR ", data %p, %" PRIu32 " bytes in all, %" PRIu32
           " data bytes free\n",
           argv[0], header->base, ShmAddr(handle), header->size, ShmTotalFree(handle));
    ShmClose(handle);
    return EXIT_OK;
}

static int cmd_info(int argc, char **argv) {
    if (argc != 1) return fail(EXIT_USAGE, "usage: qorbu-shm info NAME");
    int status = check_name(argv[0]);
    ShmHandle *handle = NULL;
    Peek peek;
    if (status == EXIT_OK) status = attach(argv[0], O_RDONLY, &handle, &peek);
    if (status == kBusyUnreported) {
        /* The header is all there is to show of a busy segment. */
        print_header_fields(argv[0], &peek);
        return fail(EXIT_BUSY, "segment '%s' is busy: free lists not read", argv[0]);
    }
    if (status != EXIT_OK) return status;
    const ShmHeader *header = header_of(handle);
    peek = (Peek){header->base, header->size, header->useFlock, header->busy};
    print_header_fields(argv[0], &peek);
    ShmFreeSummary stats;
    if (qorbu_shm_summarise(handle, &stats) != 0) {
        status = damaged_error(argv[0]);
    } else {
        printf("free      %" PRIu32 "\n", stats.free_bytes);
        printf("blocks    %" PRIu32 " free\n", stats.blocks);
        printf("largest   %" PRIu32 "\n", stats.largest);
    }
    ShmClose(handle);
    return status;
}

static int cmd_dump(int argc, char **argv) {
    if (argc != 1) return fail(EXIT_USAGE, "usage: qorbu-shm dump NAME");
    int status = check_name(argv[0]);
    ShmHandle *handle = NULL;
    if (status == EXIT_OK) status = attach(argv[0], O_RDONLY, &handle, NULL);
    if (status != EXIT_OK) return status;
    ShmHeader *header = header_of(handle);
    ShmFreeSummary stats;
    if (header->busy)
        status = busy_error(argv[0]);
    else if (qorbu_shm_summarise(handle, &stats) != 0)
        status = damaged_error(argv[0]);
    else
        ShmPrintFree(stdout, header);
    ShmClose(handle);
    return status;
}

static int cmd_alloc(int argc, char **argv) {
    if (argc != 2) return fail(EXIT_USAGE, "usage: qorbu-shm alloc NAME SIZE");
    unsigned long long size;
    int status = check_name(argv[0]);
    if (status != EXIT_OK) return status;
    if (parse_number(argv[1], 1, 0xffffffffu, &size) != 0)
        return fail(EXIT_USAGE, "invalid size '%s'", argv[1]);
    ShmHandle *handle = NULL;
    status = attach(argv[0], O_RDWR, &handle, NULL);
    if (status != EXIT_OK) return status;
    /* A damaged segment is refused as a whole, as info reports it. */
    ShmFreeSummary stats;
    void *block = NULL;
    if (qorbu_shm_summarise(handle, &stats) == 0)
        block = ShmAlloc(handle, (uint32_t)size);
    else
        errno = EUCLEAN;
    if (block)
        printf("%p\n", block);
    else if (errno == EUCLEAN)
        status = damaged_error(argv[0]);
    else if (errno == ENOMEM)
        status = fail(EXIT_FAILED, "no free block of %llu bytes in segment '%s'", size, argv[0]);
    else if (errno == EBUSY)
        status = fail(EXIT_BUSY, "segment '%s' is busy", argv[0]);
    else
        status = fail(EXIT_FAILED, "cannot allocate in segment '%s': %s", argv[0], error_text(errno));
    ShmClose(handle);
    return status;
}

/* The library refuses a foreign pointer with a message and ends the process
 * on a double free; the tool checks first so that both get an exit code. */
static int check_block(const ShmHandle *handle, uintptr_t address, const char *text) {
    switch (qorbu_shm_block_state(handle, (const void *)address)) {
    case SHM_BLOCK_ALLOCATED: return EXIT_OK;
    case SHM_BLOCK_FREE: return fail(EXIT_DOUBLE_FREE, "the block at %s is free already", text);
    case SHM_BLOCK_DAMAGED: return EXIT_FAILED;
    default: break;
    }
    const uintptr_t data_start = (uintptr_t)ShmAddr((ShmHandle *)handle);
    return fail(EXIT_USAGE,
                "address %s is not a block of this segment's data area (%#" PRIxPTR "..%#" PRIxPTR ")", text,
                data_start, data_start + handle->size - (uintptr_t)ShmOverhead());
}

static int cmd_free(int argc, char **argv) {
    if (argc != 2) return fail(EXIT_USAGE, "usage: qorbu-shm free NAME ADDR");
    unsigned long long address;
    int status = check_name(argv[0]);
    if (status != EXIT_OK) return status;
    if (parse_number(argv[1], 0, UINTPTR_MAX, &address) != 0)
        return fail(EXIT_USAGE, "invalid address '%s'", argv[1]);
    ShmHandle *handle = NULL;
    status = attach(argv[0], O_RDWR, &handle, NULL);
    if (status != EXIT_OK) return status;
    ShmHeader *header = header_of(handle);
    ShmFreeSummary stats;
    if (header->busy)
        status = busy_error(argv[0]);
    else if (qorbu_shm_summarise(handle, &stats) != 0)
        status = damaged_error(argv[0]);
    else
        status = check_block(handle, (uintptr_t)address, argv[1]);
    if (status == EXIT_OK) {
        errno = 0;
        ShmFree(handle, (void *)(uintptr_t)address);
        if (errno == EUCLEAN)
            status = damaged_error(argv[0]);
        else if (errno == EBUSY)
            status = busy_error(argv[0]);
        else if (errno != 0)
            status = fail(EXIT_FAILED, "cannot free in segment '%s': %s", argv[0], error_text(errno));
    }
    ShmClose(handle);
    return status;
}

static int cmd_unlink(int argc, char **argv) {
    if (argc != 1) return fail(EXIT_USAGE, "usage: qorbu-shm unlink NAME");
    int status = check_name(argv[0]);
    if (status != EXIT_OK) return status;
    if (ShmUnlink(argv[0]) == 0) return EXIT_OK;
    if (errno == ENOENT) return fail(EXIT_NO_SEGMENT, "no segment named '%s'", argv[0]);
    return fail(EXIT_FAILED, "cannot unlink segment '%s': %s", argv[0], error_text(errno));
}

typedef struct Command {
    const char *name;
    int (*run)(int argc, char **argv);
} Command;

static const Command kCommands[] = {
    {"create", cmd_create}, {"info", cmd_info}, {"dump", cmd_dump},
    {"alloc", cmd_alloc},   {"free", cmd_free}, {"unlink", cmd_unlink},
};

int main(int argc, char **argv) {
    if (argc < 2) return fputs(kUsage, stderr), EXIT_USAGE;
    if (strcmp(argv[1], "--help") == 0 || strcmp(argv[1], "-h") == 0 || strcmp(argv[1], "help") == 0) {
        fputs(kUsage, stdout);
        return EXIT_OK;
    }
    for (size_t i = 0; i < sizeof kCommands / sizeof kCommands[0]; ++i)
        if (strcmp(argv[1], kCommands[i].name) == 0) return kCommands[i].run(argc - 2, argv + 2);
    return fail(EXIT_USAGE, "unknown command '%s' (try qorbu-shm --help)", argv[1]);
}
