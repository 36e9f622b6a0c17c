/* The segment lock: the handle's descriptor lock (once a second read-write
 * handle has attached), then the in-segment mutex, then the busy test. */
#include "shm/shm_private.h"

#include <cerrno>
#include <pthread.h>
#include <sys/file.h>

namespace qorbu::shm {

namespace {

/* Attributes destroyed on every path out of init_segment_mutex. */
class MutexAttributes {
  public:
    MutexAttributes() : error_(pthread_mutexattr_init(&attr_)) {}
    ~MutexAttributes() {
        if (error_ == 0) pthread_mutexattr_destroy(&attr_);
    }
    MutexAttributes(const MutexAttributes &) = delete;
    MutexAttributes &operator=(const MutexAttributes &) = delete;
    int error() const { return error_; }
    pthread_mutexattr_t *get() { return &attr_; }

  private:
    pthread_mutexattr_t attr_;
    int error_;
};

} // namespace

int init_segment_mutex(pthread_mutex_t *mutex) {
    MutexAttributes attr;
    if (attr.error() != 0) return attr.error();
    // A process-private futex never wakes a waiter in another process.
    int err = pthread_mutexattr_setpshared(attr.get(), PTHREAD_PROCESS_SHARED);
    if (err != 0) return err;
    // Robust, so that a holder that dies does not wedge every other process.
    if (pthread_mutexattr_setrobust(attr.get(), PTHREAD_MUTEX_ROBUST) == 0) {
        err = pthread_mutex_init(mutex, attr.get());
        if (err != ENOTSUP) return err;
        pthread_mutexattr_setrobust(attr.get(), PTHREAD_MUTEX_STALLED);
    }
    return pthread_mutex_init(mutex, attr.get());
}

SegmentLock::SegmentLock(ShmHandle *h) : handle_(h) {
    // Every locked operation writes the header: a read-only mapping cannot.
    if (!h->writable) {
        error_ = EBADF;
        return;
    }
    if (load_word(h->base->useFlock) == 1 && !lock_descriptor()) return;
    if (!lock_mutex()) {
        unlock_descriptor();
        return;
    }
    if (load_word(h->base->busy) == 1) {
        release();
        error_ = EBUSY;
    }
}

bool SegmentLock::lock_descriptor() {
    while (flock(handle_->fd, LOCK_EX) != 0) {
        if (errno != EINTR) {
            error_ = errno;
            return false;
        }
    }
    flock_taken_ = true;
    return true;
}

bool SegmentLock::lock_mutex() {
    int err = pthread_mutex_lock(&handle_->base->mutex);
    if (err == EOWNERDEAD) {
        // The holder died. Inside an allocation or free it left busy at 1,
        // which the caller's busy test then reports; elsewhere it lost nothing.
        err = pthread_mutex_consistent(&handle_->base->mutex);
        if (err != 0) pthread_mutex_unlock(&handle_->base->mutex);
    }
    if (err != 0) {
        error_ = err;
        return false;
    }
    mutex_taken_ = true;
    return true;
}

void SegmentLock::unlock_descriptor() {
    if (!flock_taken_) return;
    flock(handle_->fd, LOCK_UN);
    flock_taken_ = false;
}

void SegmentLock::mark_busy() {
    store_word(handle_->base->busy, 1);
    busy_set_ = true;
}

void SegmentLock::release() {
    if (busy_set_) {
        store_word(handle_->base->busy, 0);
        busy_set_ = false;
    }
    if (mutex_taken_) {
        pthread_mutex_unlock(&handle_->base->mutex);
        mutex_taken_ = false;
    }
    unlock_descriptor();
}

} // namespace qorbu::shm
