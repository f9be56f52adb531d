// Reader-writer lock on one thread: the counters through every operation
// that does not wait, with the mutex free after each; the withdrawal of a
// waiting writer; destroy.  Waiting and cancelled threads are the
// concurrency suite's.
#include <cstring>

#include "harness.h"
#include "oxidm_state.h"
#include "oxsec_lock.h"

namespace {

class LockState : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        std::memset(static_cast<void *>(&lock), 0xA5, sizeof lock);  // init sets every field
        sec__lock_init(&lock);
    }
    bool mutex_free() { return pthread_mutex_trylock(&lock.mutex) == 0 && pthread_mutex_unlock(&lock.mutex) == 0; }
    sec_rwlock lock;
};

int rd(sec_rwlock *l) { return sec__lock_read(l), 0; }
int unrd(sec_rwlock *l) { return sec__unlock_read(l), 0; }
int wr(sec_rwlock *l) { return sec__lock_write(l), 0; }
int unwr(sec_rwlock *l) { return sec__unlock_write(l), 0; }
int promote(sec_rwlock *l) { return sec__lock_promote(l), 0; }
int demote(sec_rwlock *l) { return sec__lock_demote(l), 0; }

TEST_F(LockState, CountersThroughEveryOperationThenDestroy) {
    const struct {
        int (*op)(sec_rwlock *);
        uint32_t waiting;  // waiting writers, set before the operation
        int result;        // of trylock
        int32_t count;     // after
    } steps[] = {
        {rd, 0, 0, 1},   {rd, 0, 0, 2},      {sec__trylock_write, 0, -1, 2}, {unrd, 0, 0, 1},
        {promote, 0, 0, -1},                 {sec__trylock_write, 0, -1, -1}, {demote, 0, 0, 1},
        {unrd, 0, 0, 0}, {wr, 0, 0, -1},     {unwr, 0, 0, 0},
        {sec__trylock_write, 2, 0, -1} /* waiting writers are not considered */, {unwr, 2, 0, 0},
    };
    EXPECT_TRUE(lock.lock_count == 0 && lock.waiting_writers == 0 && mutex_free());
    for (const auto &s : steps) {
        SCOPED_TRACE(&s - steps);
        lock.waiting_writers = s.waiting;
        EXPECT_EQ(s.op(&lock), s.result);
        EXPECT_EQ(lock.lock_count, s.count);
        EXPECT_EQ(lock.waiting_writers, s.waiting);
        EXPECT_TRUE(mutex_free());
    }
    // A waiting writer that gives up withdraws and releases the mutex.
    for (uint32_t waiting : {2u, 1u}) {
        pthread_mutex_lock(&lock.mutex);
        lock.waiting_writers = waiting;
        sec__waiting_writer_cleanup(&lock);
        EXPECT_EQ(lock.waiting_writers, waiting - 1);
        EXPECT_TRUE(mutex_free());
    }
    EXPECT_EQ(pthread_mutex_destroy(&lock.mutex), 0) << "every operation locked the mutex as often as it unlocked it";
    pthread_mutex_init(&lock.mutex, nullptr);
    EXPECT_EQ(sec__lock_destroy(&lock), 0);
    const sec_rwlock zero{};
    EXPECT_EQ(std::memcmp(&lock, &zero, sizeof lock), 0);
}

}  // namespace
