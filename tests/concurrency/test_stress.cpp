// Calls racing file rewrites.  The stress run: mapping threads for four
// mechanisms while both map files are rewritten and the routines registered
// again and again, cluster queries while the node file is rewritten (the
// first ones before any load); every answer must come
// from one version of each file.  Also: a query waits for the load that
// claimed its file's time.
#include <chrono>

#include "harness.h"
#include "mpm.h"
#include "oxidm_state.h"
#include "threads.h"

namespace {

using oxtest::num;

using Races = threads::Test;
using Stress = threads::Test;

// A mapping's walk saw one version of each file (the global one at most one
// behind the local one, written first) and one pair of routines, and the
// answer is that version's.
bool map_and_check(int m, int n) {
    const std::string answer = mpm::map(m, n % 4 == 0 ? "joe" : n % 4 == 1 ? "ann" : n % 4 == 2 ? "eve" : "bob");
    const mpm::Walk w = mpm::walk;
    if (w.local.mixed || w.global.mixed || w.pair.mixed || (w.global.version >= 0 && w.global.version < w.local.version - 1))
        return false;
    if (n % 4 < 2) return answer == num("s", m) + num(n % 4 ? "g" : "l", n % 4 ? w.global.version : w.local.version);
    return answer.empty();  // a denial, or no line matched
}

// Under one read share, the trees hold one whole version and the asked
// host's answer is that version's.
bool query_and_check(int n) {
    const std::string host = num(n % 2 ? "h" : "10.0.0.", n % 10);
    if (n % 4 == 0) return sec_is_in_any_cluster(host.c_str()) == 1;
    idm::clmap::MapHold hold(&idmutex);
    char **clusters = nullptr;
    int32_t count = 0;
    return sec__get_cluster_names(hold, host.c_str(), &clusters, &count) == 0 && vfile::tree_version() >= 0 &&
           count == 2 && vfile::clusters_of(host) == std::string(clusters[0]) + " " + clusters[1];
}

// For OXIDM_STRESS_SECONDS (default 1), and until each file had 30 versions
// and each kind of call 100 runs.
TEST_F(Stress, MappingAndClusterThreadsAgainstRewrittenFiles) {
    const double seconds = std::getenv("OXIDM_STRESS_SECONDS") ? std::atof(std::getenv("OXIDM_STRESS_SECONDS")) : 1;
    for (int m = 0; m < 4; ++m) ASSERT_EQ(sec_idm_register_translator(1, num("s", m).c_str(), mpm::translate, mpm::cleanup), 0);
    vfile::write(oxtest::kLocalMap, mpm::map_text('L', 0, 4, 6), 0);
    vfile::write(oxtest::kVarGlobalMap, mpm::map_text('G', 0, 4, 6), 0);
    vfile::write(oxtest::kNodeInfo, vfile::node_text(0), 0);
    std::atomic<bool> stop{false};
    std::atomic<long> calls[4] = {}, bad[2] = {};  // mappings, queries; map and node file versions
    std::vector<std::thread> all;
    for (int t = 0; t < 12; ++t)
        all.emplace_back([&, t] {
            for (int n = t, kind = t < 8 ? 0 : 1; !stop; ++n, ++calls[kind])
                bad[kind] += !(kind ? query_and_check(n) : map_and_check(t % 4, n));
        });
    all.emplace_back([&] {  // also the routines replaced while mappings run: each walk uses one pair
        for (int v = 1; !stop; ++v, ++calls[2], usleep(1000)) {
            vfile::write(oxtest::kLocalMap, mpm::map_text('L', v, 4, 6), v);
            vfile::write(oxtest::kVarGlobalMap, mpm::map_text('G', v, 4, 6), v);
            for (int m = 0; m < 4; ++m)
                EXPECT_EQ(sec_idm_register_translator(1, num("s", m).c_str(), v % 2 ? mpm::translate<'A'> : mpm::translate<'B'>,
                                                      v % 2 ? mpm::cleanup<'A'> : mpm::cleanup<'B'>), 0);
        }
    });
    all.emplace_back([&] {
        for (int v = 1; !stop; ++v, ++calls[3], usleep(1000)) vfile::write(oxtest::kNodeInfo, vfile::node_text(v), v);
    });
    const auto begin = std::chrono::steady_clock::now();
    auto elapsed = [&] { return std::chrono::duration<double>(std::chrono::steady_clock::now() - begin).count(); };
    while (elapsed() < seconds || calls[0] < 100 || calls[1] < 100 || calls[2] < 30 || calls[3] < 30) usleep(10000);
    stop = true;
    for (std::thread &t : all) t.join();
    for (int k = 0; k < 2; ++k) EXPECT_EQ(bad[k].load(), 0) << "wrong of " << calls[k] << " calls of kind " << k;
    EXPECT_EQ(mssx_locks_held(), 0);
    long cached = 0;
    for (int m = 0; m < 4; ++m) cached += idm__native_find_translator(num("s", m).c_str())->rule_count;
    EXPECT_EQ(mpm::ids_out.load(), 0) << "ids never given to the cleanup routine";
    EXPECT_EQ(mpm::rules_out.load(), cached) << "rules neither cached nor given to the cleanup routine";
}

// The first query's load is held as it begins, after it claimed the file's
// time; a second query of that time waits for it instead of answering from
// trees that load has not built.  Let go, the load answers both; cancelled,
// it withdraws its claim and the waiting query loads the file itself.
std::atomic<bool> g_hold{false};
std::atomic<int> g_loads{0};
TEST_F(Races, AQueryWaitsForTheLoadThatClaimedItsTime) {
    oxtest::set_trace_levels(0, 0, 0, 0, 1);
    // Held where the parse of a loaded text begins, cancellable only at
    // pthread_testcancel: a cancellation acted on inside a sleeping call
    // unwinds through the thread sanitizer's interceptor, which then loses
    // track of the lock's mutex.
    trx_on_record([](int id) {
        if (id == idm::tp::kNodeFileParsing && g_loads.fetch_add(1) == 0) for (; g_hold; sched_yield()) pthread_testcancel();
    });
    for (const int cancelled : {0, 1}) {
        SCOPED_TRACE(cancelled ? "load cancelled" : "load let go");
        vfile::write(oxtest::kNodeInfo, vfile::node_text(cancelled), cancelled);
        g_loads = 0;
        g_hold = true;
        std::atomic<int32_t> second{0};
        threads::Thread loader([] { (void)sec_is_in_any_cluster("h1"); });
        ASSERT_TRUE(threads::eventually([] { return g_loads > 0; }));
        std::thread waiter([&] { second = sec_is_in_any_cluster("h1"); });
        usleep(200000);  // long enough for an unguarded query to answer from the trees as they are
        EXPECT_EQ(second.load(), 0) << "answered while the load of its file's time was still running";
        g_hold = cancelled;
        EXPECT_EQ(loader.cancel(cancelled), bool(cancelled));
        waiter.join();
        EXPECT_EQ(second.load(), 1);
        EXPECT_EQ(g_loads.load(), 1 + cancelled) << "loads of the file";
        EXPECT_EQ(vfile::tree_version(), cancelled);
    }
    trx_on_record(nullptr);
}

}  // namespace
