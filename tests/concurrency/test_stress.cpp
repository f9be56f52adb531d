// Everything at once, for a bounded time: 16 threads map identities for 4
// mechanisms while both map files are rewritten, 8 threads query the
// cluster map while the node information file is rewritten, and 2 threads
// look up groups.  Every answer must come from one version of each file:
//   - map files: every line carries its file's version ("L<v>." in the
//     local file, "G<v>." in the global one); within one walk all local
//     rules must show one version and all global rules one version (a walk
//     over a list mixed from two reads of a file, or a rule cache left from
//     another version, shows two), the answer must name the version the
//     walk saw, and the global version can lag the local one by at most one
//     (the writer writes the local file first);
//   - node information: under one read share every host holds the clusters
//     of one version (each version has the same length, so even a load
//     that stats one version and reads the next parses a whole one);
//   - groups: the same list every time.
// The time is OXIDM_STRESS_SECONDS (default 2); scripts/harden-long.sh runs
// the long form, in which the resident memory must not grow after warm-up.
// Calls per second and memory are recorded as test properties and printed.
#include <pwd.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "harness.h"
#include "test_mpm.h"
#include "oxidm_clmap.h"
#include "oxidm_state.h"

namespace {

using oxtest::heap_copy;
using oxtest::num;

using Clock = std::chrono::steady_clock;

constexpr int kMechanisms = 4;
constexpr int kMappers = 16;
constexpr int kQueriers = 8;
constexpr int kGroupThreads = 2;
constexpr int kFiller = 6;  // entries before the matching one, per mechanism and file

double stress_seconds() {
    const char *s = std::getenv("OXIDM_STRESS_SECONDS");
    return s != nullptr ? std::atof(s) : 2.0;
}

// ---- map files and the version-checking translator ----

std::string mech(int m) { return num("s", m); }

// Local version v: per mechanism, kFiller entries, a denial, and "joe".
std::string local_text(int v) {
    std::string t = num("# local ", v) + "\n";
    for (int m = 0; m < kMechanisms; ++m) {
        for (int i = 0; i < kFiller; ++i) t += mech(m) + num(":L", v) + num(".a", i) + "=x\n";
        t += mech(m) + num(":!L", v) + ".eve\n";
        t += mech(m) + num(":L", v) + ".joe=" + mech(m) + num("l", v) + "\n";
    }
    return t;
}
// Global version v: per mechanism, kFiller entries and "ann".
std::string global_text(int v) {
    std::string t = num("# global ", v) + "\n";
    for (int m = 0; m < kMechanisms; ++m) {
        for (int i = 0; i < kFiller; ++i) t += mech(m) + num(":G", v) + num(".b", i) + "=y\n";
        t += mech(m) + num(":G", v) + ".ann=" + mech(m) + num("g", v) + "\n";
    }
    return t;
}

// What one walk saw: the version of the local and of the global rules.
struct Walk {
    long local = -1, global = -1;
    bool mixed = false;
};
thread_local Walk t_walk;

// "L<v>.<token>": the rule's registry is "L<v>" (the id's is made equal, so
// the registry always matches), its token <token>.
int32_t translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule, idm_id *id) {
    if (entry != nullptr) {
        const char *dot = std::strchr(entry->network_id, '.');
        if (dot == nullptr) return 5;
        rule->rgy_type = heap_copy("st");
        rule->rgy = heap_copy(entry->network_id, static_cast<size_t>(dot - entry->network_id));
        rule->token_cnt = 1;
        rule->tokens = oxtest::one_token(dot + 1);
        if (entry->local_id != nullptr) {
            rule->mapping = oxtest::mapping_of(entry->local_id);
        }
    }
    const long version = std::atol(rule->rgy + 1);
    long &seen = rule->rgy[0] == 'L' ? t_walk.local : t_walk.global;
    if (seen == -1) seen = version;
    else if (seen != version) t_walk.mixed = true;
    id->rgy_type = heap_copy("st");
    id->rgy = heap_copy(rule->rgy);
    id->token_cnt = 1;
    id->tokens = oxtest::one_token(network_id);
    return 0;
}

int32_t cleanup(idm_rule *rule, idm_id *id) { return oxtest::free_rule_and_id(rule, id); }

// One mapping and its judgement: true when consistent with one version of
// each file.
bool map_and_check(int m, int n) {
    static const char *const kWho[] = {"joe", "ann", "eve", "nobody"};
    const char *who = kWho[n % 4];
    t_walk = Walk{};
    idm_buffer local{};
    const int32_t status = sec_idm_map_identity(mech(m).c_str(), who, &local);
    std::string answer = local.value != nullptr ? local.value : "";
    std::free(local.value);
    const Walk w = t_walk;
    if (status != 0 || w.mixed) return false;
    if (w.local >= 0 && w.global >= 0 && w.global < w.local - 1) return false;
    const std::string prefix = mech(m);
    switch (n % 4) {
    case 0: return w.local >= 0 && answer == prefix + num("l", w.local);
    case 1: return w.global >= 0 && answer == prefix + num("g", w.global);
    default: return answer.empty();  // a denial, or no entry matched
    }
}

// ---- node information ----

constexpr int kHosts = 10;

std::string node_text(int v) {
    char number[16];
    std::snprintf(number, sizeof number, "%07d", v);
    std::string t;
    for (int h = 0; h < kHosts; ++h)
        t += num("NODE:\nNAME: h", h) + num("\nADDRESS: 10.0.0.", h) + "\nCLUSTER: v" +
             number + num(" m", v % 7) + "\n";
    return t;
}

// Under one read share: the host's answer, and every host of the trees, of
// one version.  Returns "" or what was wrong.
std::string query_and_check(int n) {
    const std::string host = num(n % 2 ? "h" : "10.0.0.", n % kHosts);
    auto failed = [&](const char *what) {
        oxtest::Error e = oxtest::last_error();
        std::string why = std::string(what) + " for " + host + " (last error on this thread " +
                          std::to_string(e.msgno) + "; trees " + std::to_string(nametree.rst_node_cnt) + "/" +
                          std::to_string(iptree.rst_node_cnt) + "; lastmod " +
                          std::to_string(__atomic_load_n(&lastmod, __ATOMIC_RELAXED)) + ")";
        oxtest::clear_errors();
        return why;
    };
    if (n % 4 == 0) return sec_is_in_any_cluster(host.c_str()) == 1 ? "" : failed("public query not 1");
    idm::clmap::MapHold hold(&idmutex);
    char **clusters = nullptr;
    int32_t count = 0;
    const int32_t status = sec__get_cluster_names(hold, host.c_str(), &clusters, &count);
    if (status != 0) return failed(("lookup status " + std::to_string(status)).c_str());
    if (count != 2) return failed("not two clusters");
    const int version = std::atoi(clusters[0] + 1);
    if (std::atoi(clusters[1] + 1) != version % 7) return failed("clusters of two versions");
    if (nametree.rst_node_cnt != kHosts || iptree.rst_node_cnt != kHosts) return failed("partial trees");
    const std::string other = num("h", (n + 3) % kHosts);
    idm_clnode probe{const_cast<char *>(other.c_str()), nullptr, 0};
    void *item = &probe;
    if (sec__rst_find(&nametree, &item) != 1) return failed("host missing");
    if (std::atoi(static_cast<idm_clnode *>(item)->clusters[0] + 1) != version) return failed("hosts of two versions");
    return "";
}

// ---- groups ----

std::vector<std::string> groups_of(const std::string &user, int32_t *status) {
    idm_buffer name{static_cast<uint32_t>(user.size() + 1), const_cast<char *>(user.c_str())};
    uint32_t count = 0;
    idm_buffer *list = nullptr;
    *status = sec_idm_get_groups(&name, &count, &list);
    std::vector<std::string> out;
    for (uint32_t i = 0; i < count; ++i) {
        out.emplace_back(list[i].value);
        std::free(list[i].value);
    }
    std::free(list);
    return out;
}

// ---- memory ----

long status_kb(const char *field) {
    std::ifstream f("/proc/self/status");
    std::string line;
    const size_t n = std::strlen(field);
    while (std::getline(f, line))
        if (line.compare(0, n, field) == 0) return std::atol(line.c_str() + n + 1);
    return -1;
}

constexpr bool kSanitized =
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
    true;
#else
    false;
#endif

class Stress : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
    }
};

TEST_F(Stress, MappingClusterAndGroupThreadsAgainstRewrittenFiles) {
    const double seconds = stress_seconds();
    for (int m = 0; m < kMechanisms; ++m)
        ASSERT_EQ(sec_idm_register_translator(1, mech(m).c_str(), translate, cleanup), 0);
    oxtest::write_file(oxtest::kLocalMap, local_text(0), 1000);
    oxtest::write_file(oxtest::kVarGlobalMap, global_text(0), 1000);
    oxtest::write_file(oxtest::kNodeInfo, node_text(0), 1000);
    const passwd *root = getpwuid(0);
    const std::string user = root != nullptr ? root->pw_name : "root";
    int32_t group_status = 0;
    const std::vector<std::string> groups = groups_of(user, &group_status);
    for (int m = 0; m < kMechanisms; ++m) ASSERT_TRUE(map_and_check(m, 0));
    // The first version is loaded before the threads start: a query that
    // finds a load under way answers from the trees as they were, which
    // before any load are empty.
    ASSERT_EQ(sec_is_in_any_cluster("h0"), 1);

    std::atomic<bool> stop{false};
    std::atomic<long> mappings{0}, queries{0}, lookups{0}, map_writes{0}, node_writes{0};
    std::atomic<long> bad_mappings{0}, bad_queries{0}, bad_lookups{0};
    std::mutex first_bad_mutex;
    std::string first_bad_query;
    std::vector<std::thread> threads;
    for (int t = 0; t < kMappers; ++t)
        threads.emplace_back([&, t] {
            for (int n = t; !stop.load(std::memory_order_relaxed); ++n) {
                if (!map_and_check(t % kMechanisms, n)) bad_mappings.fetch_add(1);
                mappings.fetch_add(1, std::memory_order_relaxed);
            }
        });
    for (int t = 0; t < kQueriers; ++t)
        threads.emplace_back([&, t] {
            for (int n = t; !stop.load(std::memory_order_relaxed); ++n) {
                if (std::string why = query_and_check(n); !why.empty()) {
                    if (bad_queries.fetch_add(1) == 0) {
                        std::lock_guard<std::mutex> lock(first_bad_mutex);
                        first_bad_query = why;
                    }
                }
                queries.fetch_add(1, std::memory_order_relaxed);
            }
        });
    for (int t = 0; t < kGroupThreads; ++t)
        threads.emplace_back([&] {
            while (!stop.load(std::memory_order_relaxed)) {
                int32_t status = -1;
                if (groups_of(user, &status) != groups || status != group_status) bad_lookups.fetch_add(1);
                lookups.fetch_add(1, std::memory_order_relaxed);
            }
        });
    // The writers: local file, then global file, of each version; and the
    // node information file.  Each version has its own modification time.
    threads.emplace_back([&] {
        for (int v = 1; !stop.load(); ++v) {
            oxtest::write_file(oxtest::kLocalMap, local_text(v), 1000 + v);
            oxtest::write_file(oxtest::kVarGlobalMap, global_text(v), 1000 + v);
            map_writes.fetch_add(1);
            usleep(2000);
        }
    });
    threads.emplace_back([&] {
        for (int v = 1; !stop.load(); ++v) {
            oxtest::write_file(oxtest::kNodeInfo, node_text(v), 1000 + v);
            node_writes.fetch_add(1);
            usleep(2000);
        }
    });

    // Steady state: memory sampled every second after a warm-up of a tenth
    // of the time (at least one second).
    const auto begin = Clock::now();
    const auto end = begin + std::chrono::duration<double>(seconds);
    const auto warm = begin + std::chrono::duration<double>(std::max(1.0, seconds / 10));
    long warm_rss = -1, last_rss = -1, peak_rss = -1;
    long warm_calls = 0;
    auto warm_time = begin;
    while (Clock::now() < end) {
        std::this_thread::sleep_for(std::chrono::milliseconds(std::min<long>(1000, static_cast<long>(seconds * 250))));
        last_rss = status_kb("VmRSS:");
        peak_rss = std::max(peak_rss, last_rss);
        if (warm_rss < 0 && Clock::now() >= warm) {
            warm_rss = last_rss;
            warm_calls = mappings.load() + queries.load() + lookups.load();
            warm_time = Clock::now();
        }
    }
    const long steady_calls = mappings.load() + queries.load() + lookups.load() - warm_calls;
    const double steady_seconds = std::chrono::duration<double>(Clock::now() - warm_time).count();
    stop.store(true);
    for (std::thread &t : threads) t.join();
    const double total = std::chrono::duration<double>(Clock::now() - begin).count();

    EXPECT_EQ(bad_mappings.load(), 0) << "of " << mappings.load() << " mappings";
    EXPECT_EQ(bad_queries.load(), 0) << "of " << queries.load() << " queries; first: " << first_bad_query;
    EXPECT_EQ(bad_lookups.load(), 0) << "of " << lookups.load() << " group lookups";
    EXPECT_GT(mappings.load(), 0);
    EXPECT_GT(queries.load(), 0);
    EXPECT_GT(lookups.load(), 0);
    EXPECT_GT(map_writes.load(), 0);
    EXPECT_GT(node_writes.load(), 0);
    EXPECT_EQ(mssx_locks_held(), 0);

    const long per_second = static_cast<long>((mappings.load() + queries.load() + lookups.load()) / total);
    RecordProperty("mappings_per_second", static_cast<int>(mappings.load() / total));
    RecordProperty("queries_per_second", static_cast<int>(queries.load() / total));
    RecordProperty("group_lookups_per_second", static_cast<int>(lookups.load() / total));
    RecordProperty("map_file_versions", static_cast<int>(map_writes.load()));
    RecordProperty("node_file_versions", static_cast<int>(node_writes.load()));
    RecordProperty("rss_warm_kb", static_cast<int>(warm_rss));
    RecordProperty("rss_end_kb", static_cast<int>(last_rss));
    RecordProperty("rss_peak_kb", static_cast<int>(peak_rss));
    std::printf("stress: %.0f s; %ld calls/s (%ld mappings, %ld queries, %ld group lookups; steady %.0f calls/s); "
                "%ld map file and %ld node file versions; RSS warm %ld kB, end %ld kB, peak %ld kB, HWM %ld kB\n",
                total, per_second, mappings.load(), queries.load(), lookups.load(),
                steady_seconds > 0 ? steady_calls / steady_seconds : 0.0, map_writes.load(), node_writes.load(),
                warm_rss, last_rss, peak_rss, status_kb("VmHWM:"));
    // In the long form, the resident memory levels off: after warm-up it may
    // move by allocator noise, not grow with the number of calls.  (The
    // sanitizers keep freed memory in quarantine; their figures say nothing.)
    if (seconds >= 60 && !kSanitized) {
        EXPECT_LE(last_rss, warm_rss + warm_rss / 10 + 4096) << "resident memory grew after warm-up";
    }
}

}  // namespace
