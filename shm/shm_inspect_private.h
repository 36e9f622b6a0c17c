/* Inspection of a segment's free lists for qorbu-shm, which links the
 * library's objects statically: the same checked walk that every allocator
 * operation uses. Not exported from libqorbu.so; plain C. */
#ifndef QORBU_SHM_SHM_INSPECT_PRIVATE_H
#define QORBU_SHM_SHM_INSPECT_PRIVATE_H

#include "shm/shm.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef struct ShmFreeSummary {
    uint32_t free_bytes; /* whole free blocks */
    uint32_t blocks;     /* number of free blocks */
    uint32_t largest;    /* size of the largest free block, 0 when none */
} ShmFreeSummary;

/* Walks every free list of the handle's segment, without the segment lock.
 * Returns 0, or EUCLEAN when a list is damaged. */
__attribute__((visibility("hidden"))) int qorbu_shm_summarise(const ShmHandle *h, ShmFreeSummary *summary);

typedef enum ShmBlockState {
    SHM_BLOCK_ALLOCATED, /* a block as ShmAlloc hands them out, not in its free list */
    SHM_BLOCK_FREE,      /* in its class's free list already */
    SHM_BLOCK_FOREIGN,   /* not the start of a block of this segment */
    SHM_BLOCK_DAMAGED    /* its class's free list is damaged */
} ShmBlockState;

/* What ShmFree would find at p, without the segment lock. */
__attribute__((visibility("hidden"))) ShmBlockState qorbu_shm_block_state(const ShmHandle *h, const void *p);

#ifdef __cplusplus
}
#endif

#endif
