// Allocation-failure sweeps of the mapping service: a whole mapping pass
// (the map file set made, a local and a global file read, the entry list and
// the rule cache grown past ten, the result copied) and a registration; and
// the blocks that held an identity or a path, freed zeroed.
#include <pwd.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <string>

#include "oxidm_state.h"
#include "oxidm_natfile.h"
#include "oxidm_natmap.h"
#include "test_sweep.h"

namespace {

using oxtest::heap_copy;
using oxtest::num;
using sweep::Row;
using sweep::st;

// One token, the network identifier, allocated as a real MPM does.  Notes
// the current error at every call, so a report in the middle of the walk is
// seen even when later entries report their own mismatches.
int32_t translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule, idm_id *id) {
    sweep::note();
    oxtest::fill_rule_and_id(entry, network_id, rule, id);
    return 0;
}
int32_t cleanup(idm_rule *rule, idm_id *id) {
    sweep::note();
    return oxtest::free_rule_and_id(rule, id);
}

// 13 entries, six local and seven global, so the entry list and the rule
// cache each grow twice; "joe" matches the 12th, the 13th grants "guest".
const std::vector<std::string> kLocal = {"alice=al", "!eve", "bob=bl", "carol=cl", "dave=dl", "erin=el"};
const std::vector<std::string> kGlobal = {"frank=fl", "gina=gl", "!hal", "ivan=il", "jack=jl2", "joe=jl", "*=guest"};

std::string file_for(const std::string &mech, const std::vector<std::string> &lines, const char *head) {
    std::string text = head;
    for (const std::string &l : lines) text += mech + ":" + l + "\n";
    return text;
}

std::string map(const std::string &mech, const char *who) {
    idm_buffer local{};
    const int32_t status = sec_idm_map_identity(mech.c_str(), who, &local);
    std::string answer = std::to_string(status) + " " + (local.value != nullptr ? local.value : "");
    if (local.value != nullptr) {
        EXPECT_EQ(local.length, std::strlen(local.value) + 1);
    }
    std::free(local.value);
    return answer;
}

class SweepMapping : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
    }
};

TEST_F(SweepMapping, PassOverTwoFilesWithRulesCached) {
    const std::string jl = "0 jl";
    std::vector<Row> rows = {
        {"map file set: the record, the names array, the three paths, the per-file arrays", idm::kMsg654,
         "idm__native_get_mapfile_names", idm::kNoMemory, st(idm::kNoMemory, " "), {jl},
         {std::to_string(sizeof(idm_mapfile_set)), std::to_string(3 * sizeof(char *)), "28", "29", "32",
          std::to_string(3 * sizeof(uint32_t))}},
        {"identifier copy", idm::kMsg658, "idm__read_mapfile_entries", idm::kInternal, st(idm::kInternal, " "), {jl}},
        {"entry list growth", idm::kMsg658, "idm_alloc_entries", idm::kInternal, st(idm::kNoMemory, " "), {jl}},
        {"rule cache growth", idm::kMsg654, "idm__native_cache_rule", idm::kNoMemory, jl, {jl}},
        {"local name copy: the walk goes on to \"*\"", idm::kMsg654, "idm__native_get_mapping", idm::kNoMemory,
         "0 guest", {jl}},
    };
    std::string mech;
    int64_t mtime = 100000;
    int descriptors = 0;
    sweep::Operation op{
        [&](long n) {  // a mechanism of its own per step: no set, no entries, no cache yet
            mech = num("sw", n);
            EXPECT_EQ(sec_idm_register_translator(1, mech.c_str(), translate, cleanup), 0);
            oxtest::write_file(oxtest::kLocalMap, file_for(mech, kLocal, "# local\n"), mtime += 10);
            oxtest::write_file(oxtest::kVarGlobalMap, file_for(mech, kGlobal, "other:joe=nobody\n"), mtime);
            descriptors = oxtest::open_descriptors();
        },
        [&] { return map(mech, "joe"); },
        jl,
        [&] {
            EXPECT_EQ(mssx_locks_held(), 0);
            EXPECT_EQ(oxtest::open_descriptors(), descriptors);
            EXPECT_TRUE(oxtest::unlocked(&idm__native_state.mutex));
            idm_translator *record = idm__native_find_translator(mech.c_str());
            EXPECT_TRUE(record != nullptr && oxtest::unlocked(&record->mutex));
        },
        [&] {  // a change of a file brings every entry back
            oxtest::set_mtime(oxtest::kLocalMap, mtime += 10);
            EXPECT_EQ(map(mech, "joe"), jl);
            EXPECT_EQ(map(mech, "alice"), "0 al");
            EXPECT_EQ(map(mech, "eve"), "0 ");
        },
    };
    EXPECT_GT(sweep::run(op, rows), 30);
}

// A failed registration leaves the list as it was; registering again works.
TEST_F(SweepMapping, Registration) {
    ASSERT_EQ(sec_idm_register_translator(1, "first", translate, cleanup), 0);  // once-controls outside the count
    std::string mnemonic;
    uint32_t count = 0;
    std::vector<Row> rows = {{"translator record, mnemonic copy", idm::kMsg654, "idm__native_register_translator",
                              idm::kNoMemory, st(idm::kNoMemory, " unlisted +0"), {"0 listed +1"}}};
    auto listed = [&](int32_t status) {
        idm_translator_routine t = nullptr;
        idm_cleanup_routine c = nullptr;
        EXPECT_EQ(_sec_idm_get_translator(mnemonic.c_str(), &t, &c), 0);
        return std::to_string(status) + (t == translate && c == cleanup ? " listed +" : " unlisted +") +
               std::to_string(idm__native_state.translator_count - count);
    };
    auto reg = [&] { return listed(sec_idm_register_translator(1, mnemonic.c_str(), translate, cleanup)); };
    sweep::Operation op{[&](long n) { mnemonic = num("regist", n), count = idm__native_state.translator_count; }, reg,
                        "0 listed +1", [] { EXPECT_TRUE(oxtest::unlocked(&idm__native_state.mutex)); },
                        [&] {  // registering again replaces the routines of the one record; the list still works
                            EXPECT_EQ(reg(), "0 listed +1");
                            EXPECT_EQ(map("first", "joe"), "0 ");
                        }};
    EXPECT_EQ(sweep::run(op, rows), 2);
}

// Every block that held an identity or a path goes through the zeroing free
// (whose hook sees it) and is all zero there.
using Blocks = std::vector<std::pair<const void *, size_t>>;
Blocks g_routed;
void on_secret_free(const void *p, size_t n) {
    sweep::check_zeroed(p, n);
    g_routed.emplace_back(p, n);
}
// Each block of `wanted` was routed once, and `others` more blocks besides.
void expect_routed(const Blocks &wanted, size_t others = 0) {
    for (const auto &block : wanted) EXPECT_EQ(std::count(g_routed.begin(), g_routed.end(), block), 1);
    EXPECT_EQ(g_routed.size(), wanted.size() + others);
    EXPECT_EQ(sweep::g_unzeroed.exchange(0), 0) << "a block freed unzeroed";
    g_routed.clear();
}

using Zeroed = SweepMapping;
TEST_F(Zeroed, IdentifiersPathsResultsAndGroupBuffers) {
    ASSERT_EQ(sec_idm_register_translator(1, "zr", translate, cleanup), 0);
    oxtest::write_file(oxtest::kLocalMap, file_for("zr", kLocal, "zr:  bo  =  bl2 more\nzr: ! bo\n"), 1000);
    idm_test_on_secret_free(on_secret_free);
    idm_buffer first{}, again{};
    ASSERT_EQ(sec_idm_map_identity("zr", "alice", &first), 0);
    const idm_translator *record = idm__native_find_translator("zr");
    Blocks texts;
    for (int32_t i = 0; i < record->entry_count; ++i)
        for (const char *t : {record->entries[i].network_id, record->entries[i].local_id})
            if (t != nullptr) texts.emplace_back(t, std::strlen(t) + 1);
    ASSERT_EQ(texts.size(), 14u);
    expect_routed({});
    // The file changes: the next mapping releases every old identifier.
    oxtest::set_mtime(oxtest::kLocalMap, 2000);
    ASSERT_EQ(sec_idm_map_identity("zr", "alice", &again), 0);
    expect_routed(texts);
    texts = {{first.value, 3}, {again.value, 3}};  // results, released as the library releases a buffer
    idm__release_buffer(&first);
    idm__release_buffer(&again);
    expect_routed(texts);
    // A map file set: three paths, the names array and three per-file arrays.
    idm_mapfile_set *set = nullptr;
    ASSERT_EQ(idm__native_get_mapfile_names(&set), 0);
    texts.clear();
    for (int32_t i = 0; i < set->count; ++i) texts.emplace_back(set->names[i], std::strlen(set->names[i]) + 1);
    idm__native_release_cachef(set);
    expect_routed(texts, 4);
    // A group lookup: one work area serves the user's, the primary group's
    // and the scan's lookups, zeroed once over the largest of their sizes.
    const passwd *root = getpwuid(0);
    if (root == nullptr) GTEST_SKIP() << "no user 0";
    const std::string name = root->pw_name;
    idm_buffer user{static_cast<uint32_t>(name.size() + 1), const_cast<char *>(name.c_str())};
    uint32_t count = 0;
    idm_buffer *groups = nullptr;
    ASSERT_EQ(sec_idm_get_groups(&user, &count, &groups), 0);
    idm_test_on_secret_free(nullptr);
    for (uint32_t i = 0; i < count; ++i) std::free(groups[i].value);
    std::free(groups);
    const long largest = std::max(2 * sysconf(_SC_GETPW_R_SIZE_MAX), sysconf(_SC_GETGR_R_SIZE_MAX));
    expect_routed({{g_routed.empty() ? nullptr : g_routed[0].first, static_cast<size_t>(largest)}});
}

}  // namespace
