// The cluster map under concurrent queries: eight threads query while
// another thread rewrites the node information file 1,000 times.  Every
// answer must come from one complete version of the file: under a read
// share, all hosts of the trees belong to the same version (or the trees
// are empty after an invalid version), and the answer for the asked host
// agrees with them.  Also: queries cancelled while they wait for idmutex,
// and while a reload waits for the write hold.
#include <atomic>
#include <cstdio>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <vector>

#include "harness.h"
#include "oxidm_clmap.h"
#include "oxidm_state.h"
#include "test_cluster_threads.h"

namespace {

using cluster_test::blocked_on;
using cluster_test::Thread;
using oxtest::kNodeInfo;

constexpr int kHosts = 10;
constexpr int kVersions = 1000;
constexpr int kQueryThreads = 8;

// Version v: hosts h0..h9 (and addresses 10.0.0.0..9), each in clusters
// "v<v>" and "m<v % 7>"; every 50th version has a syntax error at its end.
// All versions have the same length: the library stats the path and then
// opens it, so it may read a newer file than the one it took the size from,
// and only a file of the same size is read whole (a longer one would be cut
// at the size stat reported, as it should).
std::string version_cluster(int v) {
    char name[16];
    std::snprintf(name, sizeof name, "v%04d", v);
    return name;
}

std::string version_text(int v) {
    std::string t = "# version " + version_cluster(v) + "\n";
    for (int h = 0; h < kHosts; ++h)
        t += "NODE:\nNAME: h" + std::to_string(h) + "\nADDRESS: 10.0.0." + std::to_string(h) + "\nCLUSTER: " +
             version_cluster(v) + " m" + std::to_string(v % 7) + "\n";
    t += v % 50 == 49 ? "NODE:\n" : "#ODE:\n";
    return t;
}

// Under the caller's read share: -1 when both trees are empty, the version
// when every host and address is present with that version's clusters, -2
// for anything else (a mixture, a partial tree).  Versions need not grow
// from one query to the next: a reload that read an older version may win
// the write hold after one that read a newer one (the last reload wins).
int tree_version() {
    if (nametree.rst_node_cnt == 0 && iptree.rst_node_cnt == 0) return -1;
    if (nametree.rst_node_cnt != kHosts || iptree.rst_node_cnt != kHosts) return -2;
    int version = -3;
    for (int h = 0; h < 2 * kHosts; ++h) {
        std::string key = h < kHosts ? "h" : "10.0.0.";  // appended: GCC 12 -O3 misreads literal + string
        key += std::to_string(h < kHosts ? h : h - kHosts);
        idm_clnode probe{key.data(), nullptr, 0};
        void *item = &probe;
        if (sec__rst_find(h < kHosts ? &nametree : &iptree, &item) != 1) return -2;
        const auto *n = static_cast<const idm_clnode *>(item);
        if (n->count != 2 || n->clusters[0][0] != 'v') return -2;
        int v = std::atoi(n->clusters[0] + 1);
        if (std::string(n->clusters[1]) != "m" + std::to_string(v % 7)) return -2;
        if (version == -3) version = v;
        if (v != version) return -2;
    }
    return version;
}

class ClusterMap : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
        pthread_once(&idm__init_once_block, idm__state_init);
    }
};

struct LockCounts {
    int32_t lock_count;
    uint32_t waiting_writers;
};
LockCounts lock_counts() {
    pthread_mutex_lock(&idmutex.mutex);
    LockCounts c{idmutex.lock_count, idmutex.waiting_writers};
    pthread_mutex_unlock(&idmutex.mutex);
    return c;
}

TEST_F(ClusterMap, EveryAnswerComesFromOneCompleteVersion) {
    oxtest::write_file(kNodeInfo, version_text(0), 1000);
    cux_set_active_cluster("m3");
    std::atomic<bool> done{false};
    std::atomic<long> queries{0}, bad{0}, found{0};
    std::mutex seen_mutex;
    std::set<int> seen;  // versions answered from, over all threads
    std::vector<std::unique_ptr<Thread>> threads;
    for (int t = 0; t < kQueryThreads; ++t)
        threads.push_back(std::make_unique<Thread>([&, t] {
            for (long i = 0; !done.load() || i < 50; ++i) {
                const std::string host = (t % 2 ? "h" : "10.0.0.") + std::to_string((i + t) % kHosts);
                if (t < 2) {
                    // The public queries as well, for their locking.
                    int32_t a = t == 0 ? sec_is_in_any_cluster(host.c_str()) : sec_is_in_active_cluster(host.c_str());
                    if (a != 1 && a != 0 && a != -1) bad++;
                }
                idm::clmap::MapHold hold(&idmutex);
                char **clusters = nullptr;
                int32_t count = 0;
                const int32_t status = sec__get_cluster_names(hold, host.c_str(), &clusters, &count);
                const int version = tree_version();
                queries++;
                if (version == -2) {
                    bad++;
                    continue;
                }
                if (status == 0) {
                    found++;
                    {
                        std::lock_guard<std::mutex> g(seen_mutex);
                        seen.insert(version);
                    }
                    if (version < 0 || count != 2 || clusters[0] != version_cluster(version)) bad++;
                } else if (status == 1) {
                    if (version != -1) bad++;  // every valid version lists every host
                } else if (status != 21) {
                    bad++;
                }
            }
        }));
    for (int v = 1; v < kVersions; ++v) {
        // Paced by the queries, not by time: they keep up with the rewrites.
        while (queries.load() < v / 4) std::this_thread::yield();
        oxtest::write_file(kNodeInfo, version_text(v), 1000 + v);
    }
    done = true;
    for (auto &t : threads) t->join();
    EXPECT_EQ(bad.load(), 0) << "of " << queries.load() << " queries";
    EXPECT_GT(found.load(), 0);
    EXPECT_GT(seen.size(), 1u) << "the queries ran alongside the rewrites";
    oxtest::write_file(kNodeInfo, version_text(kVersions), 1000 + kVersions);
    idm::clmap::MapHold hold(&idmutex);
    char **clusters = nullptr;
    int32_t count = 0;
    EXPECT_EQ(sec__get_cluster_names(hold, "h3", &clusters, &count), 0);
    EXPECT_EQ(tree_version(), kVersions);
}

TEST_F(ClusterMap, AQueryCancelledWhileWaitingForTheLockLeavesItConsistent) {
    if (!cluster_test::can_see_blocked_threads()) GTEST_SKIP() << "/proc/<pid>/syscall not readable";
    oxtest::write_file(kNodeInfo, version_text(0), 1000);
    EXPECT_EQ(sec_is_in_any_cluster("h1"), 1);
    sec__lock_write(&idmutex);
    Thread query([] { sec_is_in_any_cluster("h1"); });
    ASSERT_TRUE(blocked_on(query.tid(), idmutex.readers_ok));
    query.cancel();
    EXPECT_TRUE(query.join());
    LockCounts c = lock_counts();
    EXPECT_EQ(c.lock_count, -1);
    EXPECT_EQ(c.waiting_writers, 0u);
    sec__unlock_write(&idmutex);
    EXPECT_EQ(sec_is_in_any_cluster("h1"), 1);
}

TEST_F(ClusterMap, AReloadCancelledWhileWaitingToPromoteIsRetriedByTheNextQuery) {
    if (!cluster_test::can_see_blocked_threads()) GTEST_SKIP() << "/proc/<pid>/syscall not readable";
    oxtest::write_file(kNodeInfo, version_text(0), 1000);
    EXPECT_EQ(sec_is_in_any_cluster("h1"), 1);
    oxtest::write_file(kNodeInfo, version_text(1), 2000);
    sec__lock_read(&idmutex);  // the promotion must wait for this share
    Thread query([] { sec_is_in_any_cluster("h1"); });
    ASSERT_TRUE(blocked_on(query.tid(), idmutex.writer_ok));
    query.cancel();
    EXPECT_TRUE(query.join());
    LockCounts c = lock_counts();
    EXPECT_EQ(c.lock_count, 1) << "only the main thread's share is left";
    EXPECT_EQ(c.waiting_writers, 0u);
    EXPECT_EQ(tree_version(), 0) << "the trees were not touched";
    sec__unlock_read(&idmutex);
    // The abandoned load is done again, although the time is unchanged.
    idm::clmap::MapHold hold(&idmutex);
    char **clusters = nullptr;
    int32_t count = 0;
    EXPECT_EQ(sec__get_cluster_names(hold, "h1", &clusters, &count), 0);
    EXPECT_EQ(tree_version(), 1);
}

}  // namespace
