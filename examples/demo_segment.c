/* Reading the demo's segment without the allocator's lock; see demo_segment.h. */
#include "demo_segment.h"

#include <unistd.h>

enum { kSizeClasses = 27, kSmallestBlock = 8 };

int demo_count_free(const ShmHeader *header, uint32_t *freeBytes)
{
    const uintptr_t dataStart = header->base + (uintptr_t)getpagesize();
    const uintptr_t dataEnd = header->base + header->size;
    const uintptr_t maxBlocks = (dataEnd - dataStart) / kSmallestBlock;
    uint32_t total = 0;
    for (int k = 0; k < kSizeClasses; ++k) {
        const uint32_t blockSize = (uint32_t)kSmallestBlock << k;
        uintptr_t steps = 0;
        for (uintptr_t block = header->freeList[k]; block; block = *(const uintptr_t *)block) {
            if (block < dataStart || block >= dataEnd || ++steps > maxBlocks)
                return -1;
            total += blockSize;
        }
    }
    *freeBytes = total;
    return 0;
}
