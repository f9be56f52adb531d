// Memory of the shipped libox_idm.so for large configuration files, each
// measured in a child process of its own (forked before the first load, so
// that nothing of an earlier measurement is left in its heap):
//   - a local map file of 1,000,000 lines for the sample plug-in "host",
//     loaded by the first sec_idm_map_identity (match at entry 1);
//   - a node information file of 100,000 hosts, loaded by the first
//     sec_is_in_any_cluster.
// Reported per entry (map file line or host): the bytes the library still
// holds afterwards (mallinfo2 delta) and the peak rise of the resident set
// during the load (VmHWM after the high-water mark was reset, minus VmRSS
// before), next to the file's own bytes per entry.  The load time of the
// same call is the iteration time, with the number of page faults it took
// and the share of its time those faults cost at this machine's price of a
// first write to a fresh page.
#include <benchmark/benchmark.h>
#include <malloc.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>

#include "bench_support.h"
#include "namespace.h"
#include "oxidm.h"
#include "oxmpm_host.h"

namespace {

constexpr int kMapLines = 1'000'000;
constexpr int kHosts = 100'000;

struct Usage {
    double seconds;
    double held_bytes;
    double peak_bytes;
    double page_faults;
    int ok;
};

// Seconds for the first write to one fresh 4 KiB page (fault and zeroing),
// the least of three runs over 16 MiB.
double page_touch_seconds() {
    constexpr size_t kPage = 4096, kBytes = size_t{16} << 20;
    double best = 1;
    for (int r = 0; r < 3; ++r) {
        char *p = static_cast<char *>(mmap(nullptr, kBytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
        if (p == MAP_FAILED) return 0;
        auto t0 = std::chrono::steady_clock::now();
        for (size_t i = 0; i < kBytes; i += kPage) p[i] = 1;
        double s = std::chrono::duration<double>(std::chrono::steady_clock::now() - t0).count() / (kBytes / kPage);
        munmap(p, kBytes);
        if (s < best) best = s;
    }
    return best;
}

long status_kb(const char *field) {
    std::ifstream in("/proc/self/status");
    std::string line;
    while (std::getline(in, line))
        if (line.rfind(field, 0) == 0) return std::atol(line.c_str() + std::strlen(field));
    return 0;
}

size_t heap_in_use() {
    struct mallinfo2 m = mallinfo2();
    return m.uordblks + m.hblkhd;
}

// Runs `load` in a forked child and returns what it used.
template <class Load>
Usage in_child(Load load) {
    int fds[2];
    if (pipe(fds) != 0) return {0, 0, 0, 0, 0};
    pid_t pid = fork();
    if (pid == 0) {
        close(fds[0]);
        malloc_trim(0);
        {
            std::ofstream reset("/proc/self/clear_refs");
            reset << "5";
        }
        const long rss_before = status_kb("VmRSS:");
        const size_t heap_before = heap_in_use();
        struct rusage r0 {};
        getrusage(RUSAGE_SELF, &r0);
        auto t0 = std::chrono::steady_clock::now();
        int ok = load() ? 1 : 0;
        auto t1 = std::chrono::steady_clock::now();
        struct rusage r1 {};
        getrusage(RUSAGE_SELF, &r1);
        Usage u{std::chrono::duration<double>(t1 - t0).count(),
                static_cast<double>(heap_in_use() - heap_before),
                static_cast<double>(status_kb("VmHWM:") - rss_before) * 1024.0,
                static_cast<double>(r1.ru_minflt - r0.ru_minflt), ok};
        ssize_t w = write(fds[1], &u, sizeof u);
        _exit(w == static_cast<ssize_t>(sizeof u) ? 0 : 1);
    }
    close(fds[1]);
    Usage u{0, 0, 0, 0, 0};
    if (pid < 0 || read(fds[0], &u, sizeof u) != static_cast<ssize_t>(sizeof u)) u.ok = 0;
    close(fds[0]);
    if (pid > 0) waitpid(pid, nullptr, 0);
    return u;
}

void report(benchmark::State &state, const Usage &u, int entries, size_t file_bytes) {
    state.SetIterationTime(u.seconds);
    state.counters["held_bytes_per_entry"] = u.held_bytes / entries;
    state.counters["peak_bytes_per_entry"] = u.peak_bytes / entries;
    state.counters["file_bytes_per_entry"] = static_cast<double>(file_bytes) / entries;
    // How much of the load the kernel spent handing out fresh pages.
    static const double page_seconds = page_touch_seconds();
    state.counters["page_faults"] = u.page_faults;
    state.counters["page_fault_share"] = u.seconds > 0 ? u.page_faults * page_seconds / u.seconds : 0;
}

void BM_memory_map_1m(benchmark::State &state) {
    std::string text;
    text.reserve(static_cast<size_t>(kMapLines) * 36);
    for (int i = 1; i <= kMapLines; ++i)
        text.append("host:user").append(std::to_string(i)).append("@node1=local").append(std::to_string(i)).append("\n");
    bench::install_file(oxtest::kLocalMap, text);
    for (auto _ : state) {
        Usage u = in_child([] {
            idm_buffer out{};
            bool ok = sec_idm_map_identity("host", "user1@node1", &out) == 0 && out.value != nullptr &&
                      std::strcmp(out.value, "local1") == 0;
            std::free(out.value);
            return ok;
        });
        if (!u.ok) return state.SkipWithError("the mapping failed");
        report(state, u, kMapLines, text.size());
    }
    unlink(oxtest::kLocalMap);
}

void BM_memory_nodeinfo_100k(benchmark::State &state) {
    std::string text;
    text.reserve(static_cast<size_t>(kHosts) * 80);
    char name[32], address[32];
    for (int i = 0; i < kHosts; ++i) {
        std::snprintf(name, sizeof name, "node%06d.example.net", i);
        std::snprintf(address, sizeof address, "10.%d.%d.%d", i >> 16, (i >> 8) & 255, i & 255);
        text.append("NODE:\n  NAME: ").append(name).append("\n  ADDRESS: ").append(address);
        text.append("\n  CLUSTER: clA cl").append(std::to_string(i % 50)).append("\n");
    }
    bench::install_file(oxtest::kNodeInfo, text);
    for (auto _ : state) {
        Usage u = in_child([] { return sec_is_in_any_cluster("node000001.example.net") == 1; });
        if (!u.ok) return state.SkipWithError("the query failed");
        report(state, u, kHosts, text.size());
    }
    unlink(oxtest::kNodeInfo);
}

}  // namespace

int main(int argc, char **argv) {
    if (!oxtest::enter_private_namespace()) {
        std::fprintf(stderr, "bench_memory: no private mount namespace (run as root)\n");
        return 1;
    }
    if (oxmpm_host_register() != 0) {
        std::fprintf(stderr, "bench_memory: registration failed\n");
        return 1;
    }
    // Three children per repetition are plenty: a load is hundreds of
    // milliseconds and its memory does not vary.
    benchmark::RegisterBenchmark("BM_memory_map_1m", BM_memory_map_1m)
        ->Iterations(3)
        ->UseManualTime()
        ->Unit(benchmark::kMillisecond);
    benchmark::RegisterBenchmark("BM_memory_nodeinfo_100k", BM_memory_nodeinfo_100k)
        ->Iterations(3)
        ->UseManualTime()
        ->Unit(benchmark::kMillisecond);
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
