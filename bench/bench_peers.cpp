// Peer family: what a caller would otherwise use to turn a network identity
// into a local user, on equivalent rule sets of 10, 1,000 and 100,000 rules
// with the identity matching the first rule and the last one:
//   - libox_idm (the shipped libox_idm.so with the sample plug-in "princ"):
//     sec_idm_map_identity on a local map file of lines
//     "princ:user<i>@EXAMPLE.ORG=local<i>", files unchanged since the rules
//     were cached;
//   - MIT Kerberos: krb5_aname_to_localname, the same rules as auth_to_local
//     RULE lines of the realm in a temporary KRB5_CONFIG
//     ("RULE:[1:$1@$0](^user<i>@EXAMPLE\.ORG$)s/^.*$/local<i>/");
//   - the grid-mapfile lookup globus_gss_assist_gridmap on a grid-mapfile
//     (GRIDMAP) of the same identities as distinguished names
//     ("/O=EXAMPLE.ORG/CN=user<i>" local<i>);
//   - krb5_aname_to_localname through the oxidm local-authorization module
//     (integrations/krb5) over libox_idm's map file, at 1,000 rules.
// Every figure is checked once against the expected local name before it is
// timed.  The peers are linked into this program only; the library does not
// depend on them.
//
// Runs in a private mount namespace, so the map file and the peers'
// temporary files live on mounts that only this process sees.
#include <benchmark/benchmark.h>
#include <krb5.h>
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wregister"
#pragma GCC diagnostic ignored "-Wpedantic"
#include <globus_gss_assist.h>
#pragma GCC diagnostic pop

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <string>

#include "bench_support.h"
#include "namespace.h"
#include "ox_cu.h"
#include "oxidm.h"
#include "oxmpm_principal.h"

namespace {

constexpr int kSizes[] = {10, 1000, 100000};
enum Position { kFirst = 0, kLast = 1 };

std::string n_text(int i) { return std::to_string(i); }
int wanted(int rules, int position) { return position == kFirst ? 1 : rules; }
std::string expected_local(int rules, int position) { return "local" + n_text(wanted(rules, position)); }

// ---- libox_idm ----

int g_map_rules = -1;

bool idm_map(const std::string &id, std::string *local) {
    idm_buffer out{};
    int32_t status = sec_idm_map_identity("princ", id.c_str(), &out);
    *local = out.value != nullptr ? out.value : "";
    std::free(out.value);
    return status == 0;
}

std::string principal(int i) { return "user" + n_text(i) + "@EXAMPLE.ORG"; }

// Installs the map file of `rules` lines and maps the last identity once, so
// that every rule is cached.
bool idm_install(int rules) {
    if (g_map_rules == rules) return true;
    std::string text;
    text.reserve(static_cast<size_t>(rules) * 36);
    for (int i = 1; i <= rules; ++i) text += "princ:" + principal(i) + "=local" + n_text(i) + "\n";
    bench::install_file(oxtest::kLocalMap, text);
    g_map_rules = rules;
    std::string local;
    return idm_map(principal(rules), &local) && local == "local" + n_text(rules);
}

void BM_peer_idm(benchmark::State &state) {
    const int rules = static_cast<int>(state.range(0));
    const int position = static_cast<int>(state.range(1));
    if (!idm_install(rules)) return state.SkipWithError("libox_idm set-up failed");
    const std::string id = principal(wanted(rules, position));
    std::string local;
    if (!idm_map(id, &local) || local != expected_local(rules, position))
        return state.SkipWithError("libox_idm gave another answer");
    for (auto _ : state) {
        idm_buffer out{};
        benchmark::DoNotOptimize(sec_idm_map_identity("princ", id.c_str(), &out));
        std::free(out.value);
    }
    state.counters["rules"] = rules;
}

// The library's own share of the same call: each iteration times one call,
// then as many translations and cleanups of the identity by the plug-in as
// the walk made (one per entry up to the match), then as many 2650-666
// reports through the error facility as entries were passed over, and keeps
// the difference.  What is left is the change test (three stat calls), the
// locks, the rule checks and matching and the result copy.
void BM_peer_idm_own(benchmark::State &state) {
    static constexpr int kMsg666Number = 287;  // 2650-666 in set 1 of oxseclib.cat
    static constexpr const char kMsg666[] =
        "2650-666 libox_idm Failure: Unable to find a match between a rule\ntoken (%1$s) and the corresponding id "
        "token (%2$s).\n";
    // Thread CPU time: a difference of wall times would take in whatever
    // else ran on the machine meanwhile.
    struct Clock {
        using duration = std::chrono::nanoseconds;
        static std::chrono::time_point<Clock, duration> now() {
            struct timespec ts;
            clock_gettime(CLOCK_THREAD_CPUTIME_ID, &ts);
            return std::chrono::time_point<Clock, duration>(duration(ts.tv_sec * 1'000'000'000LL + ts.tv_nsec));
        }
    };
    const int rules = static_cast<int>(state.range(0));
    const int position = static_cast<int>(state.range(1));
    if (!idm_install(rules)) return state.SkipWithError("libox_idm set-up failed");
    const int n = wanted(rules, position);
    const std::string id = principal(n);
    const std::string local = "local" + n_text(n);
    idm_mapfile_entry entry{0, IDM_ENTRY_AFFIRMATIVE, const_cast<char *>(id.c_str()), const_cast<char *>(local.c_str()), 0};
    idm_rule rule{};
    idm_id ident{};
    if (oxmpm_principal_translate(&entry, id.c_str(), &rule, &ident) != 0)
        return state.SkipWithError("princ refuses the identity");
    oxmpm_principal_cleanup(nullptr, &ident);
    for (auto _ : state) {
        auto t0 = Clock::now();
        idm_buffer out{};
        benchmark::DoNotOptimize(sec_idm_map_identity("princ", id.c_str(), &out));
        auto t1 = Clock::now();
        std::free(out.value);
        auto t2 = Clock::now();
        for (int i = 0; i < n; ++i) {
            idm_id each{};
            benchmark::DoNotOptimize(oxmpm_principal_translate(nullptr, id.c_str(), &rule, &each));
            oxmpm_principal_cleanup(nullptr, &each);
        }
        for (int i = 1; i < n; ++i)
            benchmark::DoNotOptimize(cu_set_error_1(IDM_E_RULE, 0, "oxseclib.cat", 1, kMsg666Number, kMsg666, "user1", id.c_str()));
        auto t4 = Clock::now();
        double own = std::chrono::duration<double>((t1 - t0) - (t4 - t2)).count();
        state.SetIterationTime(own > 0 ? own : 0);
    }
    oxmpm_principal_cleanup(&rule, nullptr);
    state.counters["rules"] = rules;
}

// ---- MIT Kerberos ----

// One context per rule set: KRB5_CONFIG is read when a context is made.
krb5_context krb5_for(int rules) {
    static std::map<int, krb5_context> contexts;
    if (auto it = contexts.find(rules); it != contexts.end()) return it->second;
    std::string path = "/tmp/oxidm-bench-krb5-" + n_text(rules) + ".conf";
    std::string text = "[libdefaults]\n    default_realm = EXAMPLE.ORG\n[realms]\n    EXAMPLE.ORG = {\n";
    for (int i = 1; i <= rules; ++i)
        text += "        auth_to_local = RULE:[1:$1@$0](^user" + n_text(i) + "@EXAMPLE\\.ORG$)s/^.*$/local" + n_text(i) +
                "/\n";
    text += "    }\n";
    bench::install_file(path.c_str(), text);
    setenv("KRB5_CONFIG", path.c_str(), 1);
    krb5_context ctx = nullptr;
    if (krb5_init_context(&ctx) != 0) ctx = nullptr;
    contexts[rules] = ctx;
    return ctx;
}

// Times krb5_aname_to_localname in `ctx` for the wanted principal, after
// checking its answer once.
void time_aname_to_localname(benchmark::State &state, krb5_context ctx, int rules, int position) {
    if (ctx == nullptr) return state.SkipWithError("krb5_init_context failed");
    krb5_principal princ = nullptr;
    if (krb5_parse_name(ctx, principal(wanted(rules, position)).c_str(), &princ) != 0)
        return state.SkipWithError("krb5_parse_name failed");
    char local[256];
    if (krb5_aname_to_localname(ctx, princ, sizeof local, local) != 0 || expected_local(rules, position) != local) {
        krb5_free_principal(ctx, princ);
        return state.SkipWithError("krb5_aname_to_localname gave another answer");
    }
    for (auto _ : state) benchmark::DoNotOptimize(krb5_aname_to_localname(ctx, princ, sizeof local, local));
    krb5_free_principal(ctx, princ);
    state.counters["rules"] = rules;
}

void BM_peer_krb5(benchmark::State &state) {
    const int rules = static_cast<int>(state.range(0));
    time_aname_to_localname(state, krb5_for(rules), rules, static_cast<int>(state.range(1)));
}

#ifdef OXIDM_LOCALAUTH_MODULE
// krb5_aname_to_localname answered by the oxidm local-authorization module
// over the map file of idm_install (enable_only = oxidm: no RULE lines).
void BM_peer_krb5_oxidm(benchmark::State &state) {
    const int rules = static_cast<int>(state.range(0));
    if (!idm_install(rules)) return state.SkipWithError("libox_idm set-up failed");
    static krb5_context ctx = [] {
        bench::install_file("/tmp/oxidm-bench-krb5-oxidm.conf",
                            "[libdefaults]\n    default_realm = EXAMPLE.ORG\n[plugins]\n    localauth = {\n"
                            "        module = oxidm:" OXIDM_LOCALAUTH_MODULE "\n        enable_only = oxidm\n    }\n");
        setenv("KRB5_CONFIG", "/tmp/oxidm-bench-krb5-oxidm.conf", 1);
        krb5_context c = nullptr;
        return krb5_init_context(&c) == 0 ? c : nullptr;
    }();
    time_aname_to_localname(state, ctx, rules, static_cast<int>(state.range(1)));
}
#endif

// ---- grid-mapfile ----

std::string distinguished_name(int i) { return "/O=EXAMPLE.ORG/CN=user" + n_text(i); }

// The grid-mapfile is named by GRIDMAP at each lookup.
void gridmap_use(int rules) {
    std::string path = "/tmp/oxidm-bench-gridmap-" + n_text(rules);
    static std::map<int, bool> written;
    if (!written[rules]) {
        std::string text;
        text.reserve(static_cast<size_t>(rules) * 40);
        for (int i = 1; i <= rules; ++i) text.append("\"").append(distinguished_name(i)).append("\" local").append(n_text(i)).append("\n");
        bench::install_file(path.c_str(), text);
        written[rules] = true;
    }
    setenv("GRIDMAP", path.c_str(), 1);
}

void BM_peer_gridmap(benchmark::State &state) {
    const int rules = static_cast<int>(state.range(0));
    const int position = static_cast<int>(state.range(1));
    gridmap_use(rules);
    std::string dn = distinguished_name(wanted(rules, position));
    char *user = nullptr;
    if (globus_gss_assist_gridmap(dn.data(), &user) != 0 || user == nullptr || expected_local(rules, position) != user) {
        std::free(user);
        return state.SkipWithError("globus_gss_assist_gridmap gave another answer");
    }
    std::free(user);
    for (auto _ : state) {
        user = nullptr;
        benchmark::DoNotOptimize(globus_gss_assist_gridmap(dn.data(), &user));
        std::free(user);
    }
    state.counters["rules"] = rules;
}

// ---- limits of the same moment ----

void BM_peer_stat3(benchmark::State &state) {
    static constexpr const char *kPaths[] = {oxtest::kLocalMap, oxtest::kVarGlobalMap, oxtest::kOptGlobalMap};
    bench::stat_paths(state, kPaths);
}

// The grid-mapfile lookup's own system calls for one path, with its first
// rule in the first read: open, fstat, read, close of the 1,000-rule file.
void BM_peer_open_read(benchmark::State &state) {
    gridmap_use(1000);
    const char *path = std::getenv("GRIDMAP");
    char buf[4096];
    for (auto _ : state) {
        int fd = open(path, O_RDONLY | O_CLOEXEC);
        struct stat st;
        benchmark::DoNotOptimize(fstat(fd, &st));
        benchmark::DoNotOptimize(read(fd, buf, sizeof buf));
        close(fd);
    }
}

}  // namespace

int main(int argc, char **argv) {
    if (!oxtest::enter_private_namespace()) {
        std::fprintf(stderr, "bench_peers: no private mount namespace (run as root)\n");
        return 1;
    }
    if (oxmpm_principal_register() != 0) {
        std::fprintf(stderr, "bench_peers: registration of princ failed\n");
        return 1;
    }
    if (globus_module_activate(GLOBUS_GSI_GSS_ASSIST_MODULE) != GLOBUS_SUCCESS) {
        std::fprintf(stderr, "bench_peers: the grid-mapfile module does not start\n");
        return 1;
    }
    benchmark::RegisterBenchmark("BM_peer_stat3", BM_peer_stat3);
    benchmark::RegisterBenchmark("BM_peer_open_read", BM_peer_open_read);
    // Each rule set's figures back to back, so that their ratios come from
    // the same moment.
    for (int rules : kSizes)
        for (int position : {kFirst, kLast}) {
            benchmark::RegisterBenchmark("BM_peer_idm", BM_peer_idm)->Args({rules, position})->ArgNames({"rules", "last"});
            benchmark::RegisterBenchmark("BM_peer_idm_own", BM_peer_idm_own)
                ->Args({rules, position})
                ->ArgNames({"rules", "last"})
                ->UseManualTime();
            benchmark::RegisterBenchmark("BM_peer_krb5", BM_peer_krb5)->Args({rules, position})->ArgNames({"rules", "last"});
            benchmark::RegisterBenchmark("BM_peer_gridmap", BM_peer_gridmap)->Args({rules, position})->ArgNames({"rules", "last"});
#ifdef OXIDM_LOCALAUTH_MODULE
            if (rules == 1000)
                benchmark::RegisterBenchmark("BM_peer_krb5_oxidm", BM_peer_krb5_oxidm)
                    ->Args({rules, position})
                    ->ArgNames({"rules", "last"});
#endif
        }
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    globus_module_deactivate(GLOBUS_GSI_GSS_ASSIST_MODULE);
    return 0;
}
