// Reader-writer lock with real threads: writer preference, the wake-up
// rules, promotion and demotion, and cancellation of every kind of waiter.
// A thread's waiting is established by the condition variable it sleeps on
// (test_cluster_threads.h), never by sleeping and hoping.
#include <atomic>
#include <mutex>
#include <vector>

#include "harness.h"
#include "oxsec_lock.h"
#include "test_cluster_threads.h"

namespace {

using cluster_test::blocked_on;
using cluster_test::eventually;
using cluster_test::Thread;

struct Counts {
    int32_t lock_count;
    uint32_t waiting_writers;
    bool operator==(const Counts &o) const { return lock_count == o.lock_count && waiting_writers == o.waiting_writers; }
};
std::ostream &operator<<(std::ostream &os, const Counts &c) {
    return os << "{lock_count " << c.lock_count << ", waiting_writers " << c.waiting_writers << "}";
}

// Order in which the threads of a scenario obtained their holds.
class Events {
  public:
    void add(const std::string &e) {
        std::lock_guard<std::mutex> g(m_);
        events_.push_back(e);
    }
    std::vector<std::string> get() {
        std::lock_guard<std::mutex> g(m_);
        return events_;
    }

  private:
    std::mutex m_;
    std::vector<std::string> events_;
};

class Lock : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        if (!cluster_test::can_see_blocked_threads()) GTEST_SKIP() << "/proc/<pid>/syscall not readable";
        sec__lock_init(&lock);
    }
    void TearDown() override {
        sec__lock_destroy(&lock);
        oxtest::Test::TearDown();
    }
    // Reads the counters under the lock's mutex; also proves that no thread
    // left the mutex locked.
    Counts counts() {
        pthread_mutex_lock(&lock.mutex);
        Counts c{lock.lock_count, lock.waiting_writers};
        pthread_mutex_unlock(&lock.mutex);
        return c;
    }
    sec_rwlock lock{};
    Events events;
};

TEST_F(Lock, AWaitingWriterHoldsBackNewReadersAndGoesFirst) {
    sec__lock_read(&lock);
    sec__lock_read(&lock);
    std::atomic<bool> release_writer{false}, writer_in{false}, reader_in{false};
    Thread writer([&] {
        sec__lock_write(&lock);
        writer_in = true;
        events.add("writer");
        while (!release_writer) std::this_thread::yield();
        sec__unlock_write(&lock);
    });
    ASSERT_TRUE(blocked_on(writer.tid(), lock.writer_ok));
    Thread reader([&] {
        sec__lock_read(&lock);
        reader_in = true;
        events.add("reader");
        sec__unlock_read(&lock);
    });
    ASSERT_TRUE(blocked_on(reader.tid(), lock.readers_ok)) << "a new reader waits behind a waiting writer";
    EXPECT_EQ(counts(), (Counts{2, 1}));
    sec__unlock_read(&lock);
    EXPECT_EQ(counts(), (Counts{1, 1}));
    EXPECT_FALSE(writer_in.load());
    sec__unlock_read(&lock);
    ASSERT_TRUE(eventually(writer_in)) << "the last reader leaving wakes the writer";
    EXPECT_EQ(counts(), (Counts{-1, 0}));
    EXPECT_TRUE(blocked_on(reader.tid(), lock.readers_ok));
    release_writer = true;
    ASSERT_TRUE(eventually(reader_in));
    reader.join();
    writer.join();
    EXPECT_EQ(events.get(), (std::vector<std::string>{"writer", "reader"}));
    EXPECT_EQ(counts(), (Counts{0, 0}));
}

TEST_F(Lock, ACancelledWaitingWriterReleasesTheReadersItHeldBack) {
    sec__lock_read(&lock);
    sec__lock_read(&lock);
    std::atomic<bool> writer_in{false}, reader_in{false};
    Thread writer([&] {
        sec__lock_write(&lock);
        writer_in = true;
    });
    ASSERT_TRUE(blocked_on(writer.tid(), lock.writer_ok));
    Thread reader([&] {
        sec__lock_read(&lock);
        reader_in = true;
    });
    ASSERT_TRUE(blocked_on(reader.tid(), lock.readers_ok));
    writer.cancel();
    EXPECT_TRUE(writer.join()) << "the writer ended by cancellation";
    EXPECT_FALSE(writer_in.load());
    ASSERT_TRUE(eventually(reader_in)) << "the reader goes at once, with both read holds still in place";
    reader.join();
    EXPECT_EQ(counts(), (Counts{3, 0}));
    for (int i = 0; i < 3; ++i) sec__unlock_read(&lock);
    EXPECT_EQ(sec__trylock_write(&lock), 0);
}

TEST_F(Lock, ACancelledWaitingReaderLeavesTheCountersAlone) {
    sec__lock_write(&lock);
    Thread reader([&] { sec__lock_read(&lock); });
    ASSERT_TRUE(blocked_on(reader.tid(), lock.readers_ok));
    reader.cancel();
    EXPECT_TRUE(reader.join());
    EXPECT_EQ(counts(), (Counts{-1, 0}));
    sec__unlock_write(&lock);
    EXPECT_EQ(counts(), (Counts{0, 0}));
}

TEST_F(Lock, WriterLeavingWithoutWaitingWritersWakesEveryReader) {
    sec__lock_write(&lock);
    std::atomic<int> inside{0};
    std::vector<std::unique_ptr<Thread>> readers;
    for (int i = 0; i < 3; ++i)
        readers.push_back(std::make_unique<Thread>([&] {
            sec__lock_read(&lock);
            inside++;
        }));
    for (auto &r : readers) ASSERT_TRUE(blocked_on(r->tid(), lock.readers_ok));
    sec__unlock_write(&lock);
    for (auto &r : readers) r->join();
    EXPECT_EQ(inside.load(), 3);
    EXPECT_EQ(counts(), (Counts{3, 0}));
}

TEST_F(Lock, WriterLeavingWithWaitingWritersPassesTheLockToOneWriter) {
    sec__lock_write(&lock);
    std::atomic<int> writers_in{0};
    std::atomic<bool> release{false}, reader_in{false};
    auto writer_body = [&] {
        sec__lock_write(&lock);
        writers_in++;
        while (!release) std::this_thread::yield();
        sec__unlock_write(&lock);
    };
    Thread w1(writer_body), w2(writer_body);
    ASSERT_TRUE(blocked_on(w1.tid(), lock.writer_ok));
    ASSERT_TRUE(blocked_on(w2.tid(), lock.writer_ok));
    Thread reader([&] {
        sec__lock_read(&lock);
        reader_in = true;
        sec__unlock_read(&lock);
    });
    ASSERT_TRUE(blocked_on(reader.tid(), lock.readers_ok));
    sec__unlock_write(&lock);
    for (int i = 0; i < 300000 && writers_in.load() == 0; ++i) usleep(100);
    EXPECT_EQ(writers_in.load(), 1);
    EXPECT_EQ(counts(), (Counts{-1, 1}));
    EXPECT_FALSE(reader_in.load());
    release = true;
    w1.join();
    w2.join();
    reader.join();
    EXPECT_EQ(writers_in.load(), 2);
    EXPECT_TRUE(reader_in.load());
    EXPECT_EQ(counts(), (Counts{0, 0}));
}

TEST_F(Lock, TwoReadersPromoteOneAfterTheOther) {
    std::atomic<bool> a_reads{false}, b_reads{false}, b_promote{false}, b_release{false};
    Thread a([&] {
        sec__lock_read(&lock);
        a_reads = true;
        while (!b_reads) std::this_thread::yield();
        sec__lock_promote(&lock);
        events.add("a write");
        sec__unlock_write(&lock);
    });
    Thread b([&] {
        sec__lock_read(&lock);
        b_reads = true;
        while (!b_promote) std::this_thread::yield();
        sec__lock_promote(&lock);
        events.add("b write");
        while (!b_release) std::this_thread::yield();
        sec__unlock_write(&lock);
    });
    ASSERT_TRUE(blocked_on(a.tid(), lock.writer_ok)) << "the first promoter waits for the other reader";
    EXPECT_EQ(counts(), (Counts{1, 1}));
    b_promote = true;
    for (int i = 0; i < 300000 && events.get().empty(); ++i) usleep(100);
    EXPECT_EQ(events.get(), std::vector<std::string>{"b write"}) << "giving up the last read hold gets it at once";
    EXPECT_EQ(counts(), (Counts{-1, 1}));
    b_release = true;
    a.join();
    b.join();
    EXPECT_EQ(events.get(), (std::vector<std::string>{"b write", "a write"}));
    EXPECT_EQ(counts(), (Counts{0, 0}));
}

TEST_F(Lock, ACancelledPromoterHoldsNothingAndReleasesWaitingReaders) {
    sec__lock_read(&lock);
    std::atomic<bool> reader_in{false};
    Thread promoter([&] {
        sec__lock_read(&lock);
        sec__lock_promote(&lock);
        ADD_FAILURE() << "promotion cannot succeed while the main thread reads";
    });
    ASSERT_TRUE(blocked_on(promoter.tid(), lock.writer_ok));
    Thread reader([&] {
        sec__lock_read(&lock);
        reader_in = true;
    });
    ASSERT_TRUE(blocked_on(reader.tid(), lock.readers_ok));
    promoter.cancel();
    EXPECT_TRUE(promoter.join());
    ASSERT_TRUE(eventually(reader_in));
    reader.join();
    EXPECT_EQ(counts(), (Counts{2, 0})) << "main's and the new reader's holds; the promoter's is gone";
}

TEST_F(Lock, ADemotingWriterWaitsBehindBothWaitingWriters) {
    sec__lock_write(&lock);
    auto writer_body = [&](const char *name) {
        return [this, name] {
            sec__lock_write(&lock);
            events.add(name);
            sec__unlock_write(&lock);
        };
    };
    Thread w1(writer_body("w1")), w2(writer_body("w2"));
    ASSERT_TRUE(blocked_on(w1.tid(), lock.writer_ok));
    ASSERT_TRUE(blocked_on(w2.tid(), lock.writer_ok));
    Thread demoter([&] {
        // Takes over the main thread's write hold (the lock keeps no owner).
        sec__lock_demote(&lock);
        events.add("demoter read");
    });
    demoter.join();
    w1.join();
    w2.join();
    auto e = events.get();
    ASSERT_EQ(e.size(), 3u);
    EXPECT_EQ(e[2], "demoter read");
    EXPECT_EQ(counts(), (Counts{1, 0}));
}

TEST_F(Lock, ACancelledDemoterHoldsNothing) {
    sec__lock_write(&lock);
    std::atomic<bool> writer_in{false}, release{false};
    Thread writer([&] {
        sec__lock_write(&lock);
        writer_in = true;
        while (!release) std::this_thread::yield();
        sec__unlock_write(&lock);
    });
    ASSERT_TRUE(blocked_on(writer.tid(), lock.writer_ok));
    Thread demoter([&] {
        sec__lock_demote(&lock);
        ADD_FAILURE() << "the demoter cannot read while the writer holds the lock";
    });
    ASSERT_TRUE(eventually(writer_in));
    ASSERT_TRUE(blocked_on(demoter.tid(), lock.readers_ok));
    demoter.cancel();
    EXPECT_TRUE(demoter.join());
    EXPECT_EQ(counts(), (Counts{-1, 0}));
    release = true;
    writer.join();
    EXPECT_EQ(counts(), (Counts{0, 0}));
}

// Many threads mixing every operation: afterwards the lock is free, and no
// two writers (or a writer and a reader) were ever inside together.
TEST_F(Lock, MixedLoadKeepsExclusion) {
    std::atomic<int> readers_inside{0}, writers_inside{0}, violations{0};
    auto check_read = [&] {
        readers_inside++;
        if (writers_inside.load() != 0) violations++;
        readers_inside--;
    };
    auto check_write = [&] {
        if (writers_inside.fetch_add(1) != 0 || readers_inside.load() != 0) violations++;
        writers_inside--;
    };
    std::vector<std::unique_ptr<Thread>> threads;
    for (int t = 0; t < 6; ++t)
        threads.push_back(std::make_unique<Thread>([&, t] {
            for (int i = 0; i < 2000; ++i) {
                switch ((i + t) % 4) {
                case 0:
                    sec__lock_read(&lock);
                    check_read();
                    sec__unlock_read(&lock);
                    break;
                case 1:
                    sec__lock_write(&lock);
                    check_write();
                    sec__unlock_write(&lock);
                    break;
                case 2:
                    sec__lock_read(&lock);
                    check_read();
                    sec__lock_promote(&lock);
                    check_write();
                    sec__lock_demote(&lock);
                    check_read();
                    sec__unlock_read(&lock);
                    break;
                default:
                    if (sec__trylock_write(&lock) == 0) {
                        check_write();
                        sec__unlock_write(&lock);
                    }
                }
            }
        }));
    for (auto &t : threads) t->join();
    EXPECT_EQ(violations.load(), 0);
    EXPECT_EQ(counts(), (Counts{0, 0}));
}

}  // namespace
