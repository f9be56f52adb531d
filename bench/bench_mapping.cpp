// Mapping family: sec_idm_map_identity with the sample host-based plug-in
// and a local map file of N lines (N = 1, 100, 10,000) whose last line is the
// one that matches, next to
//   - three bare stat() calls on the three map file paths: what an unchanged
//     request must cost at least (the change test looks at each file once);
//   - the plug-in's own work per cached entry: one id translation and its
//     cleanup, as the walk calls them for a cached rule;
//   - the error facility's cost for the token mismatch that each passed-over
//     entry reports (2650-666 through libox_cu);
//   - the first call after a change: re-reading the file, dropping the old
//     rule cache and translating every line anew.
// The library's own cost per cached entry is derived inside one benchmark
// from back-to-back measurements of the same run: (walk of 10,000 lines -
// walk of 1 line - the plug-in calls of 9,999 lines, made the same way) /
// 9,999, reported once with and once without the error facility's time
// (each passed-over line reports its token mismatch).  BM_budget_50ns is a constant
// 50 ns, the baseline for that figure's target.
//
// Runs in a private mount namespace (oxtest::enter_private_namespace), so the
// map files live on tmpfs mounts that only this process sees.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <time.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>

#include "namespace.h"
#include "oxidm.h"
#include "oxidm_state.h"
#include "oxidm_natmap.h"
#include "oxmpm_host.h"

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kLarge = 10000;
int64_t g_mtime = 1'000'000;  // modification times long past, new for each file version

void set_mtime(const char *path, int64_t mtime) {
    struct timespec times[2] = {{mtime, 0}, {mtime, 0}};
    if (utimensat(AT_FDCWD, path, times, 0) != 0) {
        std::perror(path);
        std::exit(1);
    }
}

std::string identity(int n) { return "user" + std::to_string(n) + "@node1"; }

// Local map file: N "host" lines, the N-th matching identity(N); and one
// "hostone" line matching identity(kLarge) at once.
void write_map_file(int n) {
    std::string text;
    text.reserve(static_cast<size_t>(n) * 40);
    for (int i = 1; i <= n; ++i)
        text.append("host:user").append(std::to_string(i)).append("@node1=local").append(std::to_string(i)).append("\n");
    text.append("hostone:").append(identity(kLarge)).append("=one\n");
    std::string tmp = std::string(oxtest::kLocalMap) + ".tmp";
    {
        std::ofstream out(tmp, std::ios::binary | std::ios::trunc);
        out << text;
    }
    if (std::rename(tmp.c_str(), oxtest::kLocalMap) != 0) {
        std::perror(oxtest::kLocalMap);
        std::exit(1);
    }
    set_mtime(oxtest::kLocalMap, g_mtime += 10);
}

bool map_once(const char *mnemonic, const std::string &id, const char *expected) {
    idm_buffer local{};
    int32_t status = sec_idm_map_identity(mnemonic, id.c_str(), &local);
    bool ok = status == 0 && local.value != nullptr && std::string(local.value) == expected;
    std::free(local.value);
    return ok;
}

// Installs a file of n lines and walks it once for each mechanism, so that
// every rule is cached and the next calls take the unchanged path.
int g_prepared = -1;
bool prepare(int n) {
    if (g_prepared == n) return true;
    write_map_file(n);
    g_prepared = n;
    std::string local = "local" + std::to_string(n);
    return map_once("host", identity(n), local.c_str()) && map_once("hostone", identity(kLarge), "one") &&
           map_once("host", identity(n), local.c_str());
}

void BM_map_unchanged(benchmark::State &state) {
    int n = static_cast<int>(state.range(0));
    if (!prepare(n)) return state.SkipWithError("mapping failed");
    std::string id = identity(n);
    for (auto _ : state) {
        idm_buffer local{};
        benchmark::DoNotOptimize(sec_idm_map_identity("host", id.c_str(), &local));
        std::free(local.value);
    }
    state.counters["entries"] = n;
}

void BM_stat3(benchmark::State &state) {
    const char *paths[3] = {oxtest::kLocalMap, oxtest::kVarGlobalMap, oxtest::kOptGlobalMap};
    struct stat st;
    for (auto _ : state)
        for (const char *p : paths) benchmark::DoNotOptimize(stat(p, &st));
}

// The cached rule of the file's last line, as the walk hands it over.
const idm_rule *cached_rule(const char *mnemonic, int position) {
    idm_translator *t = idm__native_find_translator(mnemonic);
    if (t == nullptr || position > t->entry_count) return nullptr;
    int32_t k = t->entries[position - 1].rule_index;
    return k > 0 ? &t->rules[k - 1] : nullptr;
}

// One id translation with its cleanup, as for a cached rule.
void BM_host_translator(benchmark::State &state) {
    if (!prepare(kLarge)) return state.SkipWithError("mapping failed");
    idm_rule rule = *cached_rule("host", kLarge);
    std::string id_text = identity(kLarge);
    for (auto _ : state) {
        idm_id id{};
        benchmark::DoNotOptimize(oxmpm_host_translate(nullptr, id_text.c_str(), &rule, &id));
        oxmpm_host_cleanup(nullptr, &id);
    }
}

// The report each passed-over entry makes.
void BM_report_token_mismatch(benchmark::State &state) {
    for (auto _ : state) benchmark::DoNotOptimize(idm::report(idm::kRuleInvalid, idm::kMsg666, "user17", "user10000"));
}

// Thread CPU time: the derived figures subtract measurements from one
// another, and on a shared machine wall time would add whatever other
// processes took in between.
int64_t cpu_now() {
    struct timespec ts;
    clock_gettime(CLOCK_THREAD_CPUTIME_ID, &ts);
    return static_cast<int64_t>(ts.tv_sec) * 1'000'000'000 + ts.tv_nsec;
}

// What the walk of the first kWalked cached lines calls outside the library,
// in the walk's own order and memory: the plug-in's translator and cleanup
// for each cached rule and, when `reports`, the mismatch report that each
// line makes through libox_cu.
constexpr int kWalked = kLarge - 1;
void outside_calls(const idm_translator *t, const char *id_text, bool reports) {
    for (int i = 0; i < kWalked; ++i) {
        idm_rule *rule = &t->rules[t->entries[i].rule_index - 1];
        idm_id id{};
        benchmark::DoNotOptimize(oxmpm_host_translate(nullptr, id_text, rule, &id));
        if (reports) benchmark::DoNotOptimize(idm::report(idm::kRuleInvalid, idm::kMsg666, rule->tokens[0], id.tokens[0]));
        oxmpm_host_cleanup(nullptr, &id);
    }
}

// Library time per cached line walked, derived in each iteration from the
// same moment's walk of 10,000 lines, walk of 1 line, and the calls the walk
// makes outside the library (with or without the reports).
void library_per_entry(benchmark::State &state, bool without_reports) {
    if (!prepare(kLarge)) return state.SkipWithError("mapping failed");
    const idm_translator *t = idm__native_find_translator("host");
    std::string id_text = identity(kLarge);
    for (auto _ : state) {
        int64_t t0 = cpu_now();
        map_once("host", id_text, "local10000");
        int64_t t1 = cpu_now();
        map_once("hostone", id_text, "one");
        int64_t t2 = cpu_now();
        outside_calls(t, id_text.c_str(), without_reports);
        int64_t t3 = cpu_now();
        int64_t per_entry = ((t1 - t0) - (t2 - t1) - (t3 - t2)) / kWalked;
        state.SetIterationTime(static_cast<double>(per_entry > 0 ? per_entry : 0) * 1e-9);
    }
}
void BM_library_per_entry(benchmark::State &state) { library_per_entry(state, false); }
void BM_library_per_entry_without_reports(benchmark::State &state) { library_per_entry(state, true); }

// The checks and matches of one cached entry without the mismatch report:
// a valid rule without mapping applied to an id it matches.
void BM_apply_rule_matching_denial(benchmark::State &state) {
    char type[] = "host", rgy[] = "node1", token[] = "user1";
    char *tokens[] = {token};
    idm_rule rule{0, type, rgy, 1, tokens, nullptr};
    idm_id id{type, rgy, 1, tokens};
    idm_buffer local{};
    for (auto _ : state) benchmark::DoNotOptimize(idm__native_apply_rule(&rule, &id, &local));
}

void BM_budget_50ns(benchmark::State &state) {
    for (auto _ : state) state.SetIterationTime(50e-9);
}

// First call after the file changed: re-read, old rules released, every
// line translated anew up to the match.
void BM_map_after_change(benchmark::State &state) {
    int n = static_cast<int>(state.range(0));
    if (!prepare(n)) return state.SkipWithError("mapping failed");
    std::string id = identity(n);
    for (auto _ : state) {
        set_mtime(oxtest::kLocalMap, g_mtime += 10);
        auto t0 = Clock::now();
        idm_buffer local{};
        benchmark::DoNotOptimize(sec_idm_map_identity("host", id.c_str(), &local));
        auto t1 = Clock::now();
        std::free(local.value);
        state.SetIterationTime(std::chrono::duration<double>(t1 - t0).count());
    }
    state.counters["entries"] = n;
}

}  // namespace

int main(int argc, char **argv) {
    if (!oxtest::enter_private_namespace()) {
        std::fprintf(stderr, "bench_mapping: no private mount namespace (run as root)\n");
        return 1;
    }
    if (oxmpm_host_register() != 0 ||
        sec_idm_register_translator(IDM_MAPPING_NATIVE, "hostone", oxmpm_host_translate, oxmpm_host_cleanup) != 0) {
        std::fprintf(stderr, "bench_mapping: registration failed\n");
        return 1;
    }
    benchmark::RegisterBenchmark("BM_stat3", BM_stat3);
    for (int n : {1, 100, kLarge}) benchmark::RegisterBenchmark("BM_map_unchanged", BM_map_unchanged)->Arg(n);
    benchmark::RegisterBenchmark("BM_host_translator", BM_host_translator);
    benchmark::RegisterBenchmark("BM_report_token_mismatch", BM_report_token_mismatch);
    // Each iteration walks 10,000 lines but reports the time of one: a fixed
    // count keeps the run short.
    benchmark::RegisterBenchmark("BM_library_per_entry", BM_library_per_entry)->UseManualTime()->Iterations(40);
    benchmark::RegisterBenchmark("BM_library_per_entry_without_reports", BM_library_per_entry_without_reports)
        ->UseManualTime()
        ->Iterations(40);
    benchmark::RegisterBenchmark("BM_apply_rule_matching_denial", BM_apply_rule_matching_denial);
    benchmark::RegisterBenchmark("BM_budget_50ns", BM_budget_50ns)->UseManualTime();
    for (int n : {1, 100, kLarge})
        benchmark::RegisterBenchmark("BM_map_after_change", BM_map_after_change)->Arg(n)->UseManualTime();
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
