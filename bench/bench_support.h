// Helpers shared by the benchmark families: writing a configuration file
// atomically with a modification time long past, the shipped library's
// directory, and the physical limits every family can measure next to its
// figures (bare stat calls, an uncontended mutex pair).
//
// Modification times: the library re-reads a map file whose modification
// time equals the second of its last read, so the files written here get
// times far in the past, a new one for each version.
#ifndef OXIDM_BENCH_SUPPORT_H
#define OXIDM_BENCH_SUPPORT_H

#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <pthread.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>

namespace bench {

inline int64_t next_mtime() {
    static int64_t mtime = 1'000'000;
    return mtime += 10;
}

inline void set_mtime(const char *path, int64_t mtime) {
    struct timespec times[2] = {{mtime, 0}, {mtime, 0}};
    if (utimensat(AT_FDCWD, path, times, 0) != 0) {
        std::perror(path);
        std::exit(1);
    }
}

// Writes `text` to a temporary file beside `path` and renames it into place.
inline void install_file(const char *path, const std::string &text) {
    std::string tmp = std::string(path) + ".tmp";
    {
        std::ofstream out(tmp, std::ios::binary | std::ios::trunc);
        out << text;
        if (!out) {
            std::perror(tmp.c_str());
            std::exit(1);
        }
    }
    if (std::rename(tmp.c_str(), path) != 0) {
        std::perror(path);
        std::exit(1);
    }
    set_mtime(path, next_mtime());
}

// ---- physical limits ----

// n bare stat() calls on the given paths, once each per iteration.
template <size_t N>
inline void stat_paths(benchmark::State &state, const char *const (&paths)[N]) {
    struct stat st;
    for (auto _ : state)
        for (const char *p : paths) benchmark::DoNotOptimize(::stat(p, &st));
}

// One uncontended lock and unlock of a process-private mutex.
inline void mutex_pair(benchmark::State &state) {
    static pthread_mutex_t m = PTHREAD_MUTEX_INITIALIZER;
    for (auto _ : state) {
        pthread_mutex_lock(&m);
        benchmark::ClobberMemory();
        pthread_mutex_unlock(&m);
    }
}

// The first write to one 4 KiB page of fresh anonymous memory: the page
// fault and the zeroing of the page.  Whatever a load builds in memory the
// process has not used before costs this much per page on top of the work.
inline void page_first_touch(benchmark::State &state) {
    constexpr size_t kPage = 4096;
    constexpr size_t kRegion = size_t{64} << 20;
    char *region = nullptr;
    size_t used = kRegion;
    for (auto _ : state) {
        if (used == kRegion) {
            state.PauseTiming();
            if (region != nullptr) munmap(region, kRegion);
            region = static_cast<char *>(mmap(nullptr, kRegion, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
            if (region == MAP_FAILED) {
                state.SkipWithError("mmap failed");
                return;
            }
            used = 0;
            state.ResumeTiming();
        }
        region[used] = 1;
        benchmark::ClobberMemory();
        used += kPage;
    }
    if (region != nullptr) munmap(region, kRegion);
}

}  // namespace bench

#endif
