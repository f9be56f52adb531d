// Group lookups from several threads at once, and a thread cancelled in the
// middle of a scan.  The group enumeration position is process-wide, so
// without serialised scans the threads would see parts of each other's.
#include <pthread.h>
#include <time.h>

#include <string>
#include <vector>

#include "groups_db.h"
#include "oxidm.h"

namespace {

using Names = std::vector<std::string>;
constexpr int kUsers = 8;

class GroupsThreads : public groupstest::Fixture {
  protected:
    // 400 groups; user t<u> is named by group g<k> when (k + 3u) % 7 == 0,
    // twice when also k % 50 == 0; the primary group p<u> of every user sits
    // mid-file and lists its own user too (it must not be repeated).
    void SetUp() override {
        groupstest::Fixture::SetUp();
        std::string passwd, group;
        for (int u = 0; u < kUsers; ++u) {
            passwd += "t" + std::to_string(u) + ":x:" + std::to_string(3000 + u) + ":" + std::to_string(10000 + u) +
                      "::/:/bin/sh\n";
            expected_[u] = {"p" + std::to_string(u)};
        }
        for (int k = 0; k < 400; ++k) {
            group += "g" + std::to_string(k) + ":x:" + std::to_string(20000 + k) + ":noise";
            for (int u = 0; u < kUsers; ++u)
                for (int times = (k + 3 * u) % 7 != 0 ? 0 : k % 50 == 0 ? 2 : 1; times > 0; --times) {
                    group += ",t" + std::to_string(u);
                    expected_[u].push_back("g" + std::to_string(k));
                }
            group += "\n";
            for (int u = 0; k == 200 && u < kUsers; ++u)
                group += "p" + std::to_string(u) + ":x:" + std::to_string(10000 + u) + ":t" + std::to_string(u) + "\n";
        }
        groupstest::write_db(passwd, group);
    }
    Names expected_[kUsers];
};

struct Worker {
    int user;
    const Names *expected;
    pthread_barrier_t *start;
    int wrong = 0;
};

void *lookup_repeatedly(void *arg) {
    auto *w = static_cast<Worker *>(arg);
    const std::string user = "t" + std::to_string(w->user);
    pthread_barrier_wait(w->start);
    for (int i = 0; i < 40; ++i) {
        const groupstest::Result r = groupstest::get_groups(user.c_str());
        if (r.status != 0 || r.groups != *w->expected) ++w->wrong;
    }
    return nullptr;
}

TEST_F(GroupsThreads, ConcurrentLookupsEachSeeACompleteScan) {
    ASSERT_EQ(groupstest::get_groups("t0").groups, expected_[0]);
    pthread_barrier_t start;
    pthread_barrier_init(&start, nullptr, kUsers);
    std::vector<Worker> workers;
    for (int u = 0; u < kUsers; ++u) workers.push_back({u, &expected_[u], &start});
    std::vector<pthread_t> threads(kUsers);
    for (int u = 0; u < kUsers; ++u) ASSERT_EQ(pthread_create(&threads[u], nullptr, lookup_repeatedly, &workers[u]), 0);
    for (pthread_t t : threads) pthread_join(t, nullptr);
    pthread_barrier_destroy(&start);
    for (const Worker &w : workers) EXPECT_EQ(w.wrong, 0) << "user t" << w.user << ": incomplete or wrong lists";
}

void *lookup_once(void *arg) {
    *static_cast<groupstest::Result *>(arg) = groupstest::get_groups("t1");
    return nullptr;
}

// Joins `thread` within 30 s; false when it still runs (a scan lock left held).
bool join_within(pthread_t thread, void **result) {
    timespec limit{};
    clock_gettime(CLOCK_REALTIME, &limit);
    limit.tv_sec += 30;
    return pthread_timedjoin_np(thread, result, &limit) == 0;
}

TEST_F(GroupsThreads, CancelledScanReleasesTheLockAndClosesTheEnumeration) {
    groupstest::block_getgrent_at(100);
    groupstest::Result r;
    pthread_t thread;
    ASSERT_EQ(pthread_create(&thread, nullptr, lookup_once, &r), 0);
    while (!groupstest::block_entered()) usleep(1000);
    ASSERT_EQ(groupstest::endgrent_calls(), 0);
    pthread_cancel(thread);
    void *how = nullptr;
    ASSERT_TRUE(join_within(thread, &how));
    EXPECT_EQ(how, PTHREAD_CANCELED);
    EXPECT_EQ(groupstest::endgrent_calls(), 1) << "the enumeration was not closed";
    // The scan lock is free again and the next scan starts from the top.
    ASSERT_EQ(pthread_create(&thread, nullptr, lookup_once, &r), 0);
    if (!join_within(thread, nullptr)) {
        ADD_FAILURE() << "a lookup after the cancellation hangs: the scan lock was left held";
        std::_Exit(1);
    }
    EXPECT_EQ(r.status, 0);
    EXPECT_EQ(r.groups, expected_[1]);
}

}  // namespace
