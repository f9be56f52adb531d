// Reader-writer lock (see oxsec_lock.h for the rules).  Every operation
// takes the lock's mutex first and releases it before it returns; the
// operations that wait do so inside a waiting scope whose destructor is the
// clean-up, so the same code releases the mutex on a normal exit and when
// the thread is cancelled in pthread_cond_wait (glibc cancels a C++ thread
// by a forced unwind, and the condition wait re-acquires the mutex first).
// Results of the POSIX calls are not examined.
#include "oxsec_lock.h"

#include <cstring>

#include "oxidm_holds.h"

namespace {

// A waiting reader, and a waiting writer already counted in
// waiting_writers: ending the scope runs the matching clean-up.
using WaitingReader = idm::Hold<sec_rwlock, sec__waiting_reader_cleanup>;
using WaitingWriter = idm::Hold<sec_rwlock, sec__waiting_writer_cleanup>;

// Mutex held.  Readers go when no writer holds the lock and none waits.
void wait_as_reader(sec_rwlock *lock) {
    WaitingReader scope(lock);
    while (lock->lock_count < 0 || lock->waiting_writers != 0) pthread_cond_wait(&lock->readers_ok, &lock->mutex);
    lock->lock_count++;
}

// Mutex held.  Counts the caller as a waiting writer and waits for a free lock.
void wait_as_writer(sec_rwlock *lock) {
    lock->waiting_writers++;
    WaitingWriter scope(lock);
    while (lock->lock_count != 0) pthread_cond_wait(&lock->writer_ok, &lock->mutex);
    lock->lock_count = -1;
}

// Mutex held: the write hold has just ended.  One waiting writer goes next;
// without one, every waiting reader goes.
void wake_after_writer(sec_rwlock *lock) {
    if (lock->waiting_writers != 0) pthread_cond_signal(&lock->writer_ok);
    else pthread_cond_broadcast(&lock->readers_ok);
}

}  // namespace

extern "C" {

void sec__lock_init(sec_rwlock *lock) {
    pthread_mutex_init(&lock->mutex, nullptr);
    pthread_cond_init(&lock->writer_ok, nullptr);
    pthread_cond_init(&lock->readers_ok, nullptr);
    lock->lock_count = 0;
    lock->waiting_writers = 0;
}

int sec__lock_destroy(sec_rwlock *lock) {
    pthread_mutex_destroy(&lock->mutex);
    pthread_cond_destroy(&lock->readers_ok);
    pthread_cond_destroy(&lock->writer_ok);
    std::memset(static_cast<void *>(lock), 0, sizeof *lock);
    return 0;
}

int sec__simple_init(pthread_mutex_t *mutex) { return idm::mutex_init(mutex); }

void sec__lock_read(sec_rwlock *lock) OXIDM_NO_THREAD_SAFETY_ANALYSIS {
    pthread_mutex_lock(&lock->mutex);
    wait_as_reader(lock);
}

void sec__unlock_read(sec_rwlock *lock) OXIDM_NO_THREAD_SAFETY_ANALYSIS {
    idm::MutexHold hold(&lock->mutex);
    if (--lock->lock_count == 0) pthread_cond_signal(&lock->writer_ok);
}

void sec__lock_write(sec_rwlock *lock) OXIDM_NO_THREAD_SAFETY_ANALYSIS {
    pthread_mutex_lock(&lock->mutex);
    wait_as_writer(lock);
}

int sec__trylock_write(sec_rwlock *lock) {
    idm::MutexHold hold(&lock->mutex);
    if (lock->lock_count != 0) return -1;
    lock->lock_count = -1;
    return 0;
}

void sec__unlock_write(sec_rwlock *lock) OXIDM_NO_THREAD_SAFETY_ANALYSIS {
    idm::MutexHold hold(&lock->mutex);
    lock->lock_count = 0;
    wake_after_writer(lock);
}

void sec__lock_promote(sec_rwlock *lock) OXIDM_NO_THREAD_SAFETY_ANALYSIS {
    pthread_mutex_lock(&lock->mutex);
    // The caller's read hold ends here.  No writer is woken for it: were it
    // the last reader, the caller takes the lock at once, before any other.
    if (lock->lock_count > 0) --lock->lock_count;
    wait_as_writer(lock);
}

void sec__lock_demote(sec_rwlock *lock) OXIDM_NO_THREAD_SAFETY_ANALYSIS {
    pthread_mutex_lock(&lock->mutex);
    lock->lock_count = 0;
    wake_after_writer(lock);
    wait_as_reader(lock);
}

void sec__waiting_reader_cleanup(sec_rwlock *lock) { pthread_mutex_unlock(&lock->mutex); }

void sec__waiting_writer_cleanup(sec_rwlock *lock) {
    if (--lock->waiting_writers == 0 && lock->lock_count >= 0) pthread_cond_broadcast(&lock->readers_ok);
    pthread_mutex_unlock(&lock->mutex);
}

}  // extern "C"
