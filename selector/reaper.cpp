// The idle-descriptor reaper: a timer that closes descriptors registered
// with idle tracking once nothing has happened on them for a while.
#include <atomic>
#include <cstdlib>
#include <sys/time.h>
#include <unistd.h>

#include "selector/sel_private.h"

using namespace qorbu::sel;

extern "C" {
QORBU_API SelTimer fd_timer;
}

namespace qorbu::sel {
// fd_timer is one record, and a timer lives in one heap at a time: the first
// context to start gets it, and it passes on when that context's thread ends.
std::atomic<SelContext *> reaper_owner{nullptr};
} // namespace qorbu::sel

namespace {

bool is_idle(const SelFdEntry &entry, const struct timeval &now) {
    // A signed 32-bit difference of whole seconds: a clock set back closes nothing.
    int32_t idle = static_cast<int32_t>(static_cast<uint32_t>(now.tv_sec) -
                                        static_cast<uint32_t>(entry.lastActivity.tv_sec));
    return idle > kIdleLimitSec;
}

void schedule_reaper() { SelMakeWhen(&fd_timer.when, kReaperPeriodSec, 0); }

} // namespace

namespace qorbu::sel {

void arm_reaper_if_free(SelContext *ctx) {
    SelContext *expected = nullptr;
    if (!reaper_owner.compare_exchange_strong(expected, ctx)) return;
    fd_timer.heapIndex = 0;
    fd_timer.callback = SelReapIdleFDs;
    schedule_reaper();
    SelAddTimer(&fd_timer);
}

void release_reaper(SelContext *ctx) {
    if (reaper_owner.load() != ctx) return;
    // The heap dies with the context; the record must not claim a slot in it.
    fd_timer.heapIndex = 0;
    reaper_owner.store(nullptr);
}

} // namespace qorbu::sel

extern "C" int SelReapIdleFDs(SelTimer *) {
    SelContext *ctx = SelCurrentContext();
    struct timeval now;
    gettimeofday(&now, nullptr);

    int closed = 0;
    for (int fd = 0; fd < ctx->nfds; ++fd) {
        if (!FD_ISSET(fd, &ctx->readSet)) continue;
        const SelFdEntry &entry = ctx->fdTable[fd];
        if (entry.idleTracked == 0 || !is_idle(entry, now)) continue;
        ++closed;
        SelRemFD(fd);
        close(fd);
    }
    if (closed > kReaperExitThreshold) exit(0);

    schedule_reaper();
    return SelAddTimer(&fd_timer);
}
