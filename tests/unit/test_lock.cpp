// Reader-writer lock on one thread: the counters through every operation
// that does not wait, with the mutex free after each and locked as often as
// unlocked.  Waiting and cancelled threads are the concurrency suite's.
#include "harness.h"
#include "oxidm_state.h"
#include "oxsec_lock.h"

namespace {

void try_fails(sec_rwlock *l) { EXPECT_EQ(sec__trylock_write(l), -1); }
void try_takes(sec_rwlock *l) { EXPECT_EQ(sec__trylock_write(l), 0); }

using LockState = oxtest::Test;

TEST_F(LockState, CountersThroughEveryOperation) {
    sec_rwlock lock;
    sec__lock_init(&lock);
    const struct {
        void (*op)(sec_rwlock *);
        uint32_t waiting;  // waiting writers, set before the operation
        int32_t count;     // after
    } steps[] = {
        {sec__lock_read, 0, 1},    {sec__lock_read, 0, 2},   {try_fails, 0, 2},          {sec__unlock_read, 0, 1},
        {sec__lock_promote, 0, -1}, {try_fails, 0, -1},      {sec__lock_demote, 0, 1},   {sec__unlock_read, 0, 0},
        {sec__lock_write, 0, -1},  {sec__unlock_write, 0, 0},
        {try_takes, 2, -1} /* waiting writers are not considered */, {sec__unlock_write, 2, 0},
    };
    for (const auto &s : steps) {
        SCOPED_TRACE(&s - steps);
        lock.waiting_writers = s.waiting;
        s.op(&lock);
        EXPECT_EQ(std::pair(lock.lock_count, lock.waiting_writers), std::pair(s.count, s.waiting));
        EXPECT_EQ(pthread_mutex_trylock(&lock.mutex), 0) << "the mutex is free";
        pthread_mutex_unlock(&lock.mutex);
    }
    EXPECT_EQ(pthread_mutex_destroy(&lock.mutex), 0) << "every operation locked the mutex as often as it unlocked it";
    pthread_mutex_init(&lock.mutex, nullptr);
    EXPECT_EQ(sec__lock_destroy(&lock), 0);
}

}  // namespace
