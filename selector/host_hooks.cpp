/* The host's task queue, reached through a weak reference: a process
 * without the host scheduler's functions has nothing to drain. */
#include "selector/dispatch_private.h"

#include <cstddef>

extern "C" void SelDrainHostQueue(void *hostContext) {
    if (!thread_fetch_queued || !thread_call) return;
    alignas(std::max_align_t) unsigned char task[SEL_HOST_TASK_SIZE];
    while (thread_fetch_queued(hostContext, task) != 0) thread_call(task);
}
