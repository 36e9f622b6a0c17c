/* The second process of the self-test (qorbu-demo --inspect NAME): attaches
 * the daemon's segment read-only, at the daemon's address, walks the
 * connection records and the free lists and prints one line. */
#define _GNU_SOURCE
#include "inspect.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>

#include "demo_segment.h"

static int walk_records(const DemoSummary *summary, unsigned int *records, unsigned long long *bytes)
{
    unsigned int count = 0;
    unsigned long long total = 0;
    for (uintptr_t at = summary->records; at; at = ((const DemoConnection *)at)->next) {
        const DemoConnection *record = (const DemoConnection *)at;
        if (record->magic != DEMO_RECORD_MAGIC || count > summary->openConnections)
            return -1;
        ++count;
        total += record->bytesEchoed;
    }
    *records = count;
    *bytes = total;
    return 0;
}

int inspect_segment(const char *name)
{
    ShmHandle *segment = ShmOpen(name, O_RDONLY);
    if (!segment) {
        fprintf(stderr, "qorbu-demo --inspect: cannot open segment %s: %s\n", name, strerror(errno));
        return 1;
    }
    const ShmHeader *header = (const ShmHeader *)((char *)ShmAddr(segment) - ShmOverhead());
    const DemoSummary *summary = ShmMetadata(segment, sizeof(DemoSummary));
    unsigned int records = 0;
    unsigned long long recordBytes = 0;
    uint32_t freeBytes = 0;
    int status = 0;
    if (!summary || summary->magic != DEMO_SUMMARY_MAGIC) {
        fprintf(stderr, "qorbu-demo --inspect: segment %s holds no demo summary\n", name);
        status = 1;
    } else if (walk_records(summary, &records, &recordBytes) != 0 || demo_count_free(header, &freeBytes) != 0) {
        fprintf(stderr, "qorbu-demo --inspect: segment %s is inconsistent\n", name);
        status = 1;
    } else {
        printf("records %u bytes %llu record-bytes %llu free %u pid %d\n", records,
               (unsigned long long)summary->bytesEchoed, recordBytes, freeBytes, (int)summary->pid);
    }
    ShmClose(segment);
    return status;
}
