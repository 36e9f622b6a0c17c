#include <cerrno>
#include <csignal>
#include <cstdlib>

#include <algorithm>
#include <climits>
#include <limits>
#include <map>
#include <random>
#include <vector>

#include "selector_fixture.h"

using qorbu::test::noop_timer_callback;
using qorbu::test::SelectorTest;

namespace {

struct timespec at(long sec, long nsec = 0) {
    struct timespec t;
    t.tv_sec = sec;
    t.tv_nsec = nsec;
    return t;
}

struct timespec now_plus(long sec, long nsec = 0) {
    struct timespec t;
    SelMakeWhen(&t, sec, nsec);
    return t;
}

SelTimer make_timer(struct timespec when, SelTimerCallback callback = noop_timer_callback) {
    SelTimer t{};
    t.when = when;
    t.callback = callback;
    return t;
}

void block_sigquit() {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGQUIT);
    pthread_sigmask(SIG_BLOCK, &set, nullptr);
}

// Every armed timer sits at its own index and no child is earlier than its parent.
void expect_heap_consistent(const SelContext *ctx) {
    for (int32_t i = 1; i <= ctx->timerCount; ++i) {
        const SelTimer *t = ctx->timerHeap[i];
        ASSERT_NE(t, nullptr);
        ASSERT_EQ(t->heapIndex, static_cast<uint32_t>(i));
        if (i > 1) {
            ASSERT_FALSE(SelTimerBefore(&t->when, &ctx->timerHeap[i / 2]->when)) << "slot " << i;
        }
    }
    ASSERT_EQ(ctx->timerHeap[1] == nullptr, ctx->timerCount == 0);
}

// The heap as documented, one step at a time: the library must leave every
// timer in the same slot, which fixes the order in which equal deadlines fire.
struct ModelHeap {
    std::vector<SelTimer *> slot{nullptr};
    static bool before(const struct timespec &a, const struct timespec &b) {
        return a.tv_sec < b.tv_sec || (a.tv_sec == b.tv_sec && a.tv_nsec < b.tv_nsec);
    }
    size_t last() const { return slot.size() - 1; }
    void up(size_t i) {
        SelTimer *t = slot[i];
        for (; i > 1 && before(t->when, slot[i / 2]->when); i /= 2) slot[i] = slot[i / 2];
        slot[i] = t;
    }
    void down(size_t i) {
        SelTimer *t = slot[i];
        for (size_t c; (c = 2 * i) <= last(); i = c) {
            if (c + 1 <= last() && !before(slot[c]->when, slot[c + 1]->when)) ++c; // right wins ties
            if (!before(slot[c]->when, t->when)) break;
            slot[i] = slot[c];
        }
        slot[i] = t;
    }
    void add(SelTimer *t) {
        slot.push_back(t);
        up(last());
    }
    void remove(SelTimer *t) {
        size_t i = size_t(std::find(slot.begin() + 1, slot.end(), t) - slot.begin());
        if (i > last()) return;
        slot[i] = slot[last()];
        slot.pop_back();
        if (i > last()) return;
        if (i > 1 && before(slot[i]->when, slot[i / 2]->when))
            up(i);
        else
            down(i);
    }
    // After the library gave t its new deadline; later: the old one was before it.
    void rearmed(SelTimer *t, bool later) {
        size_t i = size_t(std::find(slot.begin() + 1, slot.end(), t) - slot.begin());
        if (i > last()) return add(t);
        later ? down(i) : up(i);
    }
};

class TimerHeapTest : public SelectorTest {
  protected:
    void SetUp() override {
        SelectorTest::SetUp();
        ASSERT_EQ(SelRemoveAllTimers(), 1); // the reaper
    }
};

} // namespace

TEST(SelClock, MakeWhenCarriesIntoSeconds) {
    struct timespec base, when;
    SelGetTime(&base);
    SelMakeWhen(&when, 0, 0);
    EXPECT_FALSE(SelTimerBefore(&when, &base));

    // Whatever the clock reads, the result is normalised and at least now + 2.999999999 s.
    for (int i = 0; i < 1000; ++i) {
        SelGetTime(&base);
        SelMakeWhen(&when, 2, 999999999);
        ASSERT_GE(when.tv_nsec, 0);
        ASSERT_LE(when.tv_nsec, 999999999);
        long long delta = (static_cast<long long>(when.tv_sec) - base.tv_sec) * 1000000000LL +
                          (when.tv_nsec - base.tv_nsec);
        ASSERT_GE(delta, 2999999999LL);
    }
    SelMakeWhen(&when, -5, 0);
    EXPECT_TRUE(SelTimerBefore(&when, &base));

    // Nanoseconds outside one second carry or borrow whole seconds; sums
    // beyond time_t saturate instead of wrapping.
    constexpr time_t kLatest = std::numeric_limits<time_t>::max();
    struct Case {
        long sec, nsec;
        long long minDelta, maxDelta; // ns after base; 0, 0: saturated
        struct timespec saturated;
    } cases[] = {{0, 1999999999L, 1999999999LL, 2999999999LL, {}},
                 {3, -1, 2999999999LL, 3999999999LL, {}},
                 {1, -2100000000L, -1100000000LL, -100000000LL, {}},
                 {LONG_MAX, 999999999L, 0, 0, {kLatest, 999999999L}}};
    for (const Case &c : cases) {
        SelGetTime(&base);
        SelMakeWhen(&when, c.sec, c.nsec);
        ASSERT_GE(when.tv_nsec, 0) << c.sec << " " << c.nsec;
        ASSERT_LE(when.tv_nsec, 999999999L) << c.sec << " " << c.nsec;
        if (c.minDelta == 0 && c.maxDelta == 0) {
            if (sizeof(long) < sizeof(time_t)) continue; // a long cannot reach the limits
            EXPECT_EQ(when.tv_sec, c.saturated.tv_sec) << c.sec;
            EXPECT_EQ(when.tv_nsec, c.saturated.tv_nsec) << c.sec;
            continue;
        }
        long long delta = (static_cast<long long>(when.tv_sec) - base.tv_sec) * 1000000000LL +
                          (when.tv_nsec - base.tv_nsec);
        EXPECT_GE(delta, c.minDelta) << c.sec << " " << c.nsec;
        EXPECT_LT(delta, c.maxDelta) << c.sec << " " << c.nsec;
    }
}

TEST_F(TimerHeapTest, SleepSetsMillisecondDeadline) {
    SelTimer t = make_timer(at(0));
    struct timespec before, after;
    SelGetTime(&before);
    ASSERT_EQ(SelSleep(&t, 1500), 0);
    SelGetTime(&after);
    auto ns = [](const struct timespec &v) {
        return static_cast<long long>(v.tv_sec) * 1000000000LL + v.tv_nsec;
    };
    EXPECT_GE(ns(t.when) - ns(before), 1500000000LL);
    EXPECT_LE(ns(t.when) - ns(after), 1500000000LL);
    EXPECT_EQ(SelDebugIsTimerActive(&t), 1);
    SelRemTimer(&t);
}

TEST_F(TimerHeapTest, CapacityDoubles) {
    SelTimer timers[5];
    const int32_t expected[] = {1, 2, 4, 4, 8};
    for (int i = 0; i < 5; ++i) {
        timers[i] = make_timer(at(100 - i));
        ASSERT_EQ(SelAddTimer(&timers[i]), 0);
        EXPECT_EQ(ctx->timerCapacity, expected[i]) << "after timer " << i + 1;
    }
    EXPECT_EQ(ctx->timerHeap[1], &timers[4]);
    EXPECT_EQ(SelRemoveAllTimers(), 5);
    EXPECT_EQ(SelRemoveAllTimers(), 0);
    EXPECT_EQ(ctx->timerCapacity, 8); // never shrinks
    for (SelTimer &t : timers) EXPECT_EQ(t.heapIndex, 0u);
}

TEST_F(TimerHeapTest, DebugIsActiveFindsEverySlot) {
    SelTimer timers[7];
    SelTimer unarmed = make_timer(at(1));
    EXPECT_EQ(SelDebugIsTimerActive(&unarmed), 0);
    for (int i = 0; i < 7; ++i) {
        timers[i] = make_timer(at(i));
        ASSERT_EQ(SelAddTimer(&timers[i]), 0);
    }
    for (SelTimer &t : timers) EXPECT_EQ(SelDebugIsTimerActive(&t), 1);
    EXPECT_EQ(SelDebugIsTimerActive(&unarmed), 0);
}

// Random arm, re-arm and cancel sequences, checked against a sorted reference.
TEST_F(TimerHeapTest, RandomOperationsKeepDeadlineOrder) {
    std::mt19937 rng(12345);
    constexpr int kTimers = 300;
    std::vector<SelTimer> timers(kTimers);
    std::multimap<std::pair<long, long>, SelTimer *> reference;
    auto key = [](const SelTimer &t) {
        return std::make_pair(static_cast<long>(t.when.tv_sec), t.when.tv_nsec);
    };
    auto erase_ref = [&](SelTimer *t) {
        auto range = reference.equal_range(key(*t));
        for (auto it = range.first; it != range.second; ++it)
            if (it->second == t) {
                reference.erase(it);
                return;
            }
        FAIL() << "timer missing from reference";
    };
    for (SelTimer &t : timers) t = make_timer(at(0));
    ModelHeap model;
    // Few distinct deadlines, so equal deadlines are common; among them the
    // extremes of both fields, which are compared as signed values.
    constexpr time_t kSecs[] = {std::numeric_limits<time_t>::min(), -1, std::numeric_limits<time_t>::max()};
    constexpr long kNsecs[] = {0, 100, 200, -1, 999999999L, std::numeric_limits<long>::min()};

    for (int step = 0; step < 20000; ++step) {
        SelTimer *t = &timers[rng() % kTimers];
        struct timespec when = at(static_cast<long>(rng() % 50), kNsecs[rng() % 3]);
        if (rng() % 8 == 0) {
            when.tv_sec = kSecs[rng() % 3];
            when.tv_nsec = kNsecs[rng() % 6];
        }
        switch (rng() % 3) {
        case 0:
            if (t->heapIndex == 0) {
                t->when = when;
                ASSERT_EQ(SelAddTimer(t), 0);
                reference.emplace(key(*t), t);
                model.add(t);
            }
            break;
        case 1: {
            const bool later = ModelHeap::before(t->when, when);
            if (t->heapIndex != 0) erase_ref(t);
            ASSERT_EQ(SelModifyTimer(t, &when), 0);
            model.rearmed(t, later);
            reference.emplace(key(*t), t);
            break;
        }
        default:
            if (t->heapIndex != 0) erase_ref(t);
            model.remove(t);
            SelRemTimer(t);
            ASSERT_EQ(t->heapIndex, 0u);
            break;
        }
        ASSERT_EQ(ctx->timerCount, static_cast<int32_t>(reference.size()));
        ASSERT_TRUE(std::equal(model.slot.begin() + 1, model.slot.end(), ctx->timerHeap + 1))
            << "step " << step;
        if (step % 97 == 0) expect_heap_consistent(ctx);
    }
    expect_heap_consistent(ctx);
    // Draining from the top yields the reference order (ties in any order).
    while (ctx->timerHeap[1] != nullptr) {
        SelTimer *top = ctx->timerHeap[1];
        ASSERT_EQ(key(*top), reference.begin()->first);
        erase_ref(top);
        SelRemTimer(top);
    }
    EXPECT_TRUE(reference.empty());
}

namespace {

int fire_count = 0;
std::vector<int> fire_order;
int record_fire(SelTimer *t) {
    ++fire_count;
    fire_order.push_back(static_cast<int>(reinterpret_cast<intptr_t>(t->arg)));
    return 0;
}

} // namespace

TEST_F(TimerHeapTest, ExpiryRunFiresDueTimersInOrderUpToTheLimit) {
    fire_count = 0;
    fire_order.clear();
    constexpr int kDue = 150;
    std::vector<SelTimer> timers(kDue + 1);
    for (int i = 0; i < kDue; ++i) {
        timers[i] = make_timer(now_plus(-1000 + i), record_fire);
        timers[i].arg = reinterpret_cast<void *>(static_cast<intptr_t>(i));
        ASSERT_EQ(SelAddTimer(&timers[i]), 0);
    }
    timers[kDue] = make_timer(now_plus(3600), record_fire);
    ASSERT_EQ(SelAddTimer(&timers[kDue]), 0);

    EXPECT_EQ(SelRunTimers(ctx), 101);
    EXPECT_EQ(ctx->timerHeap[0], &timers[100]);
    EXPECT_EQ(SelRunTimers(ctx), 49);
    EXPECT_EQ(SelRunTimers(ctx), 0);
    ASSERT_EQ(fire_order.size(), static_cast<size_t>(kDue));
    EXPECT_TRUE(std::is_sorted(fire_order.begin(), fire_order.end()));
    EXPECT_EQ(ctx->timerCount, 1);
}

TEST_F(TimerHeapTest, EqualAndPresentDeadlinesFireInTheSameRun) {
    fire_count = 0;
    struct timespec now;
    SelGetTime(&now);
    SelTimer a = make_timer(now, record_fire), b = make_timer(now, record_fire);
    ASSERT_EQ(SelAddTimer(&a), 0);
    ASSERT_EQ(SelAddTimer(&b), 0);
    EXPECT_EQ(SelRunTimers(ctx), 2);
    EXPECT_EQ(fire_count, 2);
    EXPECT_EQ(a.heapIndex, 0u);
    EXPECT_EQ(b.heapIndex, 0u);
}

namespace {

int rearm_fires = 0;
int rearm_now(SelTimer *t) {
    ++rearm_fires;
    EXPECT_EQ(t->heapIndex, 0u); // disarmed while its callback runs
    return SelSleep(t, 0);
}

SelTimer *victim = nullptr;
int disarm_victim(SelTimer *) {
    SelRemTimer(victim);
    return 0;
}

int free_self(SelTimer *t) {
    free(t);
    ++fire_count;
    return 0;
}

std::vector<SelTimer> *grown = nullptr;
int arm_many(SelTimer *) {
    for (SelTimer &t : *grown) EXPECT_EQ(SelAddTimer(&t), 0);
    return 0;
}

} // namespace

TEST_F(TimerHeapTest, CallbackThatRearmsForNowFiresUntilTheLimit) {
    rearm_fires = 0;
    SelTimer t = make_timer(now_plus(-1), rearm_now);
    ASSERT_EQ(SelAddTimer(&t), 0);
    EXPECT_EQ(SelRunTimers(ctx), 101);
    EXPECT_EQ(rearm_fires, 101);
    EXPECT_NE(t.heapIndex, 0u);
    SelRemTimer(&t);
}

TEST_F(TimerHeapTest, CallbacksMayDisarmFreeOrGrow) {
    fire_count = 0;
    SelTimer later = make_timer(now_plus(-1, 500), record_fire);
    victim = &later;
    SelTimer first = make_timer(now_plus(-2), disarm_victim);
    auto *owned = static_cast<SelTimer *>(malloc(sizeof(SelTimer)));
    *owned = make_timer(now_plus(-1), free_self);
    std::vector<SelTimer> many(40, make_timer(now_plus(3600)));
    grown = &many;
    SelTimer grower = make_timer(now_plus(-1, 100), arm_many);

    for (SelTimer *t : {&later, &first, owned, &grower}) ASSERT_EQ(SelAddTimer(t), 0);
    // first disarms later before it is due; owned frees itself; grower grows the heap.
    EXPECT_EQ(SelRunTimers(ctx), 3);
    EXPECT_EQ(fire_count, 1);
    EXPECT_EQ(later.heapIndex, 0u);
    EXPECT_EQ(ctx->timerCount, 40);
    expect_heap_consistent(ctx);
}

TEST_F(TimerHeapTest, MisuseReturnsMinus117WithSigquitBlocked) {
    block_sigquit();
    SelTimer t = make_timer(now_plus(10));
    ASSERT_EQ(SelAddTimer(&t), 0);
    SelTimer copy = t;
    EXPECT_EQ(SelAddTimer(&t), -117);
    EXPECT_EQ(ctx->timerCount, 1);

    SelTimer no_callback{};
    EXPECT_EQ(SelAddTimer(&no_callback), -117);
    struct timespec when = at(42, 7);
    EXPECT_EQ(SelModifyTimer(&no_callback, &when), -117);
    EXPECT_EQ(no_callback.when.tv_sec, 42); // the deadline is stored first
    EXPECT_EQ(no_callback.heapIndex, 0u);
    EXPECT_EQ(ctx->timerCount, 1);
    (void)copy;
    sigset_t pending;
    sigpending(&pending);
    EXPECT_EQ(sigismember(&pending, SIGQUIT), 1);
}

TEST_F(TimerHeapTest, ModifyArmsAnUnarmedTimer) {
    SelTimer t = make_timer(at(0));
    struct timespec when = at(5);
    EXPECT_EQ(SelModifyTimer(&t, &when), 0);
    EXPECT_EQ(SelDebugIsTimerActive(&t), 1);
    EXPECT_EQ(t.when.tv_sec, 5);
    SelRemTimer(&t);
    SelRemTimer(&t); // unarmed: nothing happens
    EXPECT_EQ(ctx->timerCount, 0);
}

using TimerDeathTest = TimerHeapTest;

TEST_F(TimerDeathTest, MisuseUnderDefaultDispositionEndsTheProcess) {
    EXPECT_EXIT(
        {
            signal(SIGQUIT, SIG_DFL);
            SelTimer t = make_timer(now_plus(10));
            SelAddTimer(&t);
            SelAddTimer(&t);
            _exit(0);
        },
        testing::KilledBySignal(SIGQUIT), "");
}

TEST_F(TimerDeathTest, BrokenRecordsAbort) {
    SelTimer t = make_timer(now_plus(10));
    ASSERT_EQ(SelAddTimer(&t), 0);
    SelTimer copy = t; // claims a slot that holds another record
    EXPECT_DEATH(SelRemTimer(&copy), "");
    struct timespec when = now_plus(20);
    EXPECT_DEATH(SelModifyTimer(&copy, &when), "");
    t.callback = nullptr;
    EXPECT_DEATH(SelModifyTimer(&t, &when), "");
    t.callback = noop_timer_callback;
    SelRemTimer(&t);
}
