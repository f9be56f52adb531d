// Exported mapping through the shipped libox_idm.so and the sample plug-ins
// (shared objects, as callers load them), next to the physical limits of the
// same moment:
//   - one stat() of a present file, one of an absent file, and the three
//     stat() calls an unchanged request makes (the local map file present,
//     both global files absent, as here);
//   - one uncontended mutex lock and unlock;
//   - the first write to a page of fresh memory (what every byte a load
//     builds costs on top of the work, until the process reuses its heap);
//   - sec_idm_map_identity with unchanged files, the match at entry 1, 100
//     and 10,000 of the mechanism's lines, for the plug-ins host and princ;
//   - calls per second from 1, 2, 4 and 8 threads mapping at once, all for
//     one mechanism (their walks are serialised on its record) or spread
//     over four mechanisms (independent records).
//
// One local map file holds 10,000 lines for each mechanism: host, hostb,
// hostc, hostd (the host plug-in's routines registered under four
// mnemonics) and princ.  Runs in a private mount namespace.
#include <benchmark/benchmark.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <thread>
#include <vector>

#include "bench_support.h"
#include "namespace.h"
#include "oxidm.h"
#include "oxmpm_host.h"
#include "oxmpm_principal.h"

namespace {

constexpr int kLines = 10000;
constexpr const char *kHostMechs[] = {"host", "hostb", "hostc", "hostd"};

std::string host_id(int i) { return "user" + std::to_string(i) + "@node1"; }
std::string princ_id(int i) { return "user" + std::to_string(i) + "@EXAMPLE.ORG"; }

void write_map_file() {
    std::string text;
    text.reserve(static_cast<size_t>(kLines) * 5 * 36);
    for (const char *mech : kHostMechs)
        for (int i = 1; i <= kLines; ++i)
            text.append(mech).append(":").append(host_id(i)).append("=local").append(std::to_string(i)).append("\n");
    for (int i = 1; i <= kLines; ++i)
        text.append("princ:").append(princ_id(i)).append("=local").append(std::to_string(i)).append("\n");
    bench::install_file(oxtest::kLocalMap, text);
}

bool map_is(const char *mech, const std::string &id, const std::string &expected) {
    idm_buffer out{};
    int32_t status = sec_idm_map_identity(mech, id.c_str(), &out);
    bool ok = status == 0 && out.value != nullptr && expected == out.value;
    std::free(out.value);
    return ok;
}

// Maps the last identity of every mechanism once: every rule is cached and
// the files are unchanged from then on.
bool warm_up() {
    static int done = 0;
    if (done != 0) return done > 0;
    bool ok = map_is("princ", princ_id(kLines), "local" + std::to_string(kLines));
    for (const char *mech : kHostMechs) ok = ok && map_is(mech, host_id(kLines), "local" + std::to_string(kLines));
    done = ok ? 1 : -1;
    return ok;
}

// ---- limits ----

void BM_limit_stat3(benchmark::State &state) {
    static constexpr const char *kPaths[] = {oxtest::kLocalMap, oxtest::kVarGlobalMap, oxtest::kOptGlobalMap};
    bench::stat_paths(state, kPaths);
}
void BM_limit_stat_present(benchmark::State &state) {
    static constexpr const char *kPaths[] = {oxtest::kLocalMap};
    bench::stat_paths(state, kPaths);
}
void BM_limit_stat_absent(benchmark::State &state) {
    static constexpr const char *kPaths[] = {oxtest::kVarGlobalMap};
    bench::stat_paths(state, kPaths);
}
void BM_limit_mutex_pair(benchmark::State &state) { bench::mutex_pair(state); }
void BM_limit_page_first_touch(benchmark::State &state) { bench::page_first_touch(state); }

// ---- one thread ----

void BM_map_host(benchmark::State &state) {
    const int entry = static_cast<int>(state.range(0));
    if (!warm_up()) return state.SkipWithError("set-up failed");
    const std::string id = host_id(entry);
    if (!map_is("host", id, "local" + std::to_string(entry))) return state.SkipWithError("wrong answer");
    for (auto _ : state) {
        idm_buffer out{};
        benchmark::DoNotOptimize(sec_idm_map_identity("host", id.c_str(), &out));
        std::free(out.value);
    }
}

void BM_map_princ(benchmark::State &state) {
    const int entry = static_cast<int>(state.range(0));
    if (!warm_up()) return state.SkipWithError("set-up failed");
    const std::string id = princ_id(entry);
    if (!map_is("princ", id, "local" + std::to_string(entry))) return state.SkipWithError("wrong answer");
    for (auto _ : state) {
        idm_buffer out{};
        benchmark::DoNotOptimize(sec_idm_map_identity("princ", id.c_str(), &out));
        std::free(out.value);
    }
}

// ---- several threads ----

// n threads make `kCalls` mappings each (match at entry 1), started
// together; an iteration's time is the wall time of the whole batch, and
// calls_per_s counts the calls of all threads.
void threads_mapping(benchmark::State &state, int mechanisms) {
    constexpr int kCalls = 500;
    const int n = static_cast<int>(state.range(0));
    if (!warm_up()) return state.SkipWithError("set-up failed");
    const std::string id = host_id(1);
    std::atomic<int> failures{0};
    double seconds = 0;
    for (auto _ : state) {
        std::atomic<int> ready{0};
        std::atomic<bool> go{false};
        std::vector<std::thread> threads;
        for (int t = 0; t < n; ++t)
            threads.emplace_back([&, t] {
                const char *mech = kHostMechs[t % mechanisms];
                ready.fetch_add(1);
                while (!go.load(std::memory_order_acquire)) std::this_thread::yield();
                for (int i = 0; i < kCalls; ++i) {
                    idm_buffer out{};
                    if (sec_idm_map_identity(mech, id.c_str(), &out) != 0 || out.value == nullptr) failures.fetch_add(1);
                    std::free(out.value);
                }
            });
        while (ready.load() != n) std::this_thread::yield();
        auto t0 = std::chrono::steady_clock::now();
        go.store(true, std::memory_order_release);
        for (auto &th : threads) th.join();
        double s = std::chrono::duration<double>(std::chrono::steady_clock::now() - t0).count();
        seconds += s;
        state.SetIterationTime(s);
    }
    if (failures.load() != 0) state.SkipWithError("a mapping failed");
    state.counters["threads"] = n;
    state.counters["calls_per_s"] = static_cast<double>(state.iterations()) * n * kCalls / seconds;
}
void BM_threads_one_mechanism(benchmark::State &state) { threads_mapping(state, 1); }
void BM_threads_four_mechanisms(benchmark::State &state) { threads_mapping(state, 4); }

}  // namespace

int main(int argc, char **argv) {
    if (!oxtest::enter_private_namespace()) {
        std::fprintf(stderr, "bench_threads: no private mount namespace (run as root)\n");
        return 1;
    }
    bool registered = oxmpm_host_register() == 0 && oxmpm_principal_register() == 0;
    for (const char *mech : kHostMechs)
        registered = registered &&
                     sec_idm_register_translator(IDM_MAPPING_NATIVE, mech, oxmpm_host_translate, oxmpm_host_cleanup) == 0;
    if (!registered) {
        std::fprintf(stderr, "bench_threads: registration failed\n");
        return 1;
    }
    write_map_file();

    benchmark::RegisterBenchmark("BM_limit_stat_present", BM_limit_stat_present);
    benchmark::RegisterBenchmark("BM_limit_stat_absent", BM_limit_stat_absent);
    benchmark::RegisterBenchmark("BM_limit_stat3", BM_limit_stat3);
    benchmark::RegisterBenchmark("BM_limit_mutex_pair", BM_limit_mutex_pair);
    benchmark::RegisterBenchmark("BM_limit_page_first_touch", BM_limit_page_first_touch);
    for (int entry : {1, 100, kLines}) {
        benchmark::RegisterBenchmark("BM_map_host", BM_map_host)->Arg(entry)->ArgName("entry");
        benchmark::RegisterBenchmark("BM_map_princ", BM_map_princ)->Arg(entry)->ArgName("entry");
    }
    for (int n : {1, 2, 4, 8}) {
        benchmark::RegisterBenchmark("BM_threads_one_mechanism", BM_threads_one_mechanism)
            ->Arg(n)
            ->ArgName("threads")
            ->UseManualTime()
            ->Unit(benchmark::kMillisecond);
        benchmark::RegisterBenchmark("BM_threads_four_mechanisms", BM_threads_four_mechanisms)
            ->Arg(n)
            ->ArgName("threads")
            ->UseManualTime()
            ->Unit(benchmark::kMillisecond);
    }
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
