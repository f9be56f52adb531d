// Reader-writer lock, single-threaded state transitions: try-lock,
// promotion of the only reader, demotion, destroy.  The scenarios with
// waiting threads and cancellation are in concurrency/test_cluster_lock.cpp.
#include <cstring>

#include "harness.h"
#include "oxidm_state.h"
#include "oxsec_lock.h"

namespace {

class LockState : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        std::memset(static_cast<void *>(&lock), 0xA5, sizeof lock);
        sec__lock_init(&lock);
    }
    void TearDown() override {
        idm_test_fail_mutex_init(0);
        oxtest::Test::TearDown();
    }
    sec_rwlock lock;
};

TEST_F(LockState, InitZeroesTheCounters) {
    EXPECT_EQ(lock.lock_count, 0);
    EXPECT_EQ(lock.waiting_writers, 0u);
    EXPECT_EQ(pthread_mutex_trylock(&lock.mutex), 0);
    pthread_mutex_unlock(&lock.mutex);
}

TEST_F(LockState, TryLockAnswersFromTheCountOnly) {
    struct Case {
        const char *label;
        int32_t lock_count;
        uint32_t waiting_writers;
        int answer;
        int32_t after;
    } cases[] = {
        {"free", 0, 0, 0, -1},
        {"held by one reader", 1, 0, -1, 1},
        {"held by a writer", -1, 0, -1, -1},
        {"free while writers wait", 0, 2, 0, -1},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        lock.lock_count = c.lock_count;
        lock.waiting_writers = c.waiting_writers;
        EXPECT_EQ(sec__trylock_write(&lock), c.answer);
        EXPECT_EQ(lock.lock_count, c.after);
        EXPECT_EQ(lock.waiting_writers, c.waiting_writers);
    }
}

TEST_F(LockState, TheOnlyReaderPromotesAndDemotesWithoutWaiting) {
    sec__lock_read(&lock);
    EXPECT_EQ(lock.lock_count, 1);
    sec__lock_promote(&lock);
    EXPECT_EQ(lock.lock_count, -1);
    EXPECT_EQ(lock.waiting_writers, 0u);
    sec__lock_demote(&lock);
    EXPECT_EQ(lock.lock_count, 1);
    sec__unlock_read(&lock);
    EXPECT_EQ(lock.lock_count, 0);
    sec__lock_write(&lock);
    EXPECT_EQ(lock.lock_count, -1);
    sec__unlock_write(&lock);
    EXPECT_EQ(lock.lock_count, 0);
}

TEST_F(LockState, DestroyLeavesZeroBytesAndTheRecordCanBeInitialisedAgain) {
    sec__lock_read(&lock);
    sec__unlock_read(&lock);
    EXPECT_EQ(sec__lock_destroy(&lock), 0);
    const sec_rwlock zero{};
    EXPECT_EQ(std::memcmp(&lock, &zero, sizeof lock), 0);
    sec__lock_init(&lock);
    sec__lock_write(&lock);
    EXPECT_EQ(lock.lock_count, -1);
    sec__unlock_write(&lock);
    sec__lock_destroy(&lock);
}

TEST_F(LockState, SimpleInitPassesTheResultThrough) {
    pthread_mutex_t m;
    EXPECT_EQ(sec__simple_init(&m), 0);
    EXPECT_EQ(pthread_mutex_trylock(&m), 0);
    pthread_mutex_unlock(&m);
    pthread_mutex_destroy(&m);
    idm_test_fail_mutex_init(EAGAIN);
    EXPECT_EQ(sec__simple_init(&m), EAGAIN);
}

}  // namespace
