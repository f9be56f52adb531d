// Cluster membership family, measured in the private namespace on
// /var/ox/cfg/oxsec.nodeinfo.  The queries go to the shipped libox_idm.so
// (loaded with dlopen from the build tree), so that the figures are those of
// the library callers get, without the fault-injection seam of the internal
// archive; the tree figures use the archive's routines.
//   - a query while the file is unchanged, next to one bare stat() of the
//     same file (the floor: an unchanged query costs one stat plus the read
//     share and one tree search);
//   - lookups of random hosts (names and addresses) in a file of 100,000
//     hosts, and the reload of that file (stat, open, one read, parse,
//     emptying the old trees and building the new ones);
//   - the search tree itself, holding the library's records of 100,000
//     keys, next to std::set<std::string> on the same keys, inserted in file
//     order and searched at random.
#include <benchmark/benchmark.h>
#include <dlfcn.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <cstdio>
#include <fstream>
#include <climits>
#include <unistd.h>
#include <random>
#include <set>
#include <string>
#include <vector>

#include "namespace.h"
#include "oxidm.h"
#include "oxidm_clmap.h"
#include "oxidm_state.h"

namespace {

constexpr const char kPath[] = "/var/ox/cfg/oxsec.nodeinfo";
constexpr int kLargeHosts = 100000;

std::string host_name(int i) {
    char b[32];
    std::snprintf(b, sizeof b, "node%06d.example.net", i);
    return b;
}
std::string host_address(int i) {
    char b[32];
    std::snprintf(b, sizeof b, "10.%d.%d.%d", i >> 16, (i >> 8) & 255, i & 255);
    return b;
}

std::string nodeinfo(int hosts) {
    std::string t = "# generated: " + std::to_string(hosts) + " hosts\n";
    t.reserve(static_cast<size_t>(hosts) * 80);
    for (int i = 0; i < hosts; ++i) {
        t += "NODE:\n  NAME: " + host_name(i) + "\n  ADDRESS: " + host_address(i) + "\n  CLUSTER: clA cl" +
             std::to_string(i % 50) + "\n";
    }
    return t;
}

// The exported queries of the shipped library.
int32_t (*g_any)(const char *) = nullptr;
int32_t (*g_active)(const char *) = nullptr;

bool load_shipped_library() {
    char exe[PATH_MAX];
    ssize_t n = readlink("/proc/self/exe", exe, sizeof exe - 1);
    if (n <= 0) return false;
    exe[n] = '\0';
    std::string dir(exe);
    dir.erase(dir.rfind('/'));
    const std::string path = dir + "/../security/IDM/lib/libox_idm.so.1";
    void *lib = dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL);
    if (lib == nullptr) {
        std::fprintf(stderr, "bench_cluster: %s\n", dlerror());
        return false;
    }
    g_any = reinterpret_cast<int32_t (*)(const char *)>(dlsym(lib, "sec_is_in_any_cluster"));
    g_active = reinterpret_cast<int32_t (*)(const char *)>(dlsym(lib, "sec_is_in_active_cluster"));
    return g_any != nullptr && g_active != nullptr;
}

void set_mtime(time_t mtime) {
    struct timespec t[2] = {{mtime, 0}, {mtime, 0}};
    utimensat(AT_FDCWD, kPath, t, 0);
}

// Writes the file (when another size is asked for) and loads it once.
void install(int hosts) {
    static int installed = -1;
    if (installed == hosts) return;
    std::string tmp = std::string(kPath) + ".tmp";
    {
        std::ofstream out(tmp, std::ios::binary | std::ios::trunc);
        out << nodeinfo(hosts);
    }
    std::rename(tmp.c_str(), kPath);
    set_mtime(1000 + hosts);
    if (g_any(host_name(0).c_str()) != 1) std::fprintf(stderr, "bench_cluster: load failed\n");
    installed = hosts;
}

void BM_cluster_stat(benchmark::State &state) {
    install(10);
    struct stat st;
    for (auto _ : state) benchmark::DoNotOptimize(::stat(kPath, &st));
}
BENCHMARK(BM_cluster_stat);

void BM_cluster_query_unchanged(benchmark::State &state) {
    install(10);
    const std::string host = host_name(3);
    for (auto _ : state) benchmark::DoNotOptimize(g_any(host.c_str()));
}
BENCHMARK(BM_cluster_query_unchanged);

void BM_cluster_active_unchanged(benchmark::State &state) {
    install(10);
    cux_set_active_cluster("cl3");
    const std::string host = host_name(3);
    for (auto _ : state) benchmark::DoNotOptimize(g_active(host.c_str()));
    cux_set_active_cluster(nullptr);
}
BENCHMARK(BM_cluster_active_unchanged);

void BM_cluster_stat_100k(benchmark::State &state) {
    install(kLargeHosts);
    struct stat st;
    for (auto _ : state) benchmark::DoNotOptimize(::stat(kPath, &st));
}
BENCHMARK(BM_cluster_stat_100k);

// Random names and addresses, a tenth of them not listed.
void BM_cluster_lookup_100k(benchmark::State &state) {
    install(kLargeHosts);
    std::mt19937 rng(42);
    std::vector<std::string> hosts;
    for (int i = 0; i < 4096; ++i) {
        int h = static_cast<int>(rng() % (kLargeHosts + kLargeHosts / 10));
        hosts.push_back(i % 2 ? host_name(h) : host_address(h));
    }
    size_t i = 0, found = 0;
    for (auto _ : state) {
        found += g_any(hosts[i++ & 4095].c_str()) == 1;
    }
    state.counters["found"] = static_cast<double>(found) / static_cast<double>(state.iterations());
}
BENCHMARK(BM_cluster_lookup_100k);

// Each iteration gives the file another modification time (one utimensat),
// so the query reloads it in full.
void BM_cluster_reload_100k(benchmark::State &state) {
    install(kLargeHosts);
    struct stat st;
    ::stat(kPath, &st);
    time_t mtime = st.st_mtime;
    for (auto _ : state) {
        set_mtime(++mtime);
        benchmark::DoNotOptimize(g_any("node000001.example.net"));
    }
    state.counters["bytes"] = static_cast<double>(st.st_size);
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) * st.st_size);
}
BENCHMARK(BM_cluster_reload_100k)->Unit(benchmark::kMillisecond);

// ---- the tree next to std::set<std::string> ----

int compare_keys(const void *a, const void *b) {
    return std::strcmp(static_cast<const idm_clnode *>(a)->key, static_cast<const idm_clnode *>(b)->key);
}
void keep(void *) {}

// The stored objects are the library's records (idm__getnode: the key in
// the record's block), the probes the lookup's (a key elsewhere).
struct Keys {
    std::vector<std::string> text;
    std::vector<idm_clnode *> nodes;
    std::vector<int> probes;  // random indices
    Keys() {
        for (int i = 0; i < kLargeHosts; ++i) text.push_back(host_name(i));
        char cluster[] = "clA";
        char *clusters[] = {cluster};
        for (auto &t : text) {
            idm_clnode *n = nullptr;
            idm__getnode(t.c_str(), clusters, 1, &n);
            nodes.push_back(n);
        }
        std::mt19937 rng(7);
        for (int i = 0; i < 8192; ++i) probes.push_back(static_cast<int>(rng() % kLargeHosts));
    }
};
Keys &keys() {
    static Keys k;
    return k;
}

void BM_tree_insert_100k(benchmark::State &state) {
    Keys &k = keys();
    for (auto _ : state) {
        rst_tree tree{};
        sec__rst_init(&tree, compare_keys, keep);
        for (idm_clnode *n : k.nodes) {
            void *item = n;
            sec__rst_insert(&tree, &item);
        }
        benchmark::DoNotOptimize(tree.rst_node_cnt);
        state.PauseTiming();
        sec__rst_clean(&tree);
        state.ResumeTiming();
    }
}
BENCHMARK(BM_tree_insert_100k)->Unit(benchmark::kMillisecond);

void BM_set_insert_100k(benchmark::State &state) {
    const Keys &k = keys();
    for (auto _ : state) {
        auto *set = new std::set<std::string>;
        for (const auto &t : k.text) set->insert(t);
        benchmark::DoNotOptimize(set->size());
        state.PauseTiming();
        delete set;
        state.ResumeTiming();
    }
}
BENCHMARK(BM_set_insert_100k)->Unit(benchmark::kMillisecond);

void BM_tree_find_100k(benchmark::State &state) {
    Keys &k = keys();
    rst_tree tree{};
    sec__rst_init(&tree, compare_keys, keep);
    for (idm_clnode *n : k.nodes) {
        void *item = n;
        sec__rst_insert(&tree, &item);
    }
    std::vector<idm_clnode> probes;
    for (int p : k.probes) probes.push_back({k.text[p].data(), nullptr, 0});
    size_t i = 0;
    for (auto _ : state) {
        void *item = &probes[i++ & 8191];
        benchmark::DoNotOptimize(sec__rst_find(&tree, &item));
    }
    sec__rst_clean(&tree);
}
BENCHMARK(BM_tree_find_100k);

void BM_set_find_100k(benchmark::State &state) {
    const Keys &k = keys();
    std::set<std::string> set(k.text.begin(), k.text.end());
    std::vector<std::string> probes;
    for (int p : k.probes) probes.push_back(k.text[p]);
    size_t i = 0;
    for (auto _ : state) benchmark::DoNotOptimize(set.find(probes[i++ & 8191]));
}
BENCHMARK(BM_set_find_100k);

void BM_tree_delete_100k(benchmark::State &state) {
    Keys &k = keys();
    for (auto _ : state) {
        state.PauseTiming();
        rst_tree tree{};
        sec__rst_init(&tree, compare_keys, keep);
        for (idm_clnode *n : k.nodes) {
            void *item = n;
            sec__rst_insert(&tree, &item);
        }
        state.ResumeTiming();
        for (int p : k.probes) {
            idm_clnode probe{k.text[p].data(), nullptr, 0};
            void *item = &probe;
            sec__rst_delete(&tree, &item);
        }
        state.PauseTiming();
        sec__rst_clean(&tree);
        state.ResumeTiming();
    }
}
BENCHMARK(BM_tree_delete_100k)->Unit(benchmark::kMicrosecond);

void BM_set_delete_100k(benchmark::State &state) {
    const Keys &k = keys();
    for (auto _ : state) {
        state.PauseTiming();
        auto *set = new std::set<std::string>(k.text.begin(), k.text.end());
        state.ResumeTiming();
        for (int p : k.probes) set->erase(k.text[p]);
        state.PauseTiming();
        delete set;
        state.ResumeTiming();
    }
}
BENCHMARK(BM_set_delete_100k)->Unit(benchmark::kMicrosecond);

}  // namespace

int main(int argc, char **argv) {
    if (!oxtest::enter_private_namespace()) {
        std::fprintf(stderr, "bench_cluster: no private mount namespace; skipped\n");
        return 0;
    }
    if (!load_shipped_library()) return 1;
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
