// The mapping walk end to end with real map files: which routine of the MPM is
// called with what, in which order, for each translator status; first match,
// denials, the rule cache across calls and file changes, read errors, and the
// routines replaced by a new registration.
//
// The test translator answers from the entry text "S.TOKEN": it returns S for
// the entry (0 without "S.") and makes TOKEN the rule's only token; an identity
// "#S" makes every id translation return S.  Every call is logged ("T entry" or
// "T -:token" for a cached rule, "C rule:token id:identity"), so a step shows
// which entries were translated anew, which rules came from the cache, and
// what each cleanup call released.
#include <string>

#include "harness.h"
#include "oxidm_state.h"
#include "test_mpm.h"

namespace {

using namespace oxtest;
std::string g_log;
const char *token_of(const idm_rule *r) { return r->tokens != nullptr ? r->tokens[0] : "?"; }

template <char Tag>
int32_t translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule, idm_id *id) {
    g_log += std::string(Tag == 'A' ? "" : "B") + "T " + (entry ? entry->network_id : std::string("-:") + token_of(rule)) + ";";
    const char *dot = entry ? std::strchr(entry->network_id, '.') : nullptr;
    const int32_t status = dot ? std::atoi(entry->network_id) : network_id[0] == '#' ? std::atoi(network_id + 1) : 0;
    fill_rule_and_id(entry, network_id, rule, id, dot ? dot + 1 : nullptr);
    if (status != 0 && status != IDM_TRANSLATOR_STOP && status != IDM_TRANSLATOR_REJECT && status != IDM_TRANSLATOR_REFUSED)
        free_rule_and_id(entry ? rule : nullptr, id);
    return status;
}
template <char Tag>
int32_t cleanup(idm_rule *rule, idm_id *id) {
    g_log += std::string(Tag == 'A' ? "" : "B") + "C" + (rule ? std::string(" rule:") + token_of(rule) : "") +
             (id ? std::string(" id:") + id->tokens[0] : "") + ";";
    return free_rule_and_id(rule, id);
}

class NatmapWalk : public Test {};
constexpr int32_t kStop = IDM_TRANSLATOR_STOP, kReject = IDM_TRANSLATOR_REJECT, kOther = 5;  // "5.": any other

// Each step writes a file (or removes it: "-"), or runs a hook, then maps
// and checks the status, the local name ("" for none) and the calls logged.
TEST_F(NatmapWalk, StepsThroughFilesStatusesAndTheCache) {
    OXTEST_REQUIRE_NAMESPACE();
    ASSERT_EQ(sec_idm_register_translator(1, "test", translate<'A'>, cleanup<'A'>), 0);
    struct Step { const char *path, *content, *network_id; int32_t status; const char *name, *log; void (*hook)() = nullptr; } steps[] = {
        {kLocalMap, "test:alice=a\ntest:bob=b\ntest:joe=j\ntest:zed=z\n", "joe", 0, "j",
         "T alice;C id:joe;T bob;C id:joe;T joe;C id:joe;"},  // first match wins
        {nullptr, nullptr, "joe", 0, "j", "T -:alice;C id:joe;T -:bob;C id:joe;T -:joe;C id:joe;"},
        {nullptr, nullptr, "zed", 0, "z", "T -:alice;C id:zed;T -:bob;C id:zed;T -:joe;C id:zed;T zed;C id:zed;"},
        {kLocalMap, "-", "joe", 0, "", "C rule:alice;C rule:bob;C rule:joe;C rule:zed;"},  // old cache, in order
        {kLocalMap, "other:joe=x\ntestx:joe=x\nTEST:joe=x\ntest:!joe\ntest:joe=root\n", "joe", 0, "", "T joe;C id:joe;"},
        {kLocalMap, "test:!bob\ntest:j*=*\n", "joe", 0, "joe", "C rule:joe;T bob;C id:joe;T j*;C id:joe;"},
        {kLocalMap, "test:31.joe=x\ntest:joe=root\n", "joe", kStop, "", "C rule:bob;C rule:j*;T 31.joe;C id:joe;"},
        {nullptr, nullptr, "joe", 0, "x", "T -:joe;C id:joe;"},  // the rule of a 31 is cached when valid
        {nullptr, nullptr, "#31", kStop, "", "T -:joe;C id:#31;"},  // 31 for a cached rule stops the walk too
        // 39 refuses the rule (released at once), two wildcards fail the check, 38 with a valid rule is
        // cached as valid, any other status passes the entry over without a cleanup call.
        {kLocalMap, "test:39.joe=x\ntest:0.**=y\ntest:38.j*=z\ntest:5.joe=q\ntest:joe=root\n", "joe", 0, "root",
         "C rule:joe;T 39.joe;C rule:joe;C id:joe;T 0.**;C id:joe;T 38.j*;C id:joe;T 5.joe;T joe;C id:joe;"},
        {nullptr, nullptr, "joe", 0, "z", "T -:j*;C id:joe;"},  // unusable rules cost no call
        {nullptr, nullptr, "amy", 0, "", "T -:j*;C id:amy;T 5.joe;T -:joe;C id:amy;"},
        {kLocalMap, "test:bob=b\ntest:amy=a\n", "#38", kReject, "",  // the last status when nothing matched
         "C rule:?;C rule:**;C rule:j*;C rule:joe;T bob;C id:#38;T amy;C id:#38;"},
        {kLocalMap, "test:bob=b\ntest:5.amy=a\n", "joe", kOther, "", "C rule:bob;C rule:amy;T bob;C id:joe;T 5.amy;"},
        {kLocalMap, "test:31.a*b*=x\n", "joe", kStop, "", "C rule:bob;T 31.a*b*;C id:joe;"},
        {nullptr, nullptr, "joe", 0, "", ""},  // its rule failed the check: passed over
        {kLocalMap, "test:!amy\ntest:j*=from-local\n", "joe", 0, "from-local", nullptr},
        {kOptGlobalMap, "test:joe=from-opt\n", "joe", 0, "from-local", nullptr},  // the local file first
        {nullptr, nullptr, "amy", 0, "", nullptr},
        {kLocalMap, "test:!amy\n", "joe", 0, "from-opt", nullptr},
        {kVarGlobalMap, "test:joe=from-var\n", "joe", 0, "from-var", nullptr},  // supersedes the other global
        // A read error drops entries and rules, and stands (never "no match") until the file reads.
        {kLocalMap, "test:bob=b\ntest:joe=j\n", "joe", 0, "j", nullptr},
        {nullptr, nullptr, "joe", IDM_E_MAPFILE_ACCESS, "", "C rule:bob;C rule:joe;", [] { mssx_force_open(kLocalMap, 12), set_mtime(kLocalMap, 2'000'000); }},
        {nullptr, nullptr, "joe", IDM_E_MAPFILE_ACCESS, "", ""},
        {nullptr, nullptr, "joe", 0, "j", "T bob;C id:joe;T joe;C id:joe;", [] { mssx_force_open(nullptr, 0); }},
        // Routines registered anew inherit the cache, and release it.
        {nullptr, nullptr, "joe", 0, "j", "BT -:bob;BC id:joe;BT -:joe;BC id:joe;",
         [] { sec_idm_register_translator(1, "test", translate<'B'>, cleanup<'B'>); }},
        {nullptr, nullptr, "amy", 0, "", "BC rule:bob;BC rule:joe;BT bob;BC id:amy;BT joe;BC id:amy;BT joe;BC id:amy;",
         [] { set_mtime(kLocalMap, 2'000'010); }},
    };
    int64_t mtime = 1'000'000;
    for (const Step &s : steps) {
        if (s.path != nullptr && std::strcmp(s.content, "-") == 0) remove_file(s.path);
        else if (s.path != nullptr) write_file(s.path, s.content, mtime += 10);
        if (s.hook != nullptr) s.hook();
        idm_buffer local{};
        g_log.clear();
        EXPECT_EQ(sec_idm_map_identity("test", s.network_id, &local), s.status) << s.network_id;
        EXPECT_EQ(local.value ? local.value : "", std::string(s.name)) << s.network_id;
        EXPECT_EQ(local.length, local.value ? std::strlen(local.value) + 1 : 0);
        EXPECT_EQ(s.log ? g_log : "", s.log ? s.log : "") << s.network_id;
        std::free(local.value);
    }
}

}  // namespace
