// Guarded green-thread stacks: size, guard page, protection, and what
// happens when a stack overflows or cannot be mapped.
#include <csignal>
#include <cstdlib>

#include "gt_test_support.h"

using namespace qorbu::gt;
using namespace qorbu::test;

namespace {

using Stack = GreenIo;

/* Builds with a sanitizer report a fault through the sanitizer's own
 * handler, which ends the process with an exit status, not the signal. */
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kSanitized = true;
#define EXPECT_SEGV_DEATH(statement) EXPECT_DEATH(statement, "SEGV|stack-overflow")
#else
constexpr bool kSanitized = false;
#define EXPECT_SEGV_DEATH(statement) EXPECT_EXIT(statement, ::testing::KilledBySignal(SIGSEGV), "")
#endif

char *stackBase;
size_t stackLength;
void *stackLocal;

void note_stack(void *) {
    stackLocal = __builtin_frame_address(0);
    stackBase = static_cast<char *>(current_greenthread()->context.uc_stack.ss_sp);
    stackLength = current_greenthread()->context.uc_stack.ss_size;
}

TEST_F(Stack, SixteenKiBRoundedToPagesAboveAGuardPageWritableAndNotExecutable) {
    EXPECT_EQ(stack_mapping_length(4096), 20480u);
    EXPECT_EQ(stack_mapping_length(8192), 24576u);
    EXPECT_EQ(stack_mapping_length(16384), 32768u);
    EXPECT_EQ(stack_mapping_length(65536), 131072u);

    greenthread_create(note_stack, nullptr);
    greenthreads_run();
    ASSERT_NE(stackBase, nullptr);
    EXPECT_EQ(stackLength, stack_mapping_length(sysconf(_SC_PAGESIZE)));
    EXPECT_GE(static_cast<char *>(stackLocal), stackBase + page_size);
    EXPECT_LT(static_cast<char *>(stackLocal), stackBase + stackLength);

    EXPECT_FALSE(process_wants_executable_stack());
    EXPECT_TRUE(is_inaccessible(mapping_at(stackBase)));
    const auto usable = mapping_at(stackBase + page_size);
    EXPECT_EQ(usable.perms, "rw-p");
    EXPECT_TRUE(usable.startsHere) << "the guard page ends where the usable stack begins";
    EXPECT_EQ(mapping_at(stackBase + stackLength - 1).perms, "rw-p");
}

__attribute__((noinline)) int recurse(int depth) {
    volatile char frame[128];
    frame[0] = static_cast<char>(depth);
    if (depth > 100000000) return frame[0];
    return recurse(depth + 1) + frame[0];
}

TEST_F(Stack, TouchingTheGuardPageOrOverflowingEndsWithSigsegv) {
    EXPECT_SEGV_DEATH({
        greenthread_create(
            [](void *) {
                static_cast<volatile char *>(current_greenthread()->context.uc_stack.ss_sp)[page_size - 1] =
                    1;
            },
            nullptr);
        greenthreads_run();
    });
    EXPECT_SEGV_DEATH({
        greenthread_create([](void *) { recurse(0); }, nullptr);
        greenthreads_run();
    });
}

/* A frame larger than a page, entered with less than a page of stack left:
 * built with stack clash protection, its first probe faults on the
 * thread's own guard page instead of landing in the neighbouring stack. */
constexpr size_t kLargeFrame = 3 * 4096;
char *guardLow;

__attribute__((noinline)) int large_frame() {
    volatile char frame[kLargeFrame];
    frame[0] = 1; // the lowest byte: three pages below the caller
    frame[kLargeFrame - 1] = 1;
    return frame[0] + frame[kLargeFrame - 1];
}

__attribute__((noinline)) void descend_then_call_large_frame() {
    volatile char pad[64];
    pad[0] = 0;
    if (static_cast<char *>(__builtin_frame_address(0)) - (guardLow + page_size) > 1024)
        descend_then_call_large_frame();
    else
        pad[0] = static_cast<char>(large_frame());
    pad[0] = pad[0] + 1; // keeps the call from becoming a jump
}

void on_segv(int, siginfo_t *info, void *) {
    const char *fault = static_cast<const char *>(info->si_addr);
    if (fault < guardLow || fault >= guardLow + page_size)
        _exit(3);             // not the overflowing thread's guard page
    signal(SIGSEGV, SIG_DFL); // the access faults again and ends the process
}

TEST_F(Stack, LargeFrameOverflowFaultsOnTheThreadsOwnGuardPage) {
    if (page_size > 4096) GTEST_SKIP() << "the frame is sized for 4 KiB pages";
    EXPECT_EXIT(
        {
            static char altStack[64 * 1024];
            stack_t alt{};
            alt.ss_sp = altStack;
            alt.ss_size = sizeof altStack;
            sigaltstack(&alt, nullptr);
            struct sigaction sa {};
            sa.sa_sigaction = on_segv;
            sa.sa_flags = SA_SIGINFO | SA_ONSTACK;
            sigaction(SIGSEGV, &sa, nullptr);
            Greenthread *overflowing =
                greenthread_create([](void *) { descend_then_call_large_frame(); }, nullptr);
            greenthread_create([](void *) {}, nullptr); // the neighbouring stack
            guardLow = static_cast<char *>(overflowing->context.uc_stack.ss_sp);
            greenthreads_run();
            _exit(0);
        },
        ::testing::KilledBySignal(SIGSEGV), "");
}

#if defined(__SANITIZE_ADDRESS__)
__attribute__((noinline)) void overflow_a_local(void *) {
    char buffer[16];
    volatile char *const bytes = buffer; // no bounds known: AddressSanitizer's catch
    volatile int index = 16;
    bytes[index] = 1;
}
#endif

TEST_F(Stack, AddressSanitizerReportsFaultsOnGreenThreadStacks) {
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
void limit_address_space() {
    void *warm = malloc(64 * 1024); // the record's allocation still succeeds
    free(warm);
    FILE *statm = fopen("/proc/self/statm", "r");
    unsigned long pages = 0;
    if (statm == nullptr || fscanf(statm, "%lu", &pages) != 1) _exit(3);
    fclose(statm);
    struct rlimit limit;
    limit.rlim_cur = limit.rlim_max = pages * static_cast<unsigned long>(sysconf(_SC_PAGESIZE)) + 4096;
    if (setrlimit(RLIMIT_AS, &limit) != 0) _exit(4);
}

TEST_F(Stack, UnmappableStackSendsSigsegvOrGivesNullWhenSigsegvIsIgnored) {
    if (kEmulated || kSanitized) GTEST_SKIP() << "qemu-user and sanitizer runtimes do not honour RLIMIT_AS";
    EXPECT_EXIT(
        {
            limit_address_space();
            greenthread_create(note_stack, nullptr);
            _exit(0);
        },
        ::testing::KilledBySignal(SIGSEGV), "");
    EXPECT_EXIT(
        {
            signal(SIGSEGV, SIG_IGN);
            limit_address_space();
            Greenthread *thread = greenthread_create(note_stack, nullptr);
            _exit(thread == nullptr && live_threads == 0 && run_queue_head == nullptr ? 0 : 1);
        },
        ::testing::ExitedWithCode(0), "");
}

} // namespace
