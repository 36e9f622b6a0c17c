/* The second process of the self-test (qorbu-demo --inspect NAME): attaches
 * the daemon's segment read-only, at the daemon's address, walks the
 * connection records and the free lists and prints one line. */
#define _GNU_SOURCE
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include "demo.h"

enum { kSizeClasses = 27, kSmallestBlock = 8 };

/* Free bytes counted by walking the free lists without taking the segment
 * lock: for read-only handles, at moments when nobody allocates or frees.
 * Returns 0 and sets *free_bytes, or -1 if a list leaves the data area. */
static int count_free(const ShmHeader *header, uint32_t *free_bytes) {
    const uintptr_t data_start = header->base + (uintptr_t)getpagesize();
    const uintptr_t data_end = header->base + header->size;
    const uintptr_t max_blocks = (data_end - data_start) / kSmallestBlock;
    uint32_t total = 0;
    for (int k = 0; k < kSizeClasses; ++k) {
        const uint32_t block_size = (uint32_t)kSmallestBlock << k;
        uintptr_t steps = 0;
        for (uintptr_t block = header->freeList[k]; block; block = *(const uintptr_t *)block) {
            if (block < data_start || block >= data_end || ++steps > max_blocks)
                return -1;
            total += block_size;
        }
    }
    *free_bytes = total;
    return 0;
}

static int walk_records(const DemoSummary *summary, unsigned int *records, unsigned long long *bytes) {
    unsigned int count = 0;
    unsigned long long total = 0;
    for (uintptr_t at = summary->records; at; at = ((const DemoConnection *)at)->next) {
        const DemoConnection *record = (const DemoConnection *)at;
        if (record->magic != DEMO_RECORD_MAGIC || count > summary->open_connections)
            return -1;
        ++count;
        total += record->bytes_echoed;
    }
    *records = count;
    *bytes = total;
    return 0;
}

int inspect_segment(const char *name) {
    ShmHandle *segment = ShmOpen(name, O_RDONLY);
    if (!segment) {
        fprintf(stderr, "qorbu-demo --inspect: cannot open segment %s: %s\n", name, strerror(errno));
        return 1;
    }
    const ShmHeader *header = (const ShmHeader *)((char *)ShmAddr(segment) - ShmOverhead());
    const DemoSummary *summary = ShmMetadata(segment, sizeof(DemoSummary));
    unsigned int records = 0;
    unsigned long long record_bytes = 0;
    uint32_t free_bytes = 0;
    int status = 0;
    if (!summary || summary->magic != DEMO_SUMMARY_MAGIC) {
        fprintf(stderr, "qorbu-demo --inspect: segment %s holds no demo summary\n", name);
        status = 1;
    } else if (walk_records(summary, &records, &record_bytes) != 0 || count_free(header, &free_bytes) != 0) {
        fprintf(stderr, "qorbu-demo --inspect: segment %s is inconsistent\n", name);
        status = 1;
    } else {
        printf("records %u bytes %llu record-bytes %llu free %u pid %d\n", records,
               (unsigned long long)summary->bytes_echoed, record_bytes, free_bytes, (int)summary->pid);
    }
    ShmClose(segment);
    return status;
}
