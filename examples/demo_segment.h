/* What the demo keeps in its shared segment: a summary in the metadata area
 * and one record per open connection, allocated with ShmAlloc and linked by
 * absolute addresses (valid in every process, since every process maps the
 * segment at the same address). A second process reads all of it through a
 * read-only handle. */
#ifndef QORBU_DEMO_DEMO_SEGMENT_H
#define QORBU_DEMO_DEMO_SEGMENT_H

#include <stdint.h>

#include "shm/shm.h"

#ifdef __cplusplus
extern "C" {
#endif

#define DEMO_SUMMARY_MAGIC 0x514f5244u /* "DROQ" */
#define DEMO_RECORD_MAGIC 0x434f5244u  /* "DROC" */

/* Lives at ShmMetadata(handle, sizeof(DemoSummary)). */
typedef struct DemoSummary {
    uint32_t magic;
    int32_t pid;              /* the daemon that owns the segment */
    uint32_t openConnections; /* records in the list */
    uint32_t acceptedTotal;
    uint64_t bytesEchoed;     /* over all connections, closed ones included */
    uintptr_t records;        /* address of the newest record, 0 when none */
} DemoSummary;

/* One per open connection, in the data area. */
typedef struct DemoConnection {
    uint32_t magic;
    int32_t fd;
    uint32_t peerPort;
    uint32_t serial;          /* 1 for the first connection accepted */
    uint64_t bytesEchoed;
    uintptr_t next;           /* older record, 0 at the end */
    uintptr_t prev;           /* newer record, 0 at the head */
} DemoConnection;

/* Default segment geometry: a fixed address that a fresh process is not
 * likely to use, so a second process can map the segment there too. */
#if UINTPTR_MAX == 0xffffffffu
#define DEMO_SEGMENT_ADDRESS ((uintptr_t)0x30001000u)
#else
#define DEMO_SEGMENT_ADDRESS ((uintptr_t)0x5a0000001000u)
#endif
#define DEMO_SEGMENT_SIZE (1u << 20)

/* Free bytes counted by walking the free lists without taking the segment
 * lock: for read-only handles, at moments when nobody allocates or frees.
 * Returns 0 and sets *freeBytes, or -1 if a list leaves the data area. */
int demo_count_free(const ShmHeader *header, uint32_t *freeBytes);

#ifdef __cplusplus
}
#endif

#endif
