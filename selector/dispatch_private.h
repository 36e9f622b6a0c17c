/* Internals shared by the two dispatch loops, the select() emulation and the
 * host hooks: the weak references to the host's functions, the EINVAL
 * counter and word-wise helpers for descriptor sets. */
#ifndef QORBU_SELECTOR_DISPATCH_PRIVATE_H
#define QORBU_SELECTOR_DISPATCH_PRIVATE_H

#include <atomic>
#include <cstdint>

#include "selector/host.h"
#include "selector/sel_private.h"

/* The host process provides these (itself, or through the Net-SNMP library
 * it links). A process without them still loads the library: the weak
 * references then resolve to null and the loop skips that source. */
extern "C" {
int thread_fetch_queued(void *hostContext, void *task) __attribute__((weak));
int thread_call(void *task) __attribute__((weak));
int thread_select_nb(void *hostContext) __attribute__((weak));
int timeval_cmp(struct timeval a, struct timeval b) __attribute__((weak));
struct timeval timeval_sub(struct timeval a, struct timeval b) __attribute__((weak));
int pal_time_tzcurrent(struct timeval *now, void *unused) __attribute__((weak));
int snmp_select_info(int *numfds, fd_set *fdset, struct timeval *timeout, int *block) __attribute__((weak));
void snmp_read(fd_set *fdset) __attribute__((weak));
void snmp_timeout(void) __attribute__((weak));
void run_alarms(void) __attribute__((weak));
}

namespace qorbu::sel {

inline constexpr int kHostTimedLists = 4;
inline constexpr int kEinvalFailuresTolerated = 4; /* the fifth one aborts */
inline constexpr int kEpollBatch = 100;            /* events taken by the non-blocking wait */
inline constexpr int kEpollBlockingBatch = 1;      /* events taken by the blocking wait */
inline constexpr int kPrintedWordBits = 32;        /* the EINVAL diagnostic prints 32-bit words */

/* Waits that failed with EINVAL since the last read/write scan that ended
 * with ready pairs left over; shared by every selector thread. */
extern std::atomic<int> sel_einval_count;

/* All six host scheduler functions are present in the process. */
inline bool host_functions_present() {
    return thread_fetch_queued && thread_call && thread_select_nb && timeval_cmp && timeval_sub &&
           pal_time_tzcurrent;
}

/* snmp_select_info is present (the other three are checked one by one). */
inline bool snmp_present() { return snmp_select_info != nullptr; }

/* The blocking epoll wait's time-out: milliseconds from now until the
 * earliest timer, truncated; 0 when no timer is armed. */
int epoll_timeout_ms(const SelContext *ctx, const struct timespec &now);

/* --- descriptor sets, a machine word at a time ---------------------------- */

inline constexpr int kFdWordBits = NFDBITS;
inline constexpr int kFdWords = kSelectSetSize / kFdWordBits;
using FdWord = unsigned long;
static_assert(sizeof(FdWord) == sizeof(__fd_mask));

inline FdWord fd_word(const fd_set *set, int i) { return static_cast<FdWord>(set->fds_bits[i]); }
inline void or_fd_word(fd_set *set, int i, FdWord bits) {
    set->fds_bits[i] = static_cast<__fd_mask>(fd_word(set, i) | bits);
}

/* Bits of word i that stand for descriptors below limit. */
inline FdWord fd_word_mask_below(int i, int limit) {
    const int first = i * kFdWordBits;
    if (limit >= first + kFdWordBits) return ~FdWord{0};
    if (limit <= first) return 0;
    return (FdWord{1} << (limit - first)) - 1;
}

inline int highest_bit(FdWord bits) { return kFdWordBits - 1 - __builtin_clzl(bits); }
inline int lowest_bit(FdWord bits) { return __builtin_ctzl(bits); }

inline int clamp_to_set_size(int n) { return n < 0 ? 0 : (n > kSelectSetSize ? kSelectSetSize : n); }

} // namespace qorbu::sel

#endif
