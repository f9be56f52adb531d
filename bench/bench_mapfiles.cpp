// Identity mapping files: the change test on unchanged files next to three
// bare stat calls on the same paths, parse throughput, and memory per entry.
//
//   BM_mapfiles_test_unchanged/1|0   idm__native_test_mapfiles, files present|absent
//   BM_mapfiles_stat3/1|0            three stat() calls on the same paths
//   BM_mapfiles_parse/N              open, lock, parse N lines, unlock, close
//   BM_mapfiles_parse_warm/N         the same, heap pages kept between runs
//   BM_mapfiles_pass_memory          one reading pass over 1,000,000 lines:
//                                    peak and held bytes per entry
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <malloc.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fstream>
#include <string>

#include "namespace.h"
#include "ox_mss.h"
#include "oxidm_natfile.h"
#include "oxidm_state.h"

namespace {

const char *const kPaths[3] = {oxtest::kLocalMap, oxtest::kVarGlobalMap, oxtest::kOptGlobalMap};

void set_mtime(const char *path, int64_t mtime) {
    struct timespec times[2] = {{mtime, 0}, {mtime, 0}};
    utimensat(AT_FDCWD, path, times, 0);
}

// A map file of `lines` lines, all for mechanism "mechA", about 40 bytes each.
size_t write_map(const char *path, int lines) {
    std::FILE *f = std::fopen(path, "w");
    if (f == nullptr) {
        std::perror(path);
        std::exit(1);
    }
    size_t bytes = 0;
    for (int i = 0; i < lines; ++i) {
        int n = std::fprintf(f, "mechA:user%07d.realm.example=local%07d\n", i, i);
        bytes += static_cast<size_t>(n);
    }
    std::fclose(f);
    set_mtime(path, 1'000'000);
    return bytes;
}

void files_present(bool present) {
    for (const char *p : kPaths) unlink(p);
    if (!present) return;
    for (const char *p : kPaths) write_map(p, 10);
}

void BM_mapfiles_test_unchanged(benchmark::State &state) {
    files_present(state.range(0) != 0);
    idm_mapfile_set *set = nullptr;
    int32_t count = 0;
    idm_mapfile_entry *entries = nullptr;
    if (idm__native_read_mapfiles("mechA", &set, &count, &entries) > 1) state.SkipWithError("first pass failed");
    if (idm__native_test_mapfiles(set) != 1) state.SkipWithError("files not settled");
    for (auto _ : state) benchmark::DoNotOptimize(idm__native_test_mapfiles(set));
    idm__native_release_entry_list(count, entries);
    idm__native_release_cachef(set);
}

void BM_mapfiles_stat3(benchmark::State &state) {
    files_present(state.range(0) != 0);
    struct stat st;
    for (auto _ : state)
        for (const char *p : kPaths) benchmark::DoNotOptimize(::stat(p, &st));
}

// Opens, locks and parses the local file, then unlocks and closes it.
// Returns the entry count, or -1.
int32_t parse_local(int32_t *count, idm_mapfile_entry **entries) {
    int32_t fd = -1;
    FILE *stream = nullptr;
    if (idm__ready_mapfile(oxtest::kLocalMap, &fd, &stream) != 0) return -1;
    int32_t status = idm__parse_mapfile("mechA", oxtest::kLocalMap, stream, count, entries);
    sec__unlock_file(fd, "bench");
    std::fclose(stream);
    return status == 0 ? *count : -1;
}

void BM_mapfiles_parse(benchmark::State &state) {
    const int lines = static_cast<int>(state.range(0));
    for (const char *p : kPaths) unlink(p);
    const size_t bytes = write_map(oxtest::kLocalMap, lines);
    for (auto _ : state) {
        int32_t count = 0;
        idm_mapfile_entry *entries = nullptr;
        int32_t parsed = parse_local(&count, &entries);
        state.PauseTiming();
        if (parsed != lines) state.SkipWithError("parse failed");
        idm__native_release_entry_list(count, entries);
        state.ResumeTiming();
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * bytes));
    state.counters["lines_per_s"] =
        benchmark::Counter(static_cast<double>(lines), benchmark::Counter::kIsIterationInvariantRate);
}

// The limit of a reading pass: open the same file, read it with fgets into
// a 1024-byte buffer line by line and close it, keeping nothing.
void BM_mapfiles_fgets(benchmark::State &state) {
    const int lines = static_cast<int>(state.range(0));
    for (const char *p : kPaths) unlink(p);
    write_map(oxtest::kLocalMap, lines);
    char piece[1024];
    for (auto _ : state) {
        std::FILE *f = std::fopen(oxtest::kLocalMap, "re");
        if (f == nullptr) return state.SkipWithError("open failed");
        int n = 0;
        while (std::fgets(piece, sizeof piece, f) != nullptr) ++n;
        std::fclose(f);
        benchmark::DoNotOptimize(n);
    }
    state.counters["lines_per_s"] =
        benchmark::Counter(static_cast<double>(lines), benchmark::Counter::kIsIterationInvariantRate);
}

// The floor of a reading pass under the fixed per-line work: the same
// fgets loop, and per line what every entry must cost whatever the checks
// do (two identifier copies on the heap, one clock reading, a slot in an
// array that grows), with the identifiers cut at fixed places instead of
// being found.  Released outside the timing, as for the parse.
void BM_mapfiles_floor(benchmark::State &state) {
    const int lines = static_cast<int>(state.range(0));
    for (const char *p : kPaths) unlink(p);
    write_map(oxtest::kLocalMap, lines);
    {
        // One untimed pass takes the pages from the system, as for the parse.
        int32_t count = 0;
        idm_mapfile_entry *entries = nullptr;
        parse_local(&count, &entries);
        idm__native_release_entry_list(count, entries);
    }
    char piece[1024];
    for (auto _ : state) {
        std::FILE *f = std::fopen(oxtest::kLocalMap, "re");
        if (f == nullptr) return state.SkipWithError("open failed");
        idm_mapfile_entry *entries = nullptr;
        size_t count = 0, capacity = 0;
        while (std::fgets(piece, sizeof piece, f) != nullptr) {
            if (count == capacity) {
                capacity = capacity == 0 ? 10 : capacity + capacity / 2;
                entries = static_cast<idm_mapfile_entry *>(std::realloc(entries, capacity * sizeof *entries));
            }
            char *network = static_cast<char *>(std::malloc(28));
            std::memcpy(network, piece + 6, 27);
            network[27] = '\0';
            char *local = static_cast<char *>(std::malloc(13));
            std::memcpy(local, piece + 34, 12);
            local[12] = '\0';
            struct timeval now {};
            cu_gettimeofday_1(&now, nullptr);
            entries[count++] = idm_mapfile_entry{now.tv_sec, IDM_ENTRY_AFFIRMATIVE, network, local, 0};
        }
        std::fclose(f);
        state.PauseTiming();
        for (size_t i = 0; i < count; ++i) {
            std::free(entries[i].network_id);
            std::free(entries[i].local_id);
        }
        std::free(entries);
        state.ResumeTiming();
    }
    state.counters["lines_per_s"] =
        benchmark::Counter(static_cast<double>(lines), benchmark::Counter::kIsIterationInvariantRate);
}

// The same with the heap kept by the process between iterations: this
// machine's first touch of a fresh page costs some 17 us, which bounds a
// cold parse (120 bytes per entry) at about 2 million lines per second
// whatever the parser does; the warm figure is the parser's own rate.
void BM_mapfiles_parse_warm(benchmark::State &state) {
    mallopt(M_MMAP_THRESHOLD, 1 << 30);
    mallopt(M_TRIM_THRESHOLD, 1 << 30);
    {
        // One untimed pass takes the pages from the system.
        const int lines = static_cast<int>(state.range(0));
        for (const char *p : kPaths) unlink(p);
        write_map(oxtest::kLocalMap, lines);
        int32_t count = 0;
        idm_mapfile_entry *entries = nullptr;
        parse_local(&count, &entries);
        idm__native_release_entry_list(count, entries);
    }
    BM_mapfiles_parse(state);
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

// Mean cost of the first write to a page of a fresh anonymous mapping.
double first_touch_ns() {
    constexpr size_t kPage = 4096, kPages = 4096;
    char *region = static_cast<char *>(mmap(nullptr, kPage * kPages, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
    if (region == MAP_FAILED) return 0;
    struct timespec a, b;
    clock_gettime(CLOCK_THREAD_CPUTIME_ID, &a);
    for (size_t i = 0; i < kPages; ++i) static_cast<volatile char *>(region)[i * kPage] = 1;
    clock_gettime(CLOCK_THREAD_CPUTIME_ID, &b);
    munmap(region, kPage * kPages);
    return ((b.tv_sec - a.tv_sec) * 1e9 + static_cast<double>(b.tv_nsec - a.tv_nsec)) / kPages;
}

// Peak: the rise of the resident high-water mark over the pass (reset just
// before it).  Held: heap in use by the returned list.
void BM_mapfiles_pass_memory(benchmark::State &state) {
    const int lines = 1'000'000;
    for (const char *p : kPaths) unlink(p);
    write_map(oxtest::kLocalMap, lines);
    malloc_trim(0);
    double peak = 0, held = 0;
    for (auto _ : state) {
        idm_mapfile_set *set = nullptr;
        int32_t count = 0;
        idm_mapfile_entry *entries = nullptr;
        {
            std::ofstream reset("/proc/self/clear_refs");
            reset << "5";
        }
        const long rss_before = status_kb("VmRSS:");
        const size_t heap_before = heap_in_use();
        if (idm__native_read_mapfiles("mechA", &set, &count, &entries) != 0 || count != lines)
            state.SkipWithError("pass failed");
        const long hwm = status_kb("VmHWM:");
        peak = static_cast<double>(hwm - rss_before) * 1024.0 / count;
        held = static_cast<double>(heap_in_use() - heap_before) / count;
        state.PauseTiming();
        idm__native_release_entry_list(count, entries);
        idm__native_release_cachef(set);
        malloc_trim(0);
        state.ResumeTiming();
    }
    state.counters["peak_bytes_per_entry"] = peak;
    state.counters["held_bytes_per_entry"] = held;
    // What fresh memory adds to a pass at the least: the held bytes of an
    // entry take held / 4096 fresh pages, each at the first-touch cost
    // measured here (the mean over 4,096 pages of a fresh mapping).
    const double page_ns = first_touch_ns();
    state.counters["first_touch_ns"] = page_ns;
    state.counters["fault_ns_per_entry"] = held * page_ns / 4096.0;
    state.counters["lines_per_s"] =
        benchmark::Counter(static_cast<double>(lines), benchmark::Counter::kIsIterationInvariantRate);
}

}  // namespace

int main(int argc, char **argv) {
    if (!oxtest::enter_private_namespace()) {
        std::fprintf(stderr, "bench_mapfiles: needs a private mount namespace (run as root)\n");
        return 1;
    }
    benchmark::RegisterBenchmark("BM_mapfiles_pass_memory", BM_mapfiles_pass_memory)
        ->Iterations(3)
        ->Unit(benchmark::kMillisecond);
    for (int present : {1, 0}) {
        benchmark::RegisterBenchmark("BM_mapfiles_test_unchanged", BM_mapfiles_test_unchanged)->Arg(present);
        benchmark::RegisterBenchmark("BM_mapfiles_stat3", BM_mapfiles_stat3)->Arg(present);
    }
    for (int lines : {1'000, 100'000, 1'000'000}) {
        benchmark::RegisterBenchmark("BM_mapfiles_parse", BM_mapfiles_parse)->Arg(lines)->Unit(benchmark::kMicrosecond);
        benchmark::RegisterBenchmark("BM_mapfiles_fgets", BM_mapfiles_fgets)->Arg(lines)->Unit(benchmark::kMicrosecond);
    }
    // Registered last, each floor after a kept-heap parse: the heap settings
    // stay for the rest of the run (bench/run.sh runs this family in order).
    for (int lines : {1'000, 100'000, 1'000'000}) {
        benchmark::RegisterBenchmark("BM_mapfiles_parse_warm", BM_mapfiles_parse_warm)
            ->Arg(lines)
            ->Unit(benchmark::kMicrosecond);
        benchmark::RegisterBenchmark("BM_mapfiles_floor", BM_mapfiles_floor)->Arg(lines)->Unit(benchmark::kMicrosecond);
    }
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
