// Linked with an executable stack: green-thread stacks are executable too,
// as the loader makes every other stack of such a program.
#include "gt_test_support.h"

using namespace qorbu::test;

TEST_F(GreenThreads, StacksAreExecutableWhenTheProgramAsksForIt) {
    const Greenthread *thread = greenthread_create([](void *) {}, nullptr);
    const auto base = reinterpret_cast<uintptr_t>(thread->context.uc_stack.ss_sp);
    EXPECT_TRUE(mapping_at(base).inaccessible());
    EXPECT_EQ(mapping_at(base + static_cast<uintptr_t>(page_size)).perms, "rwxp");
    EXPECT_TRUE(run_for(10));
}
