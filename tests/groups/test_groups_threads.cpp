// Group lookups from several threads at once, and a thread cancelled in the
// middle of a scan.  The group enumeration position is process-wide, so
// without serialised scans the threads would see parts of each other's.
#include <pthread.h>
#include <time.h>

#include <atomic>
#include <string>
#include <vector>

#include "groups_db.h"
#include "oxidm.h"

namespace {

using Names = std::vector<std::string>;

class GroupsThreads : public groupstest::Fixture {};

struct GroupEntry {
    std::string name;
    unsigned gid;
    Names members;
};

constexpr int kUsers = 8;

// 400 groups; user u is named by group k when (k + 3u) % 7 == 0, twice when
// also k % 50 == 0; primary group "p<u>" of every user sits mid-file and
// lists its own user too (it must not be repeated).
std::vector<GroupEntry> make_groups() {
    std::vector<GroupEntry> groups;
    for (int k = 0; k < 400; ++k) {
        GroupEntry g{"g" + std::to_string(k), 20000u + static_cast<unsigned>(k), {"noise" + std::to_string(k)}};
        for (int u = 0; u < kUsers; ++u) {
            if ((k + 3 * u) % 7 != 0) continue;
            g.members.push_back("t" + std::to_string(u));
            if (k % 50 == 0) g.members.push_back("t" + std::to_string(u));
        }
        groups.push_back(g);
        if (k == 200)
            for (int u = 0; u < kUsers; ++u)
                groups.push_back({"p" + std::to_string(u), 10000u + static_cast<unsigned>(u), {"t" + std::to_string(u)}});
    }
    return groups;
}

void write_thread_db(const std::vector<GroupEntry> &groups) {
    std::string passwd, group;
    for (int u = 0; u < kUsers; ++u)
        passwd += "t" + std::to_string(u) + ":x:" + std::to_string(3000 + u) + ":" + std::to_string(10000 + u) +
                  "::/:/bin/sh\n";
    for (const GroupEntry &g : groups) {
        group += g.name + ":x:" + std::to_string(g.gid) + ":";
        for (size_t i = 0; i < g.members.size(); ++i) group += (i ? "," : "") + g.members[i];
        group += "\n";
    }
    groupstest::write_db(passwd, group);
}

Names expected_for(const std::vector<GroupEntry> &groups, int u) {
    const std::string user = "t" + std::to_string(u), primary = "p" + std::to_string(u);
    Names out{primary};
    for (const GroupEntry &g : groups) {
        if (g.name == primary) continue;
        for (const std::string &m : g.members)
            if (m == user) out.push_back(g.name);
    }
    return out;
}

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
        groupstest::Result r = groupstest::get_groups(user.c_str());
        if (r.status != 0 || r.groups != *w->expected) ++w->wrong;
    }
    return nullptr;
}

TEST_F(GroupsThreads, ConcurrentLookupsEachSeeACompleteScan) {
    const std::vector<GroupEntry> groups = make_groups();
    write_thread_db(groups);
    std::vector<Names> expected;
    for (int u = 0; u < kUsers; ++u) expected.push_back(expected_for(groups, u));
    ASSERT_EQ(groupstest::get_groups("t0").groups, expected[0]);

    pthread_barrier_t start;
    pthread_barrier_init(&start, nullptr, kUsers);
    std::vector<Worker> workers;
    for (int u = 0; u < kUsers; ++u) workers.push_back({u, &expected[static_cast<size_t>(u)], &start});
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
    const std::vector<GroupEntry> groups = make_groups();
    write_thread_db(groups);
    groupstest::reset_interposition();
    groupstest::block_getgrent_at(100);
    groupstest::Result ignored;
    pthread_t victim;
    ASSERT_EQ(pthread_create(&victim, nullptr, lookup_once, &ignored), 0);
    while (!groupstest::block_entered()) usleep(1000);
    ASSERT_EQ(groupstest::endgrent_calls(), 0);
    pthread_cancel(victim);
    void *how = nullptr;
    ASSERT_TRUE(join_within(victim, &how));
    EXPECT_EQ(how, PTHREAD_CANCELED);
    EXPECT_EQ(groupstest::endgrent_calls(), 1) << "the enumeration was not closed";

    // The scan lock is free again and the next scan starts from the top.
    groupstest::Result r;
    pthread_t next;
    ASSERT_EQ(pthread_create(&next, nullptr, lookup_once, &r), 0);
    if (!join_within(next, nullptr)) {
        ADD_FAILURE() << "a lookup after the cancellation hangs: the scan lock was left held";
        std::_Exit(1);
    }
    EXPECT_EQ(r.status, 0);
    EXPECT_EQ(r.groups, expected_for(groups, 1));
}

}  // namespace
