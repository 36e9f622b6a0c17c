/* Green-thread internals shared by the scheduler, the stack code, the
 * descriptor calls and the white-box tests. */
#ifndef QORBU_GREENTHREADS_GREENTHREAD_PRIVATE_H
#define QORBU_GREENTHREADS_GREENTHREAD_PRIVATE_H

#include <stddef.h>
#include <stdint.h>
#include <ucontext.h>

#include "greenthreads/greenthread.h"

/* Which sanitizer has to be told about stack switches. */
#if defined(__SANITIZE_ADDRESS__)
#define QORBU_GT_ASAN 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
#define QORBU_GT_ASAN 1
#endif
#endif
#if defined(__SANITIZE_THREAD__)
#define QORBU_GT_TSAN 1
#elif defined(__has_feature)
#if __has_feature(thread_sanitizer)
#define QORBU_GT_TSAN 1
#endif
#endif

/* One record per green thread plus one for the main context. The field
 * order is fixed: debuggers and the host's tools read it. */
struct Greenthread {
    ucontext_t context; /* uc_stack names the whole mapping, guard page included */
    Greenthread *next;  /* run queue link; free-list link once finished */
    int32_t runnable;   /* kRunnable, kBlocked or kFinished (below) */
    GreenthreadEntry entry;
    void *arg;
#ifdef QORBU_GT_TSAN
    void *tsan_fiber; /* ThreadSanitizer builds only */
#endif
};

static_assert(offsetof(Greenthread, context) == 0);
static_assert(offsetof(Greenthread, next) == sizeof(ucontext_t));
static_assert(offsetof(Greenthread, runnable) == sizeof(ucontext_t) + sizeof(void *));
#if UINTPTR_MAX == 0xffffffffu
static_assert(offsetof(Greenthread, entry) == sizeof(ucontext_t) + 8);
static_assert(offsetof(Greenthread, arg) == sizeof(ucontext_t) + 12);
#ifndef QORBU_GT_TSAN
static_assert(sizeof(Greenthread) == sizeof(ucontext_t) + 16);
#endif
#endif

namespace qorbu::gt {

/* Values of Greenthread::runnable. A finished record has a state of its own:
 * it sits on the free list through the link the run queue uses, so a wakeup
 * must never queue it. */
inline constexpr int32_t kBlocked = 0;
inline constexpr int32_t kRunnable = 1;
inline constexpr int32_t kFinished = -1;

/* Usable stack of every green thread, before rounding up to whole pages. */
inline constexpr size_t kStackSize = 16384;

/* Process-wide scheduler state; only the thread that called
 * greenthreads_init touches it. */
extern Greenthread *run_queue_head;
extern Greenthread *run_queue_tail;
extern Greenthread *current_thread;
extern Greenthread *free_threads;
extern Greenthread *main_thread;
extern long page_size;
extern int live_threads;

void run_queue_append(Greenthread *thread);
[[noreturn]] void greenthread_start();

/* One turn of the run loop: hand the processor to the queued threads if
 * there are any, otherwise wait once in the selector. */
void run_one_turn();

/* True in the main context, and before greenthreads_init: there the caller
 * must not block, it has to drive the run loop itself. */
inline bool in_main_context() { return current_thread == main_thread; }

/* Stacks (stack.cpp). */
size_t stack_mapping_length(long page_bytes);
bool process_wants_executable_stack();
/* Maps a stack of stack_mapping_length() bytes whose lowest page is the
 * guard page; null (errno set) when the mapping fails. */
void *stack_map();
void stack_unmap(void *base);

} // namespace qorbu::gt

#endif
