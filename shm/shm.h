/* libqorbu shared memory: named POSIX segments mapped at one address in
 * every process, with a buddy allocator for their data area.
 *
 * Segment format (shared by every process that attaches a segment; 32-bit
 * and 64-bit processes never share one). P is the page size (getpagesize()).
 *
 *   32-bit targets (i386, armhf), every address a 32-bit word:
 *     offset   0  4   base      address of this header in every process
 *     offset   4  4   size      whole segment length; 0 until published
 *     offset   8 24   mutex     pthread_mutex_t, process-shared and robust
 *     offset  32  4   useFlock  1 once a second read-write handle attached
 *     offset  36  4   busy      1 while an allocation or free runs
 *     offset  40 108  freeList  27 heads, class k at 40 + 4k
 *     offset 148      metadata area (ShmMetadata), up to the end of the page
 *     offset   P      data area (ShmAddr)
 *
 *   64-bit targets (x86_64), natural layout, every address a 64-bit word:
 *     offset   0  8   base
 *     offset   8  4   size      (4 bytes of padding follow)
 *     offset  16 40   mutex
 *     offset  56  4   useFlock
 *     offset  60  4   busy
 *     offset  64 216  freeList  27 heads, class k at 64 + 8k
 *     offset 280      metadata area, up to the end of the page
 *     offset   P      data area
 *
 * Blocks: class k (0..26) holds blocks of 8 << k bytes. A free block's first
 * word (uintptr_t) links to the next free block of its class; every list is
 * kept in strictly descending address order. An allocated block's class word
 * is the uintptr_t just below it and holds the address of its class's
 * freeList slot; ShmAlloc(n) picks the smallest k with
 * n + sizeof(uintptr_t) <= 8 << k, so the last word of every block is never
 * the caller's. The class word of the block at the start of the data area is
 * the last word of the header page, i.e. of the metadata area. */
#ifndef QORBU_SHM_SHM_H
#define QORBU_SHM_SHM_H

#include <pthread.h>
#include <stdint.h>
#include <stdio.h>

#include "qorbu_api.h"

#ifdef __cplusplus
extern "C" {
#endif

/* The header at the start of every segment; the data area starts one page
 * further. This is the format every process sharing a segment relies on. */
typedef struct ShmHeader {
    uintptr_t base;         /* address of this header in every process */
    uint32_t size;          /* whole segment length; 0 until published */
    pthread_mutex_t mutex;  /* process-shared, robust */
    uint32_t useFlock;      /* 1 once a second read-write handle attached */
    uint32_t busy;          /* 1 while an allocation or free changes the lists */
    uintptr_t freeList[27]; /* heads, class k holds blocks of 8 << k bytes */
} ShmHeader;

struct ShmMapping;

/* The process-local handle of an attached segment, made by ShmCreate or
 * ShmOpen and released by ShmClose. Callers may read the first three fields;
 * the rest belongs to the library. */
typedef struct ShmHandle {
    int fd;                     /* the object's descriptor; carries the descriptor lock */
    ShmHeader *base;            /* the mapped header page */
    uint32_t size;              /* length of the mapping: the whole segment */
    uint32_t writable;          /* opened O_RDWR */
    struct ShmMapping *mapping; /* the process's one mapping of this segment */
} ShmHandle;

QORBU_API ShmHandle *ShmCreate(const char *name, void *addr, uint32_t size);
QORBU_API ShmHandle *ShmOpen(const char *name, int mode);
QORBU_API void ShmClose(ShmHandle *h);
QORBU_API int ShmUnlink(const char *name);
QORBU_API void *ShmAddr(ShmHandle *h);
QORBU_API void *ShmMetadata(ShmHandle *h, uint32_t len);
QORBU_API int ShmOverhead(void);
QORBU_API void *ShmAlloc(ShmHandle *h, uint32_t n);
QORBU_API void ShmFree(ShmHandle *h, void *p);
QORBU_API uint32_t ShmTotalFree(ShmHandle *h);
QORBU_API void ShmPrintFree(FILE *stream, ShmHeader *header);

#ifdef __cplusplus
}
#endif

#endif
