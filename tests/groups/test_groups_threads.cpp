// Group lookups from several threads at once, and a thread cancelled in the
// middle of a scan.  The group enumeration position is process-wide, so
// without serialised scans the threads would see parts of each other's.
#include <pthread.h>
#include <unistd.h>
#include <time.h>

#include <cstdint>
#include <string>
#include <vector>

#include "groups_db.h"
#include "test_mpm.h"

namespace {

using Names = std::vector<std::string>;
using oxtest::num;
constexpr int kUsers = 8;
Names g_expected[kUsers];

class GroupsThreads : public groupstest::Fixture {
  protected:
    // 400 groups; user t<u> is named by group g<k> when (k + 3u) % 7 == 0,
    // twice when also k % 50 == 0; the primary group p<u> of every user sits
    // mid-file and lists its own user too (it must not be repeated).
    void SetUp() override {
        groupstest::Fixture::SetUp();
        std::string passwd, group;
        for (int u = 0; u < kUsers; ++u) {
            passwd += num("t", u) + num(":x:", 3000 + u) + num(":", 10000 + u) + "::/:/bin/sh\n";
            g_expected[u] = {num("p", u)};
        }
        for (int k = 0; k < 400; ++k) {
            group += num("g", k) + num(":x:", 20000 + k) + ":noise";
            for (int u = 0; u < kUsers; ++u)
                for (int times = (k + 3 * u) % 7 != 0 ? 0 : k % 50 == 0 ? 2 : 1; times > 0; --times) {
                    group += num(",t", u);
                    g_expected[u].push_back(num("g", k));
                }
            group += "\n";
            for (int u = 0; k == 200 && u < kUsers; ++u) group += num("p", u) + num(":x:", 10000 + u) + num(":t", u) + "\n";
        }
        groupstest::write_db(passwd, group);
    }
};

// Joins `thread` within 30 s; false when it still runs (a scan lock left held).
bool join_within(pthread_t thread, void **result = nullptr) {
    timespec limit{};
    clock_gettime(CLOCK_REALTIME, &limit);
    limit.tv_sec += 30;
    return pthread_timedjoin_np(thread, result, &limit) == 0;
}

// Looks up the groups of t<u> 40 times (once for u >= 100, as t<u - 100>);
// returns the number of wrong answers.
void *look_up(void *arg) {
    const auto u = reinterpret_cast<intptr_t>(arg);
    intptr_t wrong = 0;
    for (int i = 0; i < (u < 100 ? 40 : 1); ++i) {
        const groupstest::Result r = groupstest::get_groups(num("t", u % 100).c_str());
        wrong += r.status != 0 || r.groups != g_expected[u % 100];
    }
    return reinterpret_cast<void *>(wrong);
}

TEST_F(GroupsThreads, ConcurrentLookupsEachSeeACompleteScan) {
    // nss_wrapper loads its files at the first lookup, unguarded: once first.
    ASSERT_EQ(look_up(reinterpret_cast<void *>(100)), nullptr);
    std::vector<pthread_t> threads(kUsers);
    for (intptr_t u = 0; u < kUsers; ++u)
        ASSERT_EQ(pthread_create(&threads[u], nullptr, look_up, reinterpret_cast<void *>(u)), 0);
    for (int u = 0; u < kUsers; ++u) {
        void *wrong = nullptr;
        ASSERT_TRUE(join_within(threads[u], &wrong));
        EXPECT_EQ(wrong, nullptr) << "user t" << u << ": incomplete or wrong lists";
    }
}

TEST_F(GroupsThreads, CancelledScanReleasesTheLockAndClosesTheEnumeration) {
    groupstest::block_getgrent_at(100);
    pthread_t thread;
    ASSERT_EQ(pthread_create(&thread, nullptr, look_up, reinterpret_cast<void *>(101)), 0);
    while (!groupstest::block_entered()) usleep(1000);
    ASSERT_EQ(groupstest::endgrent_calls(), 0);
    pthread_cancel(thread);
    void *how = nullptr;
    ASSERT_TRUE(join_within(thread, &how));
    EXPECT_EQ(how, PTHREAD_CANCELED);
    EXPECT_EQ(groupstest::endgrent_calls(), 1) << "the enumeration was not closed";
    // The scan lock is free again and the next scan starts from the top.
    ASSERT_EQ(pthread_create(&thread, nullptr, look_up, reinterpret_cast<void *>(101)), 0);
    void *wrong = nullptr;
    if (!join_within(thread, &wrong)) {
        ADD_FAILURE() << "a lookup after the cancellation hangs: the scan lock was left held";
        std::_Exit(1);
    }
    EXPECT_EQ(wrong, nullptr);
}

}  // namespace
