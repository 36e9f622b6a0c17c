// Per-thread selector contexts: creation, the thread-local key, the host
// context hand-over and the signals that may interrupt a wait.
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <cstring>

#include "selector/sel_private.h"

extern "C" {
QORBU_API pthread_key_t sel_tl_key = static_cast<pthread_key_t>(-1);
QORBU_API pthread_once_t sel_tl_once = PTHREAD_ONCE_INIT;
}

namespace {

constexpr pthread_key_t kNoKey = static_cast<pthread_key_t>(-1);
constexpr int32_t kInitialTimerCapacity = 1;

SelContext *allocate_context() {
    auto *ctx = static_cast<SelContext *>(malloc(sizeof(SelContext)));
    if (ctx == nullptr) return nullptr;
    memset(ctx, 0, sizeof *ctx);
    sigemptyset(&ctx->signals);
    FD_ZERO(&ctx->readSet);
    FD_ZERO(&ctx->writeSet);
    FD_ZERO(&ctx->exceptSet);

    // Slot 0 plus one usable slot, both empty.
    ctx->timerCapacity = kInitialTimerCapacity;
    ctx->timerHeap = static_cast<SelTimer **>(calloc(kInitialTimerCapacity + 1, sizeof(SelTimer *)));
    if (ctx->timerHeap == nullptr) {
        free(ctx);
        errno = ENOMEM;
        return nullptr;
    }
    return ctx;
}

} // namespace

extern "C" {

void SelCreateKey(void) {
    if (pthread_key_create(&sel_tl_key, SelFreeContext) != 0) sel_tl_key = kNoKey;
}

void SelFreeContext(void *context) {
    auto *ctx = static_cast<SelContext *>(context);
    qorbu::sel::release_reaper(ctx);
    free(ctx->fdTable);
    free(ctx->timerHeap);
    free(ctx);
}

int SelInit(void) {
    pthread_once(&sel_tl_once, SelCreateKey);
    if (sel_tl_key == kNoKey) return -1;
    if (SelCurrentContext() != nullptr) return 0;

    SelContext *ctx = allocate_context();
    if (ctx == nullptr) return -1;
    if (pthread_setspecific(sel_tl_key, ctx) != 0) {
        free(ctx->timerHeap);
        free(ctx);
        errno = ENOMEM;
        return -1;
    }
    qorbu::sel::arm_reaper_if_free(ctx);
    return 0;
}

void SelSetZG(void *hostContext) { SelCurrentContext()->zg = hostContext; }

int SelAddSignal(int signo) {
    SelContext *ctx = SelCurrentContext();
    // sigismember answers -1 for an invalid number and 1 for a registered one.
    if (sigismember(&ctx->signals, signo) != 0 || sigaddset(&ctx->signals, signo) != 0) {
        errno = EINVAL;
        return -1;
    }
    return sigprocmask(SIG_BLOCK, &ctx->signals, nullptr);
}

int SelRemSignal(int signo) {
    sigset_t only;
    sigemptyset(&only);
    if (sigaddset(&only, signo) != 0) {
        errno = EINVAL;
        return -1;
    }
    if (sigprocmask(SIG_UNBLOCK, &only, nullptr) != 0) return -1;

    SelContext *ctx = SelCurrentContext();
    if (sigismember(&ctx->signals, signo) != 1 || sigdelset(&ctx->signals, signo) != 0) {
        errno = EINVAL;
        return -1;
    }
    return 0;
}

} // extern "C"
