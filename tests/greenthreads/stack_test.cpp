// Guarded green-thread stacks: size, guard page, protection, and what
// happens when a stack overflows or cannot be mapped.
#include <gtest/gtest.h>

#include <signal.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <unistd.h>

#include "greenthreads/greenthread_private.h"
#include "gt_test_support.h"
#include "support/test_support.h"

using namespace qorbu::gt;
using qorbu::test::mapping_at;

namespace {

TEST(StackLength, IsSixteenKiBRoundedToPagesPlusAGuardPage)
{
    EXPECT_EQ(stack_mapping_length(4096), 20480u);
    EXPECT_EQ(stack_mapping_length(16384), 32768u);
    EXPECT_EQ(stack_mapping_length(65536), 131072u);
    EXPECT_EQ(stack_mapping_length(8192), 24576u);
}

class Stack : public ::testing::Test {
protected:
    void SetUp() override { greenthreads_init(); }
};

char *stackBase;
size_t stackLength;
void *stackLocal;

void note_stack(void *)
{
    stackLocal = __builtin_frame_address(0);
    stackBase = static_cast<char *>(current_greenthread()->context.uc_stack.ss_sp);
    stackLength = current_greenthread()->context.uc_stack.ss_size;
}

TEST_F(Stack, MappingIsGuardedWritableAndNotExecutable)
{
    greenthread_create(note_stack, nullptr);
    greenthreads_run();
    ASSERT_NE(stackBase, nullptr);
    EXPECT_EQ(stackLength, stack_mapping_length(sysconf(_SC_PAGESIZE)));
    if (sysconf(_SC_PAGESIZE) == 4096) {
        EXPECT_EQ(stackLength, 20480u);
    }
    EXPECT_GE(static_cast<char *>(stackLocal), stackBase + page_size);
    EXPECT_LT(static_cast<char *>(stackLocal), stackBase + stackLength);

    EXPECT_FALSE(process_wants_executable_stack());
    EXPECT_TRUE(qorbu::test::is_inaccessible(mapping_at(stackBase), qorbu::test::kEmulated));
    const auto usable = mapping_at(stackBase + page_size);
    EXPECT_EQ(usable.perms, "rw-p");
    EXPECT_TRUE(usable.startsHere) << "the guard page ends where the usable stack begins";
    EXPECT_EQ(mapping_at(stackBase + stackLength - 1).perms, "rw-p");
}

void touch_guard_page(void *)
{
    volatile char *guard = static_cast<char *>(current_greenthread()->context.uc_stack.ss_sp);
    guard[page_size - 1] = 1;
}

TEST_F(Stack, TouchingTheGuardPageFaults)
{
    EXPECT_SEGV_DEATH({
        greenthread_create(touch_guard_page, nullptr);
        greenthreads_run();
    });
}

__attribute__((noinline)) int recurse(int depth)
{
    volatile char frame[128];
    frame[0] = static_cast<char>(depth);
    if (depth > 100000000)
        return frame[0];
    return recurse(depth + 1) + frame[0];
}

TEST_F(Stack, OverflowHitsTheGuardPageAndEndsWithSigsegv)
{
    EXPECT_SEGV_DEATH({
        greenthread_create([](void *) { recurse(0); }, nullptr);
        greenthreads_run();
    });
}

#if defined(__SANITIZE_ADDRESS__)
__attribute__((noinline)) void overflow_a_local(void *)
{
    char buffer[16];
    volatile char *const bytes = buffer; // no bounds known: AddressSanitizer's catch
    volatile int index = 16;
    bytes[index] = 1;
}
#endif

TEST_F(Stack, AddressSanitizerReportsFaultsOnGreenThreadStacks)
{
#if defined(__SANITIZE_ADDRESS__)
    EXPECT_DEATH(
        {
            greenthread_create(overflow_a_local, nullptr);
            greenthreads_run();
        },
        // Locating the frame needs the switch announcements: otherwise the
        // address lies outside every stack the sanitizer knows.
        "stack-buffer-overflow.*is located in stack of thread");
#else
    GTEST_SKIP() << "built without AddressSanitizer";
#endif
}

// Cuts the address space just above what is mapped now, so that the next
// stack mapping fails.
void limit_address_space()
{
    void *warm = malloc(64 * 1024); // the record's allocation still succeeds
    free(warm);
    FILE *statm = fopen("/proc/self/statm", "r");
    unsigned long pages = 0;
    if (statm == nullptr || fscanf(statm, "%lu", &pages) != 1)
        _exit(3);
    fclose(statm);
    struct rlimit limit;
    limit.rlim_cur = limit.rlim_max = pages * static_cast<unsigned long>(sysconf(_SC_PAGESIZE)) + 4096;
    if (setrlimit(RLIMIT_AS, &limit) != 0)
        _exit(4);
}

bool address_space_limit_works()
{
    return !qorbu::test::kEmulated && !qorbu::test::kSanitized;
}

TEST_F(Stack, UnmappableStackSendsSigsegv)
{
    if (!address_space_limit_works())
        GTEST_SKIP() << "qemu-user and sanitizer runtimes do not honour RLIMIT_AS";
    EXPECT_EXIT(
        {
            limit_address_space();
            greenthread_create(note_stack, nullptr);
            _exit(0);
        },
        ::testing::KilledBySignal(SIGSEGV), "");
}

TEST_F(Stack, UnmappableStackGivesNullWhenSigsegvIsIgnored)
{
    if (!address_space_limit_works())
        GTEST_SKIP() << "qemu-user and sanitizer runtimes do not honour RLIMIT_AS";
    EXPECT_EXIT(
        {
            signal(SIGSEGV, SIG_IGN);
            limit_address_space();
            Greenthread *thread = greenthread_create(note_stack, nullptr);
            const bool clean = thread == nullptr && live_threads == 0 && run_queue_head == nullptr;
            _exit(clean ? 0 : 1);
        },
        ::testing::ExitedWithCode(0), "");
}

} // namespace
