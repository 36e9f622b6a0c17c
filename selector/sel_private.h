/* Selector internals shared by the selector's source files, white-box tests
 * and debuggers (which read SelContext through sel_tl_key). */
#ifndef QORBU_SELECTOR_SEL_PRIVATE_H
#define QORBU_SELECTOR_SEL_PRIVATE_H

#include <signal.h>
#include <stddef.h>

#include "selector/sel.h"

#ifdef __cplusplus
#include <atomic>
#include <ctime>
#endif

#ifdef __cplusplus
extern "C" {
#endif

struct epoll_event;

/* One per selector thread. The field order is fixed: tools read it; fields
 * are only ever added at the end. */
typedef struct SelContext {
    sigset_t signals; /* registered signals: blocked except while waiting */
    fd_set readSet;   /* select-mode interest sets */
    fd_set writeSet;
    fd_set exceptSet;
    int32_t nfds;      /* one past the highest select-mode registration */
    int32_t scanStart; /* where the next read/write scan begins */
    SelFdEntry *fdTable;
    int32_t fdTableSize;
    SelTimer **timerHeap; /* slot 0: timer being fired; 1..timerCount: min-heap */
    int32_t timerCount;
    int32_t timerCapacity;
    void *zg;         /* host context from SelSetZG */
    fd_set readyRead; /* working sets of the current wait */
    fd_set readyWrite;
    fd_set readyExcept;
    uint32_t pass_count; /* passes started in this thread, nested ones included */
    /* The events of the running epoll pass, and the first not yet
     * dispatched: SelRemFD drops a removed descriptor's events from it. */
    struct epoll_event *epoll_batch;
    int32_t epoll_batch_next;
    int32_t epoll_batch_end;
} SelContext;

#ifdef __cplusplus
static_assert(SEL_READ == 1u && SEL_WRITE == 2u && SEL_EXCEPT == 4u && SEL_IN_CALLBACK == 8u);
#if UINTPTR_MAX == 0xffffffffu
/* Debuggers and host tools read these records on the 32-bit targets. */
static_assert(sizeof(time_t) == 4 && sizeof(long) == 4);
static_assert(offsetof(SelTimer, heapIndex) == 0 && offsetof(SelTimer, when) == 4);
static_assert(offsetof(SelTimer, callback) == 12 && offsetof(SelTimer, arg) == 16 && sizeof(SelTimer) == 20);
static_assert(offsetof(SelFdEntry, events) == 0 && offsetof(SelFdEntry, idleTracked) == 4);
static_assert(offsetof(SelFdEntry, lastActivity) == 8 && offsetof(SelFdEntry, callback) == 16);
static_assert(offsetof(SelFdEntry, arg) == 20 && sizeof(SelFdEntry) == 24);
static_assert(offsetof(SelContext, signals) == 0 && offsetof(SelContext, readSet) == 128);
static_assert(offsetof(SelContext, writeSet) == 256 && offsetof(SelContext, exceptSet) == 384);
static_assert(offsetof(SelContext, nfds) == 512 && offsetof(SelContext, scanStart) == 516);
static_assert(offsetof(SelContext, fdTable) == 520 && offsetof(SelContext, fdTableSize) == 524);
static_assert(offsetof(SelContext, timerHeap) == 528 && offsetof(SelContext, timerCount) == 532);
static_assert(offsetof(SelContext, timerCapacity) == 536 && offsetof(SelContext, zg) == 540);
static_assert(offsetof(SelContext, readyRead) == 544 && offsetof(SelContext, readyWrite) == 672);
static_assert(offsetof(SelContext, readyExcept) == 800);
/* Later fields are appended behind the ones above, which keep their places. */
static_assert(offsetof(SelContext, pass_count) == 928);
#endif
#endif

/* Internal operations, hidden from the library's users but linkable by the
 * white-box tests (they link the static archive of the same objects). */
/* The calling thread's context: every timer and descriptor call looks it up,
 * so the lookup is inline; on x86-64 it calls the C library's lookup through
 * the GOT, without the PLT stub's extra indirect jump (measured: about 1 ns
 * of the 17 of an arm and cancel with 100 timers armed). */
#if defined(__x86_64__) && defined(__has_attribute)
#if __has_attribute(noplt)
extern void *pthread_getspecific(pthread_key_t key) __THROW __attribute__((noplt));
#endif
#endif
static inline SelContext *SelCurrentContext(void) { return (SelContext *)pthread_getspecific(sel_tl_key); }
void SelCreateKey(void);
void SelFreeContext(void *context);

int SelTimerBefore(const struct timespec *a, const struct timespec *b);
void SelHeapUp(SelContext *ctx, uint32_t slot);
void SelHeapDown(SelContext *ctx, uint32_t slot);
int SelRunTimers(SelContext *ctx);

SelFdEntry *SelFdSlot(SelContext *ctx, int fd);
/* The entry of fd when the table reaches it, else null; never grows it. */
static inline SelFdEntry *SelFdFind(SelContext *ctx, int fd) {
    return fd >= 0 && fd < ctx->fdTableSize ? &ctx->fdTable[fd] : (SelFdEntry *)0;
}
void SelDispatchFD(SelContext *ctx, int fd, unsigned int event);

int SelReapIdleFDs(SelTimer *timer);

void SelDrainHostQueue(void *hostContext);

#ifdef __cplusplus
}

namespace qorbu::sel {

inline constexpr int kReaperPeriodSec = 30;
inline constexpr int kIdleLimitSec = 25;
inline constexpr int kReaperExitThreshold = 800;
inline constexpr int kMaxTimersPerRun = 101;
inline constexpr int kSelectSetSize = FD_SETSIZE;
inline constexpr int kMaxSignal = 64;
inline constexpr int kTimerMisuse = -117;
inline constexpr int kErestart = 85;

/* The deadline order (SelTimerBefore), inline for the heap's loops and the
 * dispatch loops: a is before b when its seconds are less, or equal with
 * fewer nanoseconds; both fields compare as signed numbers. */
inline bool deadline_before(const struct timespec &a, const struct timespec &b) {
    return a.tv_sec < b.tv_sec || (a.tv_sec == b.tv_sec && a.tv_nsec < b.tv_nsec);
}

/* The process-wide epoll instance; 0 means select mode. */
extern std::atomic<int> epoll_fd;
inline int current_epoll_fd() { return epoll_fd.load(std::memory_order_relaxed); }

/* The reaper timer is armed in one live thread's heap at a time: the
 * owner's. When the owner's thread ends, the next pass of any selector
 * thread takes the reaper over; a pass pays one relaxed load for this. */
extern std::atomic<SelContext *> reaper_owner;
void arm_reaper_if_free(SelContext *ctx);
void release_reaper(SelContext *ctx);
inline void adopt_orphaned_reaper(SelContext *ctx) {
    if (reaper_owner.load(std::memory_order_relaxed) == nullptr) arm_reaper_if_free(ctx);
}

/* Starts a pass: counts it (a dispatch loop stops once a callback has run a
 * nested pass) and takes an orphaned reaper over. Returns the pass number. */
inline uint32_t begin_pass(SelContext *ctx) {
    adopt_orphaned_reaper(ctx);
    return ++ctx->pass_count;
}

/* One SelEpoll pass. The run loop of the green threads passes true: with no
 * timer armed it sleeps until a descriptor or a signal wakes it, where
 * SelEpoll itself does not wait at all. */
int epoll_pass(bool sleep_without_timer);

} // namespace qorbu::sel
#endif

#endif
