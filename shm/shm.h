/* libqorbu shared memory: named POSIX segments mapped at one address in
 * every process, with a buddy allocator for their data area. */
#ifndef QORBU_SHM_SHM_H
#define QORBU_SHM_SHM_H

#include <pthread.h>
#include <stdint.h>
#include <stdio.h>

#ifndef QORBU_API
#define QORBU_API __attribute__((visibility("default")))
#endif

#ifdef __cplusplus
extern "C" {
#endif

/* The header at the start of every segment; the data area starts one page
 * further. This is the format every process sharing a segment relies on. */
typedef struct ShmHeader {
    uintptr_t base;          /* address of this header in every process */
    uint32_t size;           /* whole segment length; 0 until published */
    pthread_mutex_t mutex;   /* process-shared, robust */
    uint32_t useFlock;       /* 1 once a second read-write handle attached */
    uint32_t busy;           /* 1 while an allocation or free changes the lists */
    uintptr_t freeList[27];  /* heads, class k holds blocks of 8 << k bytes */
} ShmHeader;

typedef struct ShmHandle ShmHandle;

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
