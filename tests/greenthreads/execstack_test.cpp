// This binary is linked with an executable stack: green-thread stacks must
// then be executable too, as the loader makes every other stack.
#include "gt_test_support.h"

using namespace qorbu::gt;
using namespace qorbu::test;

namespace {

char *stackBase;

TEST(ExecutableStackProcess, GreenThreadStacksAreExecutableToo) {
    greenthreads_init();
    EXPECT_TRUE(process_wants_executable_stack());
    greenthread_create(
        [](void *) { stackBase = static_cast<char *>(current_greenthread()->context.uc_stack.ss_sp); },
        nullptr);
    greenthreads_run();
    ASSERT_NE(stackBase, nullptr);
    EXPECT_TRUE(is_inaccessible(mapping_at(stackBase)));
    EXPECT_EQ(mapping_at(stackBase + page_size).perms, "rwxp");
}

} // namespace
