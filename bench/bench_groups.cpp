// Group lookup family: sec_idm_get_groups on nss_wrapper databases of 10,
// 1,000 and 10,000 groups, next to
//   - the bare algorithm the library follows: one getpwnam_r, one getgrgid_r
//     and one setgrent/getgrent_r/endgrent pass comparing member names, each
//     with its work buffer of the system's suggested size allocated for the
//     call, as the algorithm prescribes, but no result copied, no buffer
//     zeroed, no lock and no trace (the floor for the library);
//   - glibc's getgrouplist for the same user (context only: it returns ids,
//     not names).
// Each size's figures are measured back to back, so their ratios come from
// the same database and the same moment.
//
// nss_wrapper has to be preloaded: started without it, the program
// re-executes itself with LD_PRELOAD naming libnss_wrapper.so and
// NSS_WRAPPER_PASSWD / NSS_WRAPPER_GROUP naming files in a directory of its
// own under /tmp.  The re-executed process writes the files before its first
// lookup, which is when nss_wrapper reads the variables, and removes them at
// the end.  Moving to another size rewrites the group file; nss_wrapper
// reloads a changed file at its next lookup, done before timing starts.
// Group lookups read no configuration file of the library, so this family
// does without the private namespace (whose private /tmp would also hide
// output files that a caller names there).
#include <benchmark/benchmark.h>
#include <dlfcn.h>
#include <grp.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>
#include <vector>

#include "oxidm.h"

namespace {

constexpr const char kUser[] = "benchuser";
constexpr gid_t kPrimaryGid = 70000;
constexpr int kOtherUsers = 100;

int g_current_size = -1;

void write_atomically(const std::string &path, const std::string &content) {
    std::string tmp = path + ".tmp";
    {
        std::ofstream out(tmp, std::ios::binary | std::ios::trunc);
        out << content;
    }
    if (std::rename(tmp.c_str(), path.c_str()) != 0) {
        std::perror(path.c_str());
        std::exit(1);
    }
}

// The bench user belongs to 20 groups spread evenly over the file (5 when
// the file has 10): a scan's cost then grows with the database, not with the
// user's memberships, as for an ordinary user on a large system.
int member_step(int size) { return size / 20 > 2 ? size / 20 : 2; }
bool is_member(int size, int k) { return k % member_step(size) == 1; }

// `size` groups "grp<k>" with four other members each; the bench user's
// primary group sits in the middle of the file and lists it too.
void write_group_file(int size) {
    std::string text;
    text.reserve(static_cast<size_t>(size) * 48);
    for (int k = 0; k < size; ++k) {
        if (k == size / 2) text.append("primary:x:").append(std::to_string(kPrimaryGid)).append(":").append(kUser).append("\n");
        text.append("grp").append(std::to_string(k)).append(":x:").append(std::to_string(60000 + k)).append(":");
        for (int j = 0; j < 4; ++j) {
            if (j == 2 && is_member(size, k)) text.append(kUser).append(",");
            text.append("u").append(std::to_string((k * 7 + j) % kOtherUsers)).append(j < 3 ? "," : "");
        }
        text.append("\n");
    }
    write_atomically(std::getenv("NSS_WRAPPER_GROUP"), text);
}

void write_passwd_file() {
    std::string text;
    text.append(kUser).append(":x:5000:").append(std::to_string(kPrimaryGid)).append("::/home/bench:/bin/sh\n");
    for (int u = 0; u < kOtherUsers; ++u)
        text.append("u").append(std::to_string(u)).append(":x:").append(std::to_string(6000 + u)).append(":100::/:/bin/sh\n");
    write_atomically(std::getenv("NSS_WRAPPER_PASSWD"), text);
}

// The bare pass: the lookups and the single enumeration the library makes,
// counting memberships.
uint32_t bare_pass(size_t pw_size, size_t gr_size) {
    char *pw_buffer = static_cast<char *>(std::malloc(2 * pw_size));
    char *gr_buffer = static_cast<char *>(std::malloc(gr_size));
    passwd pwd;
    passwd *user = nullptr;
    group grp;
    group *found = nullptr;
    uint32_t count = 0;
    std::string primary;  // the primary group is passed over by name, as in the library
    if (getpwnam_r(kUser, &pwd, pw_buffer, 2 * pw_size, &user) == 0 && user != nullptr &&
        getgrgid_r(pwd.pw_gid, &grp, gr_buffer, gr_size, &found) == 0 && found != nullptr) {
        count = 1;
        primary = grp.gr_name;
    }
    std::free(gr_buffer);
    std::free(pw_buffer);
    if (count == 0) return 0;
    char *scan_buffer = static_cast<char *>(std::malloc(gr_size));
    setgrent();
    for (;;) {
        found = nullptr;
        if (getgrent_r(&grp, scan_buffer, gr_size, &found) != 0 || found == nullptr) break;
        if (std::strcmp(grp.gr_name, primary.c_str()) == 0 || grp.gr_mem == nullptr) continue;
        for (char **m = grp.gr_mem; *m != nullptr; ++m)
            if (std::strcmp(*m, kUser) == 0) ++count;
    }
    endgrent();
    std::free(scan_buffer);
    return count;
}

uint32_t library_lookup() {
    idm_buffer user{sizeof kUser, const_cast<char *>(kUser)};
    uint32_t count = 0;
    idm_buffer *groups = nullptr;
    if (sec_idm_get_groups(&user, &count, &groups) != 0) return 0;
    for (uint32_t i = 0; i < count; ++i) std::free(groups[i].value);
    std::free(groups);
    return count;
}

uint32_t expected_count(int size) {
    uint32_t count = 1;
    for (int k = 0; k < size; ++k) count += is_member(size, k) ? 1 : 0;
    return count;
}

// Switches the database to `size` groups (outside the timing) and checks the
// answer once.
bool use_size(benchmark::State &state, int size) {
    if (g_current_size != size) {
        write_group_file(size);
        g_current_size = size;
    }
    if (library_lookup() != expected_count(size)) {
        state.SkipWithError("unexpected group count: is nss_wrapper serving the generated files?");
        return false;
    }
    return true;
}

void BM_groups_library(benchmark::State &state) {
    const int size = static_cast<int>(state.range(0));
    if (!use_size(state, size)) return;
    for (auto _ : state) benchmark::DoNotOptimize(library_lookup());
    state.counters["groups"] = size;
}

void BM_groups_bare(benchmark::State &state) {
    const int size = static_cast<int>(state.range(0));
    if (!use_size(state, size)) return;
    const size_t pw_size = static_cast<size_t>(sysconf(_SC_GETPW_R_SIZE_MAX));
    const size_t gr_size = static_cast<size_t>(sysconf(_SC_GETGR_R_SIZE_MAX));
    if (bare_pass(pw_size, gr_size) != expected_count(size)) {
        state.SkipWithError("bare pass disagrees with the library");
        return;
    }
    for (auto _ : state) benchmark::DoNotOptimize(bare_pass(pw_size, gr_size));
}

void BM_groups_getgrouplist(benchmark::State &state) {
    const int size = static_cast<int>(state.range(0));
    if (!use_size(state, size)) return;
    std::vector<gid_t> gids(static_cast<size_t>(size) + 2);
    for (auto _ : state) {
        int n = static_cast<int>(gids.size());
        benchmark::DoNotOptimize(getgrouplist(kUser, kPrimaryGid, gids.data(), &n));
        benchmark::DoNotOptimize(n);
    }
}

bool nss_wrapper_loaded() {
    void *handle = dlopen("libnss_wrapper.so", RTLD_LAZY | RTLD_NOLOAD);
    if (handle == nullptr) return false;
    dlclose(handle);
    return true;
}

// Re-executes the program with nss_wrapper preloaded and its two files named.
int reexec_with_nss_wrapper(char **argv) {
    void *probe = dlopen("libnss_wrapper.so", RTLD_LAZY);
    if (probe == nullptr) {
        std::fprintf(stderr, "bench_groups: libnss_wrapper.so not found (package libnss-wrapper); skipped\n");
        return 0;
    }
    dlclose(probe);
    std::string preload = "libnss_wrapper.so";
    if (const char *old = std::getenv("LD_PRELOAD"); old != nullptr && *old != '\0') preload += std::string(":") + old;
    std::string dir = "/tmp/oxidm-bench-groups-" + std::to_string(getpid());
    setenv("LD_PRELOAD", preload.c_str(), 1);
    setenv("NSS_WRAPPER_PASSWD", (dir + "/passwd").c_str(), 1);
    setenv("NSS_WRAPPER_GROUP", (dir + "/group").c_str(), 1);
    execv("/proc/self/exe", argv);
    std::perror("bench_groups: execv");
    return 1;
}

}  // namespace

int main(int argc, char **argv) {
    if (!nss_wrapper_loaded()) return reexec_with_nss_wrapper(argv);
    std::string passwd = std::getenv("NSS_WRAPPER_PASSWD") ? std::getenv("NSS_WRAPPER_PASSWD") : "";
    std::string group = std::getenv("NSS_WRAPPER_GROUP") ? std::getenv("NSS_WRAPPER_GROUP") : "";
    if (passwd.empty() || group.empty()) {
        std::fprintf(stderr, "bench_groups: NSS_WRAPPER_PASSWD and NSS_WRAPPER_GROUP must be set\n");
        return 1;
    }
    std::string dir = passwd.substr(0, passwd.rfind('/'));
    if (mkdir(dir.c_str(), 0700) != 0) {
        std::perror(dir.c_str());
        return 1;
    }
    write_passwd_file();

    for (int size : {10, 1000, 10000}) {
        benchmark::RegisterBenchmark("BM_groups_library", BM_groups_library)->Arg(size);
        benchmark::RegisterBenchmark("BM_groups_bare", BM_groups_bare)->Arg(size);
        benchmark::RegisterBenchmark("BM_groups_getgrouplist", BM_groups_getgrouplist)->Arg(size);
    }
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();

    std::remove(passwd.c_str());
    std::remove(group.c_str());
    rmdir(dir.c_str());
    return 0;
}
