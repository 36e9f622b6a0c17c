/* The second process of the self-test (qorbu-demo --inspect NAME): attaches
 * the daemon's segment read-only, at the daemon's address, walks the
 * connection records and the free lists and prints one line. */
#define _GNU_SOURCE
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include "demo.h"

/* Free bytes, summed from ShmPrintFree's dump ("0x%08x [k] = { addr, ... }",
 * one line per class). It takes no lock, so it serves a read-only handle at
 * moments when nobody allocates or frees. -1 when a list is damaged (the
 * walker sets errno and stops there) or the dump is cut short. */
static long long count_free(ShmHandle *segment) {
    char *dump = NULL;
    size_t size = 0;
    FILE *out = open_memstream(&dump, &size);
    if (!out) return -1;
    errno = 0;
    ShmPrintFree(out, segment->base);
    int damaged = errno != 0 || ferror(out);
    damaged |= fclose(out) != 0;
    long long total = 0;
    unsigned int block, lines = 0;
    char *save = NULL;
    for (char *line = strtok_r(dump, "\n", &save); line && !damaged; line = strtok_r(NULL, "\n", &save)) {
        ++lines;
        const char *list = strchr(line, '{');
        damaged = !list || sscanf(line, "0x%x", &block) != 1;
        for (const char *at = list; !damaged && (at = strstr(at + 1, "0x"));) total += block;
    }
    free(dump);
    const unsigned int classes = sizeof segment->base->freeList / sizeof segment->base->freeList[0];
    return damaged || lines != classes ? -1 : total;
}

static int walk_records(const DemoSummary *summary, unsigned int *records, unsigned long long *bytes) {
    *records = 0;
    *bytes = 0;
    for (uintptr_t at = summary->records; at; at = ((const DemoConnection *)at)->next) {
        const DemoConnection *record = (const DemoConnection *)at;
        if (record->magic != DEMO_RECORD_MAGIC || *records > summary->open_connections) return -1;
        ++*records;
        *bytes += record->bytes_echoed;
    }
    return 0;
}

int inspect_segment(const char *name) {
    ShmHandle *segment = ShmOpen(name, O_RDONLY);
    if (!segment) {
        fprintf(stderr, "qorbu-demo --inspect: cannot open segment %s: %s\n", name, strerror(errno));
        return 1;
    }
    const DemoSummary *summary = ShmMetadata(segment, sizeof(DemoSummary));
    unsigned int records;
    unsigned long long record_bytes;
    long long free_bytes = 0;
    int status = 1;
    if (!summary || summary->magic != DEMO_SUMMARY_MAGIC)
        fprintf(stderr, "qorbu-demo --inspect: segment %s holds no demo summary\n", name);
    else if (walk_records(summary, &records, &record_bytes) != 0 || (free_bytes = count_free(segment)) < 0)
        fprintf(stderr, "qorbu-demo --inspect: segment %s is inconsistent\n", name);
    else
        status = printf("records %u bytes %llu record-bytes %llu free %lld pid %d\n", records,
                        (unsigned long long)summary->bytes_echoed, record_bytes, free_bytes,
                        (int)summary->pid) < 0;
    ShmClose(segment);
    return status;
}
