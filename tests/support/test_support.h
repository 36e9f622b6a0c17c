/* Helpers shared by the test binaries. */
#ifndef QORBU_TESTS_SUPPORT_TEST_SUPPORT_H
#define QORBU_TESTS_SUPPORT_TEST_SUPPORT_H

namespace qorbu::test {

/* True when the tests run under qemu-user (the i386 and armhf builds): qemu
 * lacks robust mutexes, ignores MAP_FIXED_NOREPLACE and runs much slower, so
 * tests scale their counts down (never their checks) or skip with a message. */
constexpr bool kEmulated =
#ifdef QORBU_TESTS_EMULATED
    true;
#else
    false;
#endif

/* Scale a workload count for the build the tests run in. */
constexpr int scaled(int native, int emulated) { return kEmulated ? emulated : native; }

} // namespace qorbu::test

#endif
