// Reader-writer lock with writer preference, in-place promotion and
// demotion, and cancellation-safe waiting.  The library has one: idmutex,
// which guards the cluster map (oxidm_clmap).
//
// `mutex` guards both counters and is held only inside the operations below.
// Readers wait only on `readers_ok`, writers and promoting readers only on
// `writer_ok`, so a signal on `writer_ok` always reaches a writer.
//
// Writer preference: once a writer waits, no new read hold is granted until
// every waiting writer has held and released the lock (or was cancelled).
// Promotion and demotion are not atomic: each gives up the caller's hold
// before it waits for the new one, so another writer may run in between.
//
// The lock keeps no owner and is not recursive; unlock, promote and demote
// trust the caller to hold what it gives up.
//
// Every wait is a cancellation point.  The waiting clean-ups below are run
// by the destructors of the waiting scopes, so a thread cancelled while
// waiting releases `mutex`, and a cancelled writer withdraws from
// `waiting_writers` (waking the readers it held back).  A thread cancelled
// inside promote or demote has already given up its previous hold and holds
// nothing.
#ifndef OXSEC_LOCK_H
#define OXSEC_LOCK_H

#include <pthread.h>

#include <cstdint>

#include "oxidm_annotations.h"

struct OXIDM_CAPABILITY("rwlock") sec_rwlock {
    pthread_mutex_t mutex;     // guards lock_count and waiting_writers
    pthread_cond_t readers_ok; // would-be readers wait here
    pthread_cond_t writer_ok;  // would-be writers and promoting readers wait here
    int32_t lock_count;        // 0 free, n > 0 held by n readers, -1 held by one writer
    uint32_t waiting_writers;  // threads inside a write-acquiring operation
};

extern "C" {

// Initialises mutex, writer_ok, readers_ok (default attributes) and zeroes
// both counters.  The record is never copied once in use.
void sec__lock_init(sec_rwlock *lock);
// Destroys mutex, readers_ok, writer_ok and zeroes the whole record; it must
// be initialised again before use.  Returns 0.
int sec__lock_destroy(sec_rwlock *lock);
// pthread_mutex_init of a plain mutex with default attributes; its result.
int sec__simple_init(pthread_mutex_t *mutex);

void sec__lock_read(sec_rwlock *lock) OXIDM_ACQUIRE_SHARED(*lock);
void sec__unlock_read(sec_rwlock *lock) OXIDM_RELEASE_SHARED(*lock);
void sec__lock_write(sec_rwlock *lock) OXIDM_ACQUIRE(*lock);
// 0: the write hold was free and is now the caller's; -1: the lock was held.
// Never waits for the lock; waiting writers are not considered.
int sec__trylock_write(sec_rwlock *lock);
void sec__unlock_write(sec_rwlock *lock) OXIDM_RELEASE(*lock);
// Read hold -> write hold (gives up the read share first).
void sec__lock_promote(sec_rwlock *lock) OXIDM_RELEASE_SHARED(*lock) OXIDM_ACQUIRE(*lock);
// Write hold -> read hold (waiting writers go first).
void sec__lock_demote(sec_rwlock *lock) OXIDM_RELEASE(*lock) OXIDM_ACQUIRE_SHARED(*lock);

// Clean-ups of a waiting scope; both run with `mutex` held and release it.
void sec__waiting_reader_cleanup(sec_rwlock *lock);
// Withdraws one waiting writer; when it was the last and no writer holds
// the lock, wakes all waiting readers.
void sec__waiting_writer_cleanup(sec_rwlock *lock);

}  // extern "C"

#endif
