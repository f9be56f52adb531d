// Threads cancelled at random moments: a mapping thread while the map files
// are rewritten under it (so the cancellation lands in the MPM's translator
// or cleanup routine, in the reading pass, or while a file is opened or
// read), and cluster query threads while the node information file is
// rewritten and a writer takes the lock now and then (so it lands while a
// query waits as a reader, promotes, demotes, or reads the file; and writers
// are cancelled while they wait too); and a query cancelled in its
// demotion behind a writer.  After each batch every lock is free,
// no file lock or descriptor is left, nothing leaked, and the next calls
// give the right answers.
#include <pthread.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <memory>
#include <random>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "../unit/test_sweep.h"
#include "harness.h"
#include "test_mpm.h"
#include "oxidm_clmap.h"
#include "oxidm_state.h"
#include "test_cluster_threads.h"

namespace {

using oxtest::num;

using cluster_test::Thread;

// Iterations of each cancellation loop: more in the long form.
int iterations() {
    const char *s = std::getenv("OXIDM_CANCEL_ITERATIONS");
    return s != nullptr ? std::atoi(s) : 150;
}

// ---- a translator that allocates nothing, with cancellation points ----
//
// Rules point at static texts chosen by the entry's identifiers (built
// before any thread starts, read-only afterwards), ids at the caller's text
// through a per-thread array: a routine cancelled half-way leaks nothing of
// its own, so any leak is the library's.

struct StaticRule {
    char *token[1];
    idm_buffer mapping;
};
// By network identifier, then local identifier ("" for a denial).
std::map<std::string, std::map<std::string, std::unique_ptr<StaticRule>, std::less<>>, std::less<>> g_rules;
std::map<std::string, std::unique_ptr<std::string>> g_texts;
char g_type[] = "rc", g_rgy[] = "R";

char *text(const std::string &s) {
    auto &slot = g_texts[s];
    if (!slot) slot = std::make_unique<std::string>(s);
    return slot->data();
}

void add_rule(const std::string &network, const std::string &local) {
    auto r = std::make_unique<StaticRule>();
    r->token[0] = text(network);
    r->mapping = {static_cast<uint32_t>(local.size() + 1), text(local)};
    g_rules[network][local] = std::move(r);
}

// The rule of an entry, found without allocating; null for a stranger.
StaticRule *rule_of(const idm_mapfile_entry *entry) {
    auto by_network = g_rules.find(std::string_view(entry->network_id));
    if (by_network == g_rules.end()) return nullptr;
    auto by_local = by_network->second.find(std::string_view(entry->local_id != nullptr ? entry->local_id : ""));
    return by_local == by_network->second.end() ? nullptr : by_local->second.get();
}

enum Where { kLibrary = 0, kTranslator, kCleanup };
thread_local bool t_victim = false;
std::atomic<int> g_where{kLibrary};

void cancellation_point(Where where) {
    if (t_victim) g_where.store(where);
    pthread_testcancel();
    if (t_victim) g_where.store(kLibrary);
}

int32_t translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule, idm_id *id) {
    thread_local char *id_token[1];
    cancellation_point(kTranslator);
    if (entry != nullptr) {
        StaticRule *r = rule_of(entry);
        if (r == nullptr) return 5;  // not one of ours: passed over
        rule->rgy_type = g_type;
        rule->rgy = g_rgy;
        rule->token_cnt = 1;
        rule->tokens = r->token;
        rule->mapping = entry->kind == IDM_ENTRY_DENIAL ? nullptr : &r->mapping;
    }
    id_token[0] = const_cast<char *>(network_id);
    id->rgy_type = g_type;
    id->rgy = g_rgy;
    id->token_cnt = 1;
    id->tokens = id_token;
    cancellation_point(kTranslator);
    return 0;
}
int32_t cleanup(idm_rule *, idm_id *) {
    cancellation_point(kCleanup);
    return 0;
}

// Version v of the files: 150 local and 150 global entries that do not
// match "joe", then "joe" in the global file mapped to "j<v>".
constexpr int kLines = 150;
std::string local_file(int v) {
    std::string t;
    for (int i = 0; i < kLines; ++i) t += num("rc:u", i) + num("=l", v % 2) + "\n";
    return t;
}
std::string global_file(int v) {
    std::string t;
    for (int i = 0; i < kLines; ++i) t += num("rc:g", i) + "=x\nother:joe=nobody\n";
    return t + num("rc:joe=j", v % 2) + "\n";
}

std::string map_joe() {
    idm_buffer local{};
    const int32_t status = sec_idm_map_identity("rc", "joe", &local);
    std::string answer = status == 0 && local.value != nullptr ? local.value : num("status ", status);
    std::free(local.value);
    return answer;
}

class CancelRandom : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
    }
};

TEST_F(CancelRandom, MappingThreadsInTheMpmAndTheReadingPass) {
    for (int i = 0; i < kLines; ++i) {
        add_rule(num("u", i), "l0");
        add_rule(num("u", i), "l1");
        add_rule(num("g", i), "x");
    }
    add_rule("joe", "j0");
    add_rule("joe", "j1");
    ASSERT_EQ(sec_idm_register_translator(1, "rc", translate, cleanup), 0);
    oxtest::write_file(oxtest::kLocalMap, local_file(0), 1000);
    oxtest::write_file(oxtest::kVarGlobalMap, global_file(0), 1000);
    ASSERT_EQ(map_joe(), "j0");
    const int descriptors = oxtest::open_descriptors();

    // The files change under the mappings all the time.
    std::atomic<bool> stop{false};
    std::atomic<int> version{0};
    std::thread rewriter([&] {
        for (int v = 1; !stop.load(); ++v) {
            oxtest::write_file(v % 2 ? oxtest::kLocalMap : oxtest::kVarGlobalMap, v % 2 ? local_file(v) : global_file(v),
                               1000 + v);
            version.store(v);
            usleep(300);
        }
    });
    // A mapping thread that is never cancelled keeps getting answers.
    std::atomic<long> peaceful{0};
    std::atomic<int> wrong{0};
    std::thread bystander([&] {
        while (!stop.load()) {
            const std::string a = map_joe();
            if (a != "j0" && a != "j1") wrong.fetch_add(1);
            peaceful.fetch_add(1);
        }
    });

    std::mt19937 random(12345);
    int where[3] = {0, 0, 0};
    for (int i = 0; i < iterations(); ++i) {
        g_where.store(kLibrary);
        Thread victim([] {
            t_victim = true;
            for (;;) (void)map_joe();
        });
        usleep(std::uniform_int_distribution<int>(0, 3000)(random));
        victim.cancel();
        ASSERT_TRUE(victim.join());
        ++where[g_where.load()];
    }
    // Progress, not speed: under a sanitizer on a loaded machine one call
    // that re-reads both files can take a good part of a second.
    const long before = peaceful.load();
    for (int ms = 0; ms < 10000 && peaceful.load() == before; ms += 10) usleep(10000);
    EXPECT_GT(peaceful.load(), before) << "the thread that was never cancelled made no progress";
    stop.store(true);
    rewriter.join();
    bystander.join();

    EXPECT_EQ(wrong.load(), 0);
    RecordProperty("cancelled_in_translator", where[kTranslator]);
    RecordProperty("cancelled_in_cleanup", where[kCleanup]);
    RecordProperty("cancelled_in_library", where[kLibrary]);
    EXPECT_GT(where[kTranslator] + where[kCleanup], 0) << "no cancellation landed inside the MPM";

    idm_translator *record = idm__native_find_translator("rc");
    ASSERT_NE(record, nullptr);
    EXPECT_TRUE(sweep::unlocked(&record->mutex));
    EXPECT_TRUE(sweep::unlocked(&idm__native_state.mutex));
    EXPECT_EQ(mssx_locks_held(), 0);
    EXPECT_EQ(oxtest::open_descriptors(), descriptors);
    // The last version is in force.
    const int v = version.load() + 1;
    oxtest::write_file(oxtest::kVarGlobalMap, global_file(v), 900000);
    EXPECT_EQ(map_joe(), num("j", v % 2));
    EXPECT_TRUE(sweep::no_leaks());
}

// ---- cluster queries ----

// Version v: hosts h0..h9 and addresses 10.0.0.0..9, clusters "v<v>" and
// "m<v % 7>" each.  Every version has the same length, so that a load that
// stats one version and reads the next still parses a whole version.
std::string node_text(int v) {
    char number[16];
    std::snprintf(number, sizeof number, "%07d", v);
    std::string t;
    for (int h = 0; h < 10; ++h)
        t += num("NODE:\nNAME: h", h) + num("\nADDRESS: 10.0.0.", h) + "\nCLUSTER: v" +
             number + num(" m", v % 7) + "\n";
    return t;
}

struct Counts {
    int32_t lock_count;
    uint32_t waiting_writers;
};
Counts counts() {
    pthread_mutex_lock(&idmutex.mutex);
    Counts c{idmutex.lock_count, idmutex.waiting_writers};
    pthread_mutex_unlock(&idmutex.mutex);
    return c;
}

// What a thread is blocked on right now: 1 readers_ok, 2 writer_ok, 0 other.
int blocked_kind(pid_t tid) {
    std::ifstream f(num("/proc/self/task/", tid) + "/syscall");
    long nr = -1;
    std::string arg;
    if (!(f >> nr >> arg) || nr != SYS_futex) return 0;
    const uintptr_t a = std::stoull(arg, nullptr, 16);
    auto inside = [a](const pthread_cond_t &c) {
        const auto b = reinterpret_cast<uintptr_t>(&c);
        return a >= b && a < b + sizeof c;
    };
    return inside(idmutex.readers_ok) ? 1 : inside(idmutex.writer_ok) ? 2 : 0;
}

TEST_F(CancelRandom, ClusterQueriesAndWritersWhileTheFileChanges) {
    pthread_once(&idm__init_once_block, idm__state_init);
    oxtest::write_file(oxtest::kNodeInfo, node_text(0), 1000);
    cux_set_active_cluster("m0");
    ASSERT_EQ(sec_is_in_any_cluster("h1"), 1);
    const int descriptors = oxtest::open_descriptors();

    std::atomic<bool> stop{false};
    std::atomic<int> version{0};
    std::thread rewriter([&] {
        for (int v = 1; !stop.load(); ++v) {
            oxtest::write_file(oxtest::kNodeInfo, node_text(v), 1000 + v);
            version.store(v);
            usleep(200);
        }
    });
    // A writer that holds the lock briefly now and then, so that queries wait
    // as readers and demoting reloads wait behind it.
    std::thread writer([&] {
        while (!stop.load()) {
            sec__lock_write(&idmutex);
            usleep(50);
            sec__unlock_write(&idmutex);
            usleep(300);
        }
    });

    std::mt19937 random(54321);
    int blocked_on[3] = {0, 0, 0};  // other, readers_ok, writer_ok
    int bad_answers = 0;
    std::atomic<int> wrong{0};
    for (int i = 0; i < iterations(); ++i) {
        const int kind = i % 4;
        Thread victim([kind, &wrong] {
            for (int n = 0;; ++n) {
                const std::string host = num(n % 2 ? "h" : "10.0.0.", n % 10);
                switch (kind) {
                case 0:
                    if (sec_is_in_any_cluster(host.c_str()) != 1) wrong.fetch_add(1);
                    break;
                case 1:
                    (void)sec_is_in_active_cluster(host.c_str());
                    break;
                case 2: {
                    idm::clmap::MapHold hold(&idmutex);
                    char **clusters = nullptr;
                    int32_t count = 0;
                    if (sec__get_cluster_names(hold, host.c_str(), &clusters, &count) != 0 || count != 2 ||
                        clusters[0][0] != 'v' || std::atoi(clusters[0] + 1) % 7 != std::atoi(clusters[1] + 1))
                        wrong.fetch_add(1);
                    break;
                }
                default:  // a writer of its own
                    sec__lock_write(&idmutex);
                    sec__unlock_write(&idmutex);
                    pthread_testcancel();
                    break;
                }
            }
        });
        usleep(std::uniform_int_distribution<int>(0, 2000)(random));
        ++blocked_on[blocked_kind(victim.tid())];
        victim.cancel();
        ASSERT_TRUE(victim.join());
    }
    stop.store(true);
    rewriter.join();
    writer.join();
    bad_answers = wrong.load();

    EXPECT_EQ(bad_answers, 0);
    RecordProperty("blocked_on_readers_ok", blocked_on[1]);
    RecordProperty("blocked_on_writer_ok", blocked_on[2]);
    RecordProperty("running", blocked_on[0]);
    const Counts c = counts();
    EXPECT_EQ(c.lock_count, 0);
    EXPECT_EQ(c.waiting_writers, 0u);
    EXPECT_EQ(oxtest::open_descriptors(), descriptors);
    // The next query loads the last version, whatever a cancelled load left.
    const int v = version.load() + 1;
    oxtest::write_file(oxtest::kNodeInfo, node_text(v), 900000);
    idm::clmap::MapHold hold(&idmutex);
    char **clusters = nullptr;
    int32_t count = 0;
    ASSERT_EQ(sec__get_cluster_names(hold, "h3", &clusters, &count), 0);
    ASSERT_EQ(count, 2);
    EXPECT_EQ(std::atoi(clusters[0] + 1), v);
    EXPECT_EQ(nametree.rst_node_cnt, 10u);
    EXPECT_EQ(iptree.rst_node_cnt, 10u);
    EXPECT_TRUE(sweep::no_leaks());
}

// A query whose reload is done and which waits, in its demotion, behind a
// writer: cancelled there it holds nothing, the writer goes on, and the
// trees it built stay.  Which of the promoting query and the writer the
// last reader's signal wakes is up to the condition variable, so the
// scenario is repeated until the query was the one (almost always at once).
TEST_F(CancelRandom, AQueryCancelledWhileItDemotesBehindAWriter) {
    pthread_once(&idm__init_once_block, idm__state_init);
    oxtest::write_file(oxtest::kNodeInfo, node_text(0), 1000);
    ASSERT_EQ(sec_is_in_any_cluster("h1"), 1);
    const auto settle = [](pid_t tid) {
        for (int i = 0; i < 300000; ++i) {
            if (int kind = blocked_kind(tid)) return kind;
            usleep(100);
        }
        return 0;
    };
    bool done = false;
    for (int attempt = 1; attempt <= 20 && !done; ++attempt) {
        oxtest::write_file(oxtest::kNodeInfo, node_text(attempt), 1000 + attempt);
        sec__lock_read(&idmutex);  // the query's promotion waits for this share
        Thread query([] { (void)sec_is_in_any_cluster("h1"); });
        ASSERT_TRUE(cluster_test::blocked_on(query.tid(), idmutex.writer_ok));
        std::atomic<bool> holding{false}, release{false};
        Thread writer([&] {
            sec__lock_write(&idmutex);
            holding.store(true);
            while (!release.load()) usleep(100);
            sec__unlock_write(&idmutex);
        });
        while (counts().waiting_writers != 2) usleep(100);
        sec__unlock_read(&idmutex);
        ASSERT_TRUE(cluster_test::eventually(holding));
        const int kind = settle(query.tid());
        if (kind == 1) {  // rebuilt, demoting, behind the writer
            query.cancel();
            EXPECT_TRUE(query.join());
            const Counts c = counts();
            EXPECT_EQ(c.lock_count, -1) << "only the writer holds the lock";
            EXPECT_EQ(c.waiting_writers, 0u);
            done = true;
        }
        release.store(true);
        writer.join();
        if (!done) query.join();  // the writer went first: the query finishes
    }
    ASSERT_TRUE(done) << "the query never reached its demotion behind the writer";
    const Counts c = counts();
    EXPECT_EQ(c.lock_count, 0);
    EXPECT_EQ(c.waiting_writers, 0u);
    // The cancelled query's reload stands; the next query needs no reload.
    EXPECT_EQ(nametree.rst_node_cnt, 10u);
    idm::clmap::MapHold hold(&idmutex);
    char **clusters = nullptr;
    int32_t count = 0;
    ASSERT_EQ(sec__get_cluster_names(hold, "h1", &clusters, &count), 0);
    EXPECT_GT(std::atoi(clusters[0] + 1), 0);
    EXPECT_TRUE(sweep::no_leaks());
}

}  // namespace
