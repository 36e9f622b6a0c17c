// Linked with an executable stack: green-thread stacks are executable too,
// as the loader makes every other stack of such a program.
#include "greenthreads/greenthread_private.h"
#include "support/test_support.h"

TEST(GreenThreadsInAnExecutableStackProgram, StacksAreExecutable) {
    greenthreads_init();
    const Greenthread *thread = greenthread_create([](void *) {}, nullptr);
    const auto base = reinterpret_cast<uintptr_t>(thread->context.uc_stack.ss_sp);
    EXPECT_EQ(qorbu::test::perms_at(base + static_cast<uintptr_t>(qorbu::gt::page_size)), "rwxp");
}
