// Monotonic timers kept in a per-thread binary min-heap of caller-owned
// records. Slot 0 of the heap array is not part of the heap: the expiry run
// parks the timer it is firing there.
#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <unistd.h>

#include <limits>

#include "selector/sel_private.h"
#include "selector/time_private.h"

using namespace qorbu::sel;

namespace {

// Doubling must keep both the slot count and the byte size representable.
constexpr int32_t kMaxTimerCapacity = static_cast<int32_t>(
    (SIZE_MAX / sizeof(SelTimer *) - 1) / 2 < INT32_MAX / 2 ? (SIZE_MAX / sizeof(SelTimer *) - 1) / 2
                                                            : INT32_MAX / 2);

void place(SelContext *ctx, uint32_t slot, SelTimer *t) {
    ctx->timerHeap[slot] = t;
    t->heapIndex = slot;
}

bool holds(const SelContext *ctx, const SelTimer *t) {
    uint32_t i = t->heapIndex;
    return i >= 1 && i <= static_cast<uint32_t>(ctx->timerCount) && ctx->timerHeap[i] == t;
}

bool grow_heap(SelContext *ctx) {
    int32_t capacity = ctx->timerCapacity;
    if (capacity > kMaxTimerCapacity) {
        errno = ENOMEM;
        return false;
    }
    size_t slots = 2 * static_cast<size_t>(capacity) + 1;
    auto *heap = static_cast<SelTimer **>(realloc(ctx->timerHeap, slots * sizeof(SelTimer *)));
    if (heap == nullptr) return false;
    for (size_t i = static_cast<size_t>(capacity) + 1; i < slots; ++i) heap[i] = nullptr;
    ctx->timerHeap = heap;
    ctx->timerCapacity = 2 * capacity;
    return true;
}

int add_timer(SelContext *ctx, SelTimer *t) {
    if (t->heapIndex != 0 || t->callback == nullptr) {
        kill(getpid(), SIGQUIT);
        return kTimerMisuse;
    }
    if (ctx->timerCount == ctx->timerCapacity && !grow_heap(ctx)) return -1;
    ctx->timerCount += 1;
    place(ctx, static_cast<uint32_t>(ctx->timerCount), t);
    SelHeapUp(ctx, static_cast<uint32_t>(ctx->timerCount));
    return 0;
}

void remove_timer(SelContext *ctx, SelTimer *t) {
    uint32_t i = t->heapIndex;
    if (i == 0) return;
    if (!holds(ctx, t)) abort();
    t->heapIndex = 0;

    uint32_t last = static_cast<uint32_t>(ctx->timerCount);
    ctx->timerCount -= 1;
    if (i == last) {
        ctx->timerHeap[i] = nullptr;
        return;
    }
    SelTimer *moved = ctx->timerHeap[last];
    ctx->timerHeap[last] = nullptr;
    place(ctx, i, moved);
    if (i > 1 && deadline_before(moved->when, ctx->timerHeap[i / 2]->when))
        SelHeapUp(ctx, i);
    else
        SelHeapDown(ctx, i);
}

// A sift-down in a large heap waits on the records of both children at every
// level; asking for the next level's four records one level ahead overlaps
// those cache misses. Changes nothing but timing.
constexpr uint32_t kGrandchildren = 4;

inline void prefetch_grandchildren(SelTimer *const *heap, uint32_t left, uint32_t count) {
    const uint32_t first = 2 * left;
    if (first + kGrandchildren - 1 > count) return;
    for (uint32_t g = first; g < first + kGrandchildren; ++g) __builtin_prefetch(&heap[g]->when);
}

bool is_due(const SelTimer *t, const struct timespec &now) { return !deadline_before(now, t->when); }

// Whether the timer is due by the clock as it reads now. A reading taken
// before the last callback serves as long as it already shows the timer due:
// the monotonic clock never goes back. Only otherwise is the clock read again.
bool due_by_clock(const SelTimer *t, struct timespec &now, bool &fresh) {
    if (is_due(t, now)) return true;
    if (fresh) return false;
    SelGetTime(&now);
    fresh = true;
    return is_due(t, now);
}

} // namespace

extern "C" {

int SelTimerBefore(const struct timespec *a, const struct timespec *b) { return deadline_before(*a, *b); }

void SelHeapUp(SelContext *ctx, uint32_t slot) {
    SelTimer **heap = ctx->timerHeap;
    SelTimer *t = heap[slot];
    while (slot > 1) {
        SelTimer *parent = heap[slot / 2];
        if (!deadline_before(t->when, parent->when)) break;
        place(ctx, slot, parent);
        slot /= 2;
    }
    place(ctx, slot, t);
}

void SelHeapDown(SelContext *ctx, uint32_t slot) {
    SelTimer **heap = ctx->timerHeap;
    SelTimer *t = heap[slot];
    const uint32_t count = static_cast<uint32_t>(ctx->timerCount);
    for (;;) {
        uint32_t left = 2 * slot;
        if (left > count) break;
        prefetch_grandchildren(heap, left, count);
        uint32_t right = left + 1;
        uint32_t child = left;
        // On equal deadlines the right child goes up.
        if (right <= count && !deadline_before(heap[left]->when, heap[right]->when)) child = right;
        if (!deadline_before(heap[child]->when, t->when)) break;
        place(ctx, slot, heap[child]);
        slot = child;
    }
    place(ctx, slot, t);
}

int SelGetTime(struct timespec *now) {
    if (clock_gettime(CLOCK_MONOTONIC, now) != 0) {
        perror("clock_gettime(CLOCK_MONOTONIC) failed");
        abort();
    }
    return 0;
}

int SelMakeWhen(struct timespec *when, long sec, long nsec) {
    SelGetTime(when);
    // Whole seconds in nsec are carried (a negative rest borrows one), and a
    // deadline beyond what time_t holds saturates instead of wrapping.
    long long carry = nsec / kNsecPerSec;
    long long rest = static_cast<long long>(when->tv_nsec) + nsec % kNsecPerSec;
    if (rest > kNsecPerSec - 1) {
        rest -= kNsecPerSec;
        ++carry;
    } else if (rest < 0) {
        rest += kNsecPerSec;
        --carry;
    }
    long long seconds;
    const bool overflow =
        __builtin_add_overflow(static_cast<long long>(when->tv_sec), static_cast<long long>(sec), &seconds) ||
        __builtin_add_overflow(seconds, carry, &seconds);
    constexpr time_t kLatest = std::numeric_limits<time_t>::max();
    constexpr time_t kEarliest = std::numeric_limits<time_t>::min();
    if (overflow ? sec > 0 : seconds > kLatest) {
        *when = {kLatest, kNsecPerSec - 1};
    } else if (overflow || seconds < kEarliest) {
        *when = {kEarliest, 0};
    } else {
        when->tv_sec = static_cast<time_t>(seconds);
        when->tv_nsec = static_cast<long>(rest);
    }
    return 0;
}

int SelAddTimer(SelTimer *t) { return add_timer(SelCurrentContext(), t); }

void SelRemTimer(SelTimer *t) { remove_timer(SelCurrentContext(), t); }

int SelModifyTimer(SelTimer *t, const struct timespec *when) {
    SelContext *ctx = SelCurrentContext();
    if (t->heapIndex == 0) {
        t->when = *when;
        return add_timer(ctx, t);
    }
    if (t->callback == nullptr || !holds(ctx, t)) abort();
    bool later = deadline_before(t->when, *when);
    t->when = *when;
    if (later)
        SelHeapDown(ctx, t->heapIndex);
    else
        SelHeapUp(ctx, t->heapIndex);
    return 0;
}

int SelRemoveAllTimers(void) {
    SelContext *ctx = SelCurrentContext();
    int removed = 0;
    while (ctx->timerHeap[1] != nullptr) {
        remove_timer(ctx, ctx->timerHeap[1]);
        ++removed;
    }
    return removed;
}

int SelDebugIsTimerActive(SelTimer *t) {
    const SelContext *ctx = SelCurrentContext();
    for (int32_t i = 1; i <= ctx->timerCount; ++i)
        if (ctx->timerHeap[i] == t) return 1;
    return 0;
}

int SelSleep(SelTimer *t, unsigned int ms) {
    const struct timespec span = ms_to_timespec(ms);
    struct timespec when;
    SelMakeWhen(&when, static_cast<long>(span.tv_sec), span.tv_nsec);
    return SelModifyTimer(t, &when);
}

int SelRunTimers(SelContext *ctx) {
    struct timespec now;
    SelGetTime(&now);
    bool fresh = true;
    int fired = 0;
    for (;;) {
        SelTimer *top = ctx->timerHeap[1];
        if (top == nullptr || !due_by_clock(top, now, fresh)) break;
        ctx->timerHeap[0] = top;
        remove_timer(ctx, top);
        // The callback may re-arm, disarm or free the record, or grow the heap.
        if (SelTimerCallback callback = top->callback) callback(top);
        if (++fired == kMaxTimersPerRun) break;
        fresh = false;
    }
    return fired;
}

} // extern "C"
