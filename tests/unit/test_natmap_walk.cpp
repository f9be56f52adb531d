// The mapping walk end to end with real map files: which routine of the MPM
// is called with what, in which order, for each translator status; first
// match, denials, the rule cache across calls and file changes, read errors,
// a cache that cannot grow, and the routines replaced by a new registration.
//
// The test translator answers from the entry text "S.TOKEN": it returns S
// for the entry (0 when there is no "S.") and makes TOKEN the rule's only
// token.  A network identity "#S" makes every id translation return S.  Every
// call is logged, so a test sees which entries were translated anew, which
// rules came from the cache, and every cleanup call with what it released.
#include <cstdlib>
#include <cstring>
#include <string>
#include <utility>
#include <vector>

#include "harness.h"
#include "oxidm_state.h"
#include "oxidm_natmap.h"

namespace {

using oxtest::reported;
using Log = std::vector<std::string>;

constexpr int64_t kOld = 1'000'000;  // a modification time long past

Log g_log;
int32_t g_force = -1;  // >= 0: every call returns this (cleaning up after itself)

char *dup(const char *s) { return static_cast<char *>(std::memcpy(std::malloc(std::strlen(s) + 1), s, std::strlen(s) + 1)); }

const char *rule_token(const idm_rule *r) { return r->tokens != nullptr ? r->tokens[0] : "?"; }

void free_rule(idm_rule *r) {
    if (r->tokens != nullptr) std::free(r->tokens[0]);
    std::free(r->tokens);
    if (r->mapping != nullptr) std::free(r->mapping->value);
    std::free(r->mapping);
    uint32_t state = r->rule_state;
    *r = idm_rule{};
    r->rule_state = state;
}
void free_id(idm_id *id) {
    if (id->tokens != nullptr) std::free(id->tokens[0]);
    std::free(id->tokens);
    *id = idm_id{};
}

template <char Tag>
int32_t test_translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule, idm_id *id) {
    std::string who = Tag == 'A' ? "T " : std::string("T") + Tag + " ";
    g_log.push_back(who + (entry != nullptr ? entry->network_id : std::string("-:") + rule_token(rule)));
    int32_t status = 0;
    if (entry != nullptr) {
        const char *token = entry->network_id;
        if (const char *dot = std::strchr(token, '.')) {
            status = std::atoi(token);
            token = dot + 1;
        }
        rule->rgy_type = const_cast<char *>("test");
        rule->rgy = const_cast<char *>("r");
        rule->token_cnt = 1;
        rule->tokens = static_cast<char **>(std::malloc(sizeof(char *)));
        rule->tokens[0] = dup(token);
        if (entry->kind == IDM_ENTRY_AFFIRMATIVE) {
            rule->mapping = static_cast<idm_buffer *>(std::malloc(sizeof(idm_buffer)));
            rule->mapping->value = dup(entry->local_id);
            rule->mapping->length = static_cast<uint32_t>(std::strlen(entry->local_id) + 1);
        }
    }
    id->rgy_type = const_cast<char *>("test");
    id->rgy = const_cast<char *>("r");
    id->token_cnt = 1;
    id->tokens = static_cast<char **>(std::malloc(sizeof(char *)));
    id->tokens[0] = dup(network_id);
    if (status == 0 && network_id[0] == '#') status = std::atoi(network_id + 1);
    if (g_force >= 0) status = g_force;
    if (status != 0 && status != 31 && status != 38 && status != 39) {
        // A status without meaning gets no cleanup call: release it all here.
        if (entry != nullptr) free_rule(rule);
        free_id(id);
    }
    return status;
}

template <char Tag>
int32_t test_cleanup(idm_rule *rule, idm_id *id) {
    std::string e = Tag == 'A' ? "C" : std::string("C") + Tag;
    if (rule != nullptr) e += std::string(" rule:") + rule_token(rule);
    if (id != nullptr) e += std::string(" id:") + (id->tokens != nullptr ? id->tokens[0] : "?");
    g_log.push_back(e);
    if (rule != nullptr) free_rule(rule);
    if (id != nullptr) free_id(id);
    return 0;
}

class NatmapWalk : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
        g_log.clear();
        g_force = -1;
        ASSERT_EQ(sec_idm_register_translator(1, "test", test_translate<'A'>, test_cleanup<'A'>), 0);
    }
    void TearDown() override {
        idm_test_fail_alloc(0);
        mssx_reset();
        oxtest::Test::TearDown();
    }
    // Maps and returns the local name, "" for an empty result.
    std::string map(const char *network_id, int32_t expected_status) {
        idm_buffer local{};
        EXPECT_EQ(sec_idm_map_identity("test", network_id, &local), expected_status) << network_id;
        std::string name = local.value != nullptr ? std::string(local.value) : std::string();
        if (local.value != nullptr) {
            EXPECT_EQ(local.length, name.size() + 1);
        }
        std::free(local.value);
        return name;
    }
    Log take_log() { return std::exchange(g_log, {}); }
    static idm_translator *record() { return idm__native_find_translator("test"); }
};

TEST_F(NatmapWalk, ThirdEntryMatchesThenCachedRulesAreReused) {
    oxtest::write_file(oxtest::kLocalMap, "test:alice=a1\ntest:bob=b1\ntest:joe=j1\ntest:zed=z1\n", kOld);
    EXPECT_EQ(map("joe", 0), "j1");
    EXPECT_EQ(take_log(), (Log{"T alice", "C id:joe", "T bob", "C id:joe", "T joe", "C id:joe"}));
    EXPECT_EQ(record()->rule_count, 3);
    EXPECT_EQ(map("joe", 0), "j1");
    EXPECT_EQ(take_log(), (Log{"T -:alice", "C id:joe", "T -:bob", "C id:joe", "T -:joe", "C id:joe"}));
    // A new identity walks on to the fourth entry, translating only it anew.
    EXPECT_EQ(map("zed", 0), "z1");
    EXPECT_EQ(take_log(),
              (Log{"T -:alice", "C id:zed", "T -:bob", "C id:zed", "T -:joe", "C id:zed", "T zed", "C id:zed"}));
    EXPECT_EQ(record()->entries[3].rule_index, 4);
}

TEST_F(NatmapWalk, Outcomes) {
    struct Case {
        const char *label;
        const char *local_file;  // null: no file
        const char *network_id;
        int32_t status;
        const char *name;
        Log log;
    } cases[] = {
        {"no map file", nullptr, "joe", 0, "", {}},
        {"no entry of this mechanism", "other:joe=root\ntestx:joe=root\nTEST:joe=root\n", "joe", 0, "", {}},
        {"denial before affirmative", "test:!joe\ntest:joe=root\n", "joe", 0, "", {"T joe", "C id:joe"}},
        {"denial that does not match", "test:!bob\ntest:joe=root\n", "joe", 0, "root",
         {"T bob", "C id:joe", "T joe", "C id:joe"}},
        {"wildcard entry", "test:j*=*\n", "joe", 0, "joe", {"T j*", "C id:joe"}},
        {"nothing matches", "test:bob=b\ntest:amy=a\n", "joe", 0, "", {"T bob", "C id:joe", "T amy", "C id:joe"}},
        {"31 stops the walk at once", "test:31.joe=x\ntest:joe=root\n", "joe", 31, "", {"T 31.joe", "C id:joe"}},
        {"39 refuses the rule", "test:39.joe=x\ntest:joe=root\n", "joe", 0, "root",
         {"T 39.joe", "C rule:joe", "C id:joe", "T joe", "C id:joe"}},
        {"38 and no match", "test:38.joe=x\n", "joe", 38, "", {"T 38.joe", "C id:joe"}},
        {"a status without meaning: no cleanup call", "test:bob=b\ntest:5.joe=j\n", "joe", 5, "",
         {"T bob", "C id:joe", "T 5.joe"}},
        {"a status without meaning, then a match", "test:5.joe=x\ntest:joe=j\n", "joe", 0, "j",
         {"T 5.joe", "T joe", "C id:joe"}},
        {"id translation fails", "test:joe=j\ntest:amy=a\n", "#38", 38, "",
         {"T joe", "C id:#38", "T amy", "C id:#38"}},
    };
    int64_t mtime = kOld;
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        // Each case starts from a new list: the last case's file is removed
        // (one call drops its entries and rules), then the case's file is
        // written with a new time, so that the next call reads it.
        oxtest::remove_file(oxtest::kLocalMap);
        map("flush", 0);
        if (c.local_file != nullptr) oxtest::write_file(oxtest::kLocalMap, c.local_file, mtime += 10);
        g_log.clear();
        EXPECT_EQ(map(c.network_id, c.status), c.name);
        EXPECT_EQ(take_log(), c.log);
    }
}

TEST_F(NatmapWalk, RefusedAndInvalidRulesArePassedOverUntilTheFilesChange) {
    oxtest::write_file(oxtest::kLocalMap, "test:39.joe=x\ntest:0.**=y\ntest:38.j*=z\ntest:joe=root\n", kOld);
    EXPECT_EQ(map("joe", 0), "root");
    EXPECT_EQ(take_log(), (Log{"T 39.joe", "C rule:joe", "C id:joe",  // refused: released, marked 32
                               "T 0.**", "C id:joe",                   // two wildcards: fails its check
                               "T 38.j*", "C id:joe",                  // 38 with a valid rule: cached as valid
                               "T joe", "C id:joe"}));
    idm_translator *t = record();
    ASSERT_EQ(t->rule_count, 4);
    EXPECT_EQ(t->rules[0].rule_state, 32u);
    EXPECT_EQ(t->rules[0].tokens, nullptr) << "a refused rule is zeroed";
    EXPECT_EQ(t->rules[1].rule_state, 32u);
    EXPECT_EQ(t->rules[2].rule_state, 1u);

    // Unusable rules cost no call; the valid "j*" rule now matches first.
    EXPECT_EQ(map("joe", 0), "z");
    EXPECT_EQ(take_log(), (Log{"T -:j*", "C id:joe"}));

    // A changed file drops every cached rule through the cleanup routine and
    // translates the entries again.
    oxtest::write_file(oxtest::kLocalMap, "test:39.joe=x\ntest:joe=root\n", kOld + 10);
    EXPECT_EQ(map("joe", 0), "root");
    EXPECT_EQ(take_log(), (Log{"C rule:?", "C rule:**", "C rule:j*", "C rule:joe",  // old cache, in order
                               "T 39.joe", "C rule:joe", "C id:joe", "T joe", "C id:joe"}));
}

TEST_F(NatmapWalk, StopAtThirtyOneThenTheCachedRuleMatches) {
    oxtest::write_file(oxtest::kLocalMap, "test:31.joe=first\ntest:joe=second\n", kOld);
    EXPECT_EQ(map("joe", 31), "");
    EXPECT_EQ(take_log(), (Log{"T 31.joe", "C id:joe"}));
    EXPECT_TRUE(oxtest::nothing_reported()) << "the rule was valid";
    // The rule was cached valid: without the entry the translator succeeds.
    EXPECT_EQ(map("joe", 0), "first");
    EXPECT_EQ(take_log(), (Log{"T -:joe", "C id:joe"}));
    // 31 for a cached rule stops the walk too.
    EXPECT_EQ(map("#31", 31), "");
    EXPECT_EQ(take_log(), (Log{"T -:joe", "C id:#31"}));
}

TEST_F(NatmapWalk, ThirtyOneWithAnInvalidRuleReportsIt) {
    oxtest::write_file(oxtest::kLocalMap, "test:31.a*b*=x\n", kOld);
    oxtest::clear_errors();
    EXPECT_EQ(map("joe", 31), "");
    EXPECT_TRUE(reported(38, idm::kMsg662, {}));
    EXPECT_EQ(record()->rules[0].rule_state, 32u);
    EXPECT_EQ(map("joe", 0), "") << "passed over: no translator call, status 0";
    EXPECT_EQ(take_log(), (Log{"T 31.a*b*", "C id:joe"}));
}

TEST_F(NatmapWalk, CacheThatCannotGrowReleasesTheRuleAndTranslatesAgain) {
    oxtest::write_file(oxtest::kLocalMap, "test:bob=b\ntest:joe=j\n", kOld);
    g_force = 5;  // first call: the files are read, nothing is cached
    EXPECT_EQ(map("joe", 5), "");
    g_force = -1;
    g_log.clear();
    idm_test_fail_alloc(1);  // the walk's first allocation: caching bob's rule
    oxtest::clear_errors();
    EXPECT_EQ(map("joe", 0), "j");
    EXPECT_EQ(idm_test_alloc_fired(), 1);
    EXPECT_EQ(take_log(), (Log{"T bob", "C rule:bob id:joe", "T joe", "C id:joe"}));
    EXPECT_EQ(oxtest::last_error().msgno, idm::kMsg654) << "reported even though the status is 0";
    EXPECT_EQ(record()->entries[0].rule_index, 0);
    EXPECT_EQ(record()->entries[1].rule_index, 1);
    EXPECT_EQ(map("joe", 0), "j");
    EXPECT_EQ(take_log(), (Log{"T bob", "C id:joe", "T -:joe", "C id:joe"}));
}

TEST_F(NatmapWalk, ReadErrorLeavesTheRecordWithoutEntriesAndRules) {
    oxtest::write_file(oxtest::kLocalMap, "test:bob=b\ntest:joe=j\n", kOld);
    EXPECT_EQ(map("joe", 0), "j");
    g_log.clear();
    mssx_force_open(oxtest::kLocalMap, 12);
    oxtest::set_mtime(oxtest::kLocalMap, kOld + 10);
    EXPECT_EQ(map("joe", 36), "");
    EXPECT_EQ(oxtest::last_error().msgno, idm::kMsg653);
    EXPECT_EQ(take_log(), (Log{"C rule:bob", "C rule:joe"}));
    EXPECT_EQ(record()->entry_count, 0);
    EXPECT_EQ(record()->entries, nullptr);
    EXPECT_EQ(record()->rule_count, 0);
    EXPECT_EQ(record()->rules, nullptr);
    // Read again at the next request: the failure stands, never "no match".
    EXPECT_EQ(map("joe", 36), "");
    mssx_force_open(nullptr, 0);
    EXPECT_EQ(map("joe", 0), "j");
}

TEST_F(NatmapWalk, LocalEntriesComeBeforeTheGlobalFile) {
    oxtest::write_file(oxtest::kOptGlobalMap, "test:joe=from-opt\n", kOld);
    oxtest::write_file(oxtest::kLocalMap, "test:!amy\ntest:j*=from-local\n", kOld);
    EXPECT_EQ(map("joe", 0), "from-local");
    EXPECT_EQ(map("amy", 0), "");
    oxtest::write_file(oxtest::kLocalMap, "test:!amy\n", kOld + 10);
    EXPECT_EQ(map("joe", 0), "from-opt");
    oxtest::write_file(oxtest::kVarGlobalMap, "test:joe=from-var\n", kOld);
    EXPECT_EQ(map("joe", 0), "from-var");
}

TEST_F(NatmapWalk, ReplacedRoutinesInheritTheCacheAndReleaseIt) {
    oxtest::write_file(oxtest::kLocalMap, "test:bob=b\ntest:joe=j\n", kOld);
    EXPECT_EQ(map("joe", 0), "j");
    ASSERT_EQ(sec_idm_register_translator(1, "test", test_translate<'B'>, test_cleanup<'B'>), 0);
    g_log.clear();
    EXPECT_EQ(map("joe", 0), "j");
    EXPECT_EQ(take_log(), (Log{"TB -:bob", "CB id:joe", "TB -:joe", "CB id:joe"}));
    oxtest::set_mtime(oxtest::kLocalMap, kOld + 10);
    EXPECT_EQ(map("amy", 0), "");
    EXPECT_EQ(take_log(), (Log{"CB rule:bob", "CB rule:joe", "TB bob", "CB id:amy", "TB joe", "CB id:amy"}));
}

TEST_F(NatmapWalk, UnregisteredMnemonic) {
    idm_buffer local{};
    EXPECT_EQ(sec_idm_map_identity("Test", "joe", &local), 22);
    EXPECT_TRUE(reported(22, idm::kMsg660, {"Test"}));
    EXPECT_EQ(local.length, 0u);
    EXPECT_EQ(local.value, nullptr);
}

TEST_F(NatmapWalk, TracePoints) {
    oxtest::write_file(oxtest::kLocalMap, "test:joe=j\n", kOld);
    EXPECT_EQ(map("joe", 0), "j");  // read and cache first
    idm_buffer local{};
    oxtest::set_trace_levels(0, 8, 0, 0, 0);
    ASSERT_EQ(idm__native_map_identity("test", "joe", &local), 0);
    std::vector<oxtest::TraceRecord> records = oxtest::trace_records();
    ASSERT_GE(records.size(), 2u);
    EXPECT_EQ(records.front().id, 110);
    EXPECT_EQ(records.front().text(0), "test");
    EXPECT_EQ(records.front().text(1), "joe");
    EXPECT_EQ(records.front().u64(2), reinterpret_cast<uintptr_t>(&local));
    EXPECT_EQ(records.back().id, 112);
    EXPECT_EQ(records.back().i32(0), 0);
    std::free(local.value);

    oxtest::reset_trace();
    oxtest::set_trace_levels(0, 1, 0, 0, 0);
    local = idm_buffer{};
    ASSERT_EQ(idm__native_map_identity("nobody", "joe", &local), 22);
    EXPECT_EQ(oxtest::trace_ids(), (std::vector<int>{108, 111}));
}

}  // namespace
