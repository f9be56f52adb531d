// The mechanisms s0, s1, ... of the concurrency tests.  A map file line
// "s<m>:<tag>.<token>=<local>" gives a rule of registry <tag> (the file's
// letter and version, "L7" or "G7"), token <token> and mapping <local>; the
// id gets the rule's registry, so the token alone decides.  Every text
// handed over is interned (made once, never freed), so a routine cancelled
// half-way leaks nothing; the routines count the rules and ids they hand
// out, so that one the library never gives to the cleanup routine shows.
// A victim thread meets cancellation points in each routine, and can be held
// in one of them until it is cancelled.
#ifndef OXIDM_TEST_CONCURRENCY_MPM_H
#define OXIDM_TEST_CONCURRENCY_MPM_H

#include <pthread.h>
#include <sched.h>

#include <atomic>
#include <cstring>
#include <map>
#include <mutex>
#include <string>

#include "test_mpm.h"
#include "versioned_file.h"

namespace mpm {

inline std::atomic<long> rules_out{0}, ids_out{0};
struct Walk { vfile::OneVersion local, global, pair; };  // what one walk saw: file versions, routines
inline thread_local Walk walk;

enum Where { kLibrary, kTranslator, kRuleCleanup, kIdCleanup };
inline thread_local bool victim = false;
inline std::atomic<int> where{kLibrary}, hold_at{kLibrary};

inline void point(Where w) {
    if (!victim) return;
    where = w;
    while (hold_at == w) pthread_testcancel(), sched_yield();  // cancelled at pthread_testcancel only
    pthread_testcancel();
    where = kLibrary;
}

struct Text { char *p[1]; idm_buffer b; };  // an interned text as a token array and as a mapping
inline Text *intern(const std::string &s) {
    static std::mutex m;
    static std::map<std::string, Text> pool;
    std::lock_guard<std::mutex> g(m);
    auto it = pool.try_emplace(s).first;
    if (it->second.p[0] == nullptr)  // set once: read later without the mutex
        it->second = {{const_cast<char *>(it->first.c_str())}, {uint32_t(s.size() + 1), const_cast<char *>(it->first.c_str())}};
    return &it->second;
}

template <char Pair = 0>
int32_t translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule, idm_id *id) {
    point(kTranslator);
    if (entry != nullptr) {
        const char *dot = std::strchr(entry->network_id, '.');
        if (dot == nullptr) return 5;  // not ours: passed over
        rule->rgy_type = const_cast<char *>("t");  // never written
        rule->rgy = intern(std::string(entry->network_id, size_t(dot - entry->network_id)))->p[0];
        rule->token_cnt = 1;
        rule->tokens = intern(dot + 1)->p;
        rule->mapping = entry->local_id != nullptr ? &intern(entry->local_id)->b : nullptr;
        rules_out++;
    }
    (rule->rgy[0] == 'G' ? walk.global : walk.local).saw(std::atol(rule->rgy + 1));
    walk.pair.saw(Pair);
    id->rgy_type = rule->rgy_type;
    id->rgy = rule->rgy;
    id->token_cnt = 1;
    id->tokens = intern(network_id)->p;
    ids_out++;
    point(kTranslator);
    return 0;
}
// A rule's cleanup belongs to the refresh, which may use the routines
// registered before this walk's.
template <char Pair = 0>
int32_t cleanup(idm_rule *rule, idm_id *id) {
    if (rule != nullptr) rules_out--, point(kRuleCleanup);
    if (id != nullptr) ids_out--, walk.pair.saw(Pair), point(kIdCleanup);
    return 0;
}

// Version v of a map file ('L' local, 'G' global) for s0..s<mechs-1>: for
// each, `filler` lines that match nobody, then in the local file a denial of
// eve and joe mapped to "s<m>l<v>", in the global one ann to "s<m>g<v>".
inline std::string map_text(char file, int v, int mechs, int filler) {
    std::string t;
    for (int m = 0; m < mechs; ++m) {
        const std::string mech = oxtest::num("s", m), tag = oxtest::num(file == 'L' ? "L" : "G", v);
        for (int i = 0; i < filler; ++i) t += mech + ":" + tag + oxtest::num(".x", i) + "=x\n";
        t += file == 'L' ? mech + ":!" + tag + ".eve\n" + mech + ":" + tag + ".joe=" + mech + oxtest::num("l", v) + "\n"
                         : mech + ":" + tag + ".ann=" + mech + oxtest::num("g", v) + "\n";
    }
    return t;
}

// Maps `who` for s<m>: the local name, "" for none, or "status <n>".
inline std::string map(int m, const char *who) {
    walk = Walk{};
    idm_buffer local{};
    const int32_t status = sec_idm_map_identity(oxtest::num("s", m).c_str(), who, &local);
    std::string answer = status != 0 ? oxtest::num("status ", status) : local.value != nullptr ? local.value : "";
    std::free(local.value);
    return answer;
}

}  // namespace mpm

#endif
