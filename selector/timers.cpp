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
#include <type_traits>

#include "selector/sel_private.h"
#include "selector/time_private.h"

using namespace qorbu::sel;

namespace {

// Doubling must keep both the slot count and the byte size representable.
constexpr int32_t kMaxTimerCapacity = static_cast<int32_t>(
    (SIZE_MAX / sizeof(SelTimer *) - 1) / 2 < INT32_MAX / 2 ? (SIZE_MAX / sizeof(SelTimer *) - 1) / 2
                                                            : INT32_MAX / 2);

// The heap operations below are the inside of the exported calls: they are
// always inlined there, take the context once from their caller and never
// call out of this file on the common path. The rare paths (growth, misuse,
// broken records) live out of line.

inline bool before(const SelTimer *a, const SelTimer *b) { return deadline_before(a->when, b->when); }

[[gnu::always_inline]] inline void place(SelTimer **heap, uint32_t slot, SelTimer *t) {
    heap[slot] = t;
    t->heapIndex = slot;
}

bool holds(const SelContext *ctx, const SelTimer *t) {
    uint32_t i = t->heapIndex;
    return i >= 1 && i <= static_cast<uint32_t>(ctx->timerCount) && ctx->timerHeap[i] == t;
}

// Where t comes to rest when it moves up from the free slot `slot`: every
// parent strictly later than t moves down a level on the way. t itself is
// not stored.
[[gnu::always_inline]] inline uint32_t sift_up(SelTimer **heap, uint32_t slot, const SelTimer *t) {
    while (slot > 1) {
        const uint32_t up = slot / 2;
        SelTimer *parent = heap[up];
        if (!before(t, parent)) break;
        place(heap, slot, parent);
        slot = up;
    }
    return slot;
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

// The deadline order as one comparison of integers twice as wide (seconds
// high; nanoseconds low, sign bit flipped so that they order as unsigned),
// which compiles without a branch: for choices that follow no pattern, such
// as which of two children is earlier, a mispredicted branch costs more than
// the few extra instructions.
#ifdef __SIZEOF_INT128__
using DeadlineKey =
    std::conditional_t<(sizeof(time_t) + sizeof(long) <= sizeof(long long)), long long, __int128>;
#else
using DeadlineKey = long long;
static_assert(sizeof(time_t) + sizeof(long) <= sizeof(long long));
#endif

inline DeadlineKey deadline_key(const struct timespec &w) {
    using Low = std::make_unsigned_t<long>;
    constexpr int kLowBits = 8 * sizeof(long);
    return (DeadlineKey(w.tv_sec) << kLowBits) | DeadlineKey(Low(w.tv_nsec) ^ (Low(1) << (kLowBits - 1)));
}

// Where t comes to rest when it moves down from the free slot `slot` of a
// heap of `count` timers: the earlier child (the right one on equal
// deadlines) moves up while it is strictly earlier than t. t is not stored.
[[gnu::always_inline]] inline uint32_t sift_down(SelTimer **heap, uint32_t count, uint32_t slot,
                                                 const SelTimer *t) {
    for (;;) {
        const uint32_t left = 2 * slot;
        if (left > count) break;
        prefetch_grandchildren(heap, left, count);
        uint32_t child = left;
        if (left < count)
            child += deadline_key(heap[left + 1]->when) <= deadline_key(heap[left]->when); // right wins ties
        SelTimer *c = heap[child];
        if (!before(c, t)) break;
        place(heap, slot, c);
        slot = child;
    }
    return slot;
}

[[gnu::noinline, gnu::cold]] bool grow_heap(SelContext *ctx) {
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

[[gnu::noinline, gnu::cold]] int refuse_misuse() {
    kill(getpid(), SIGQUIT);
    return kTimerMisuse;
}

[[gnu::always_inline]] inline int add_timer(SelContext *ctx, SelTimer *t) {
    if (__builtin_expect(t->heapIndex != 0 || t->callback == nullptr, 0)) return refuse_misuse();
    int32_t count = ctx->timerCount;
    if (__builtin_expect(count == ctx->timerCapacity, 0) && !grow_heap(ctx)) return -1;
    ctx->timerCount = ++count;
    SelTimer **heap = ctx->timerHeap;
    place(heap, sift_up(heap, static_cast<uint32_t>(count), t), t);
    return 0;
}

// Takes the armed timer out of slot i: the last timer fills the gap and moves
// up or down from there.
[[gnu::always_inline]] inline void remove_at(SelContext *ctx, uint32_t i, SelTimer *t) {
    SelTimer **heap = ctx->timerHeap;
    const uint32_t last = static_cast<uint32_t>(ctx->timerCount);
    t->heapIndex = 0;
    ctx->timerCount = static_cast<int32_t>(last - 1);
    SelTimer *moved = heap[last];
    heap[last] = nullptr;
    if (i == last) return;
    const uint32_t slot =
        i > 1 && before(moved, heap[i / 2]) ? sift_up(heap, i, moved) : sift_down(heap, last - 1, i, moved);
    place(heap, slot, moved);
}

[[gnu::always_inline]] inline void remove_timer(SelContext *ctx, SelTimer *t) {
    const uint32_t i = t->heapIndex;
    if (i == 0) return;
    if (__builtin_expect(!holds(ctx, t), 0)) abort();
    remove_at(ctx, i, t);
}

// The new deadline is copied field by field: callers have usually just built
// it with two separate stores, and one wide load across both (which the
// compiler would otherwise make of the copy) cannot take their values from
// the store buffer; it waits until both have reached the cache. The empty asm
// keeps the fields in general registers.
[[gnu::always_inline]] inline void set_when(SelTimer *t, const struct timespec *when) {
    time_t sec = when->tv_sec;
    long nsec = when->tv_nsec;
    asm("" : "+r"(sec), "+r"(nsec));
    t->when.tv_sec = sec;
    t->when.tv_nsec = nsec;
}

[[gnu::always_inline]] inline int modify_timer(SelContext *ctx, SelTimer *t, const struct timespec *when) {
    const uint32_t i = t->heapIndex;
    if (i == 0) {
        set_when(t, when);
        return add_timer(ctx, t);
    }
    if (__builtin_expect(t->callback == nullptr || !holds(ctx, t), 0)) abort();
    const bool later = deadline_before(t->when, *when);
    set_when(t, when);
    SelTimer **heap = ctx->timerHeap;
    const uint32_t slot =
        later ? sift_down(heap, static_cast<uint32_t>(ctx->timerCount), i, t) : sift_up(heap, i, t);
    if (slot != i) place(heap, slot, t); // a timer that stays keeps its slot and index
    return 0;
}

bool is_due(const SelTimer *t, const struct timespec &now) { return !deadline_before(now, t->when); }

// Whether the timer is due by the clock as it reads now. A reading taken
// before the last callback serves as long as it already shows the timer due:
// the monotonic clock never goes back. Only otherwise is the clock read again.
bool due_by_clock(const SelTimer *t, struct timespec &now, bool &fresh) {
    if (is_due(t, now)) return true;
    if (fresh) return false;
    read_clock(&now);
    fresh = true;
    return is_due(t, now);
}

void make_when(struct timespec *when, long sec, long nsec) {
    read_clock(when);
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
}

} // namespace

namespace qorbu::sel {

void clock_failed() {
    perror("clock_gettime(CLOCK_MONOTONIC) failed");
    abort();
}

} // namespace qorbu::sel

extern "C" {

int SelTimerBefore(const struct timespec *a, const struct timespec *b) { return deadline_before(*a, *b); }

void SelHeapUp(SelContext *ctx, uint32_t slot) {
    SelTimer *t = ctx->timerHeap[slot];
    place(ctx->timerHeap, sift_up(ctx->timerHeap, slot, t), t);
}

void SelHeapDown(SelContext *ctx, uint32_t slot) {
    SelTimer *t = ctx->timerHeap[slot];
    place(ctx->timerHeap, sift_down(ctx->timerHeap, static_cast<uint32_t>(ctx->timerCount), slot, t), t);
}

int SelGetTime(struct timespec *now) {
    read_clock(now);
    return 0;
}

int SelMakeWhen(struct timespec *when, long sec, long nsec) {
    make_when(when, sec, nsec);
    return 0;
}

int SelAddTimer(SelTimer *t) { return add_timer(SelCurrentContext(), t); }

void SelRemTimer(SelTimer *t) { remove_timer(SelCurrentContext(), t); }

int SelModifyTimer(SelTimer *t, const struct timespec *when) {
    return modify_timer(SelCurrentContext(), t, when);
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
    make_when(&when, static_cast<long>(span.tv_sec), span.tv_nsec);
    return modify_timer(SelCurrentContext(), t, &when);
}

int SelRunTimers(SelContext *ctx) {
    struct timespec now;
    read_clock(&now);
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
