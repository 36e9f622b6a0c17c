/* The timer heap: random operations against the reference heap, and misuse. */
#include <random>

#include "heap_interpreter.h"
#include "selector_fixture.h"

using namespace qorbu::test;

TEST_F(SelectorTest, TimerHeapMatchesTheReferenceHeapAfterEveryOperation) {
    for (unsigned seed = 1; seed <= 4; ++seed) {
        std::mt19937 random(seed);
        std::vector<uint8_t> bytes(3 * scaled(20000, 3000));
        for (uint8_t &b : bytes) b = static_cast<uint8_t>(random());
        in_child(
            [&] { EXPECT_EQ(HeapInterpreter().run(bytes.data(), bytes.size()), "") << "seed " << seed; });
    }
}

TEST_F(SelectorTest, ArmingAnArmedOrCallbacklessTimerIsRefused) {
    ASSERT_EQ(SelAddSignal(SIGQUIT), 0); /* the refusal raises it */
    SelTimer t{};
    EXPECT_EQ(SelAddTimer(&t), -117);
    t.callback = log_timer;
    ASSERT_EQ(SelSleep(&t, 1000), 0);
    const timespec when = t.when;
    EXPECT_EQ(SelAddTimer(&t), -117);
    EXPECT_EQ(ctx->timerCount, 2);
    EXPECT_EQ(ctx->timerHeap[t.heapIndex], &t);
    EXPECT_TRUE(when.tv_sec == t.when.tv_sec && when.tv_nsec == t.when.tv_nsec);
}
